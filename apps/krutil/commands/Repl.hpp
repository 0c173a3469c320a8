// `krutil repl`.
#pragma once

#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/Prompts.hpp"

namespace krutil_client {

/// Reads code line by line and has it evaluated, until the input or the session ends. Lines that begin with a colon are
/// commands to the program itself. Ctrl-C drops what a person at a terminal (`terminal`) has typed. Returns how the
/// last request ended; Ok where a person leaves. Throws what Client::request() throws.
ExitCode readAndEvaluate(Client& client, const ReplOptions& options, const Prompts::Read& read, bool terminal,
                         Output& out, Interrupt& interrupt);

}  // namespace krutil_client
