// `krutil eval`.
#pragma once

#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// Reads the code text: valid UTF-8, whatever its length, like its arguments. Throws Failure.
std::string readCode(const EvalOptions& options);

/// Has `code` evaluated, with sys.argv as Python itself sets it if there are arguments, and shows what comes of it. The
/// engine learns the absolute path of a file, so that tracebacks name it.
ExitCode evaluate(Client& client, const EvalOptions& options, const std::string& code);

}  // namespace krutil_client
