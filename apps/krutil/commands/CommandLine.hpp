// The command line, read into options.
#pragma once

#include <string>
#include <variant>

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Options.hpp"

namespace krutil_client {

/// What is left to do when the command line was an error or asked for help only.
struct Finished {
    ExitCode code;
    std::string out;  ///< for standard output
    std::string err;  ///< for standard error
};

/// Reads the command line. Nothing is printed and no file is read.
std::variant<Options, Finished> parseCommandLine(int argc, const char* const* argv);

}  // namespace krutil_client
