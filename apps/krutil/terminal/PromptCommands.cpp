#include "krutil/terminal/PromptCommands.hpp"

#include <algorithm>
#include <array>
#include <cctype>
#include <string_view>

namespace krutil_client {
namespace {

struct CommandRow {
    std::string_view word;
    std::string_view function;  ///< of the engine's module
    bool leaves;
    bool debugger;  ///< for the debugger only
    std::string_view help;
};

constexpr std::array<CommandRow, 9> commandRows{{
    {":c", "dbcont", true, false, "go on"},
    {":q", "dbquit", true, false, "quit: end the code here, as Ctrl-D does"},
    {":full", "full", false, false, "show the last value whole"},
    {"n", "next", true, true, "run this line, over its calls"},
    {"s", "step", true, true, "run to the next line, into calls"},
    {"u", "up", false, true, "look at the caller's frame"},
    {"d", "down", false, true, "look back at the frame that was called"},
    {"l", "list", false, true, "list the code around the line"},
    {"w", "where", false, true, "show the stack"},
}};

bool begins(std::string_view text, std::string_view word) {
    return text.starts_with(word) && (text.size() == word.size() || text[word.size()] == ' ');
}

// What stands behind "p ", if that is no code of its own, such as "p - 1" or "p in x".
std::string_view shownByPrint(std::string_view line) {
    constexpr std::array<std::string_view, 7> operators{"if", "in", "is", "and", "or", "not", "for"};
    if (!line.starts_with("p ")) {
        return {};
    }
    line.remove_prefix(std::min(line.find_first_not_of(' ', 1), line.size()));
    const auto first = static_cast<unsigned char>(line.empty() ? ' ' : line[0]);
    const bool operand = std::isalnum(first) != 0 || first == '_' || first == '"' || first == '\'' || first >= 0x80U;
    const bool isOperator =
        std::any_of(operators.begin(), operators.end(), [line](std::string_view word) { return begins(line, word); });
    return operand && !isOperator ? line : std::string_view();
}

}  // namespace

std::optional<PromptCommand> promptCommand(const std::string& line, bool debugger) {
    const auto row = std::find_if(commandRows.begin(), commandRows.end(), [&](const CommandRow& each) {
        return each.word == line && (debugger || !each.debugger);
    });
    if (row != commandRows.end()) {
        // Whatever the code has bound the module's name to.
        return PromptCommand{"__import__('qvm')." + std::string(row->function) + "()", row->leaves};
    }
    if (const std::string_view shown = debugger ? shownByPrint(line) : std::string_view(); !shown.empty()) {
        return PromptCommand{std::string(shown), false};
    }
    return std::nullopt;
}

std::string promptHelp(bool debugger) {
    constexpr std::size_t width = 18;
    std::string text = "Code is evaluated where the program stands.\n";
    const auto add = [&text](std::string word, std::string_view help) {
        word.resize(width, ' ');
        text += "  " + word + std::string(help) + "\n";
    };
    for (const CommandRow& row : commandRows) {
        if (debugger || !row.debugger) {
            add(std::string(row.word), row.help);
        }
    }
    if (debugger) {
        add("p NAME", "show a variable, also one with the name of a command");
    }
    add(":queue", "list what runs and what waits on the engine");
    add(":queue cancel N", "cancel the request with this number in the list");
    add("?NAME", "tell about a name");
    return text;
}

}  // namespace krutil_client
