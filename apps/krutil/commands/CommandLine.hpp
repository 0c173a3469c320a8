// The command line, read into options.
#pragma once

#include <functional>
#include <string>
#include <variant>

#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Options.hpp"

namespace CLI {
class App;
}

namespace krutil_client {

/// What is left to do when the command line was an error or asked for help only.
struct Finished {
    ExitCode code;
    std::string out;  ///< for standard output
    std::string err;  ///< for standard error
};

/// Reads the command line. Nothing is printed and no file is read.
std::variant<Options, Finished> parseCommandLine(int argc, const char* const* argv);

/// Shows `describe` the commands and options that parseCommandLine() knows, for manual pages and completion. They exist
/// until it returns.
void describeCommandLine(const std::function<void(const CLI::App&)>& describe);

}  // namespace krutil_client
