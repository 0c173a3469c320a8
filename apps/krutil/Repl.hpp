// `krutil repl`.
#pragma once

#include "Client.hpp"
#include "CommandLine.hpp"
#include "Interrupt.hpp"
#include "Output.hpp"
#include "Prompts.hpp"

namespace client {

/// Reads code line by line and has it evaluated, until the input or the session ends. Lines that begin with a colon are
/// commands to the program itself. Ctrl-C drops what a person at a terminal (`terminal`) has typed. Returns how the
/// last request ended; Ok where a person leaves. Throws what Client::request() throws.
ExitCode readAndEvaluate(Client& client, const ReplOptions& options, const Prompts::Read& read, bool terminal,
                         Output& out, Interrupt& interrupt);

}  // namespace client
