// `krutil eval`.
#pragma once

#include "Client.hpp"
#include "CommandLine.hpp"

namespace client {

/// Reads the code text: valid UTF-8, whatever its length. Throws Failure.
std::string readCode(const EvalOptions& options);

/// Has `code` evaluated and shows what comes of it.
ExitCode evaluate(Client& client, const EvalOptions& options, const std::string& code);

}  // namespace client
