// `krutil eval`.
#pragma once

#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// Reads the code text: valid UTF-8, whatever its length. Throws Failure.
std::string readCode(const EvalOptions& options);

/// Has `code` evaluated and shows what comes of it.
ExitCode evaluate(Client& client, const EvalOptions& options, const std::string& code);

}  // namespace krutil_client
