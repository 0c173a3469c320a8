// `krutil run`.
#pragma once

#include <string>

#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// Reads the script's text: valid UTF-8, like its arguments. Throws Failure.
std::string readScript(const RunOptions& options);

/// Has the script run, with sys.argv as a script that Python itself runs has it, and shows what comes of it.
ExitCode runScript(Client& client, const RunOptions& options, const std::string& text);

}  // namespace krutil_client
