// `krutil run`.
#pragma once

#include <string>

#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// Reads the program's text: valid UTF-8, like its arguments. Throws Failure.
std::string readProgram(const RunOptions& options);

/// Has the program run, with sys.argv as a program that Python itself runs has it, and shows what comes of it.
ExitCode runProgramText(Client& client, const RunOptions& options, const std::string& text);

}  // namespace krutil_client
