// `krutil repl`.
#pragma once

#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/Prompts.hpp"

namespace krutil_client {

/// Who types the lines.
enum class Person {
    None,   ///< nobody: they come from a file or a program
    Types,  ///< a person at a terminal that shows them as they are typed
    Edits,  ///< a person in the line editor
};

/// How the reading ended.
struct ReplEnd {
    ExitCode code = ExitCode::Ok;  ///< of the last request; Ok where a person leaves
    bool restart = false;          ///< the person wants a new session
};

/// Reads code line by line and has it evaluated, until the input or the session ends. Lines that begin with a colon are
/// commands to the program itself. Ctrl-C drops what a person has typed. In the line editor it begins with a line about
/// the engine, and long values are cut. Throws what Client::request() throws.
ReplEnd readAndEvaluate(Client& client, const ReplOptions& options, const Prompts::Read& read, Person person,
                        Output& out, Interrupt& interrupt);

}  // namespace krutil_client
