// What a person types at the prompts of code that stands still, besides code.
#pragma once

#include <optional>
#include <string>

namespace krutil_client {

/// Code that does what a command says.
struct PromptCommand {
    std::string code;  ///< UTF-8
    bool leaves;       ///< the prompt closes after it
};

/// The command that `line` is. A line that is exactly a command's word is the command, also where a variable has that
/// name: "p NAME" shows that. The words that step through code are for the debugger (`debugger`) only; those that begin
/// with a colon are for keyboard prompts too. Nothing for any other line.
std::optional<PromptCommand> promptCommand(const std::string& line, bool debugger);

/// The commands, for a person.
std::string promptHelp(bool debugger);

}  // namespace krutil_client
