#include "krutil/commands/Repl.hpp"

#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "krutil/commands/EvalCommand.hpp"
#include "krutil/terminal/PythonInput.hpp"
#include "krutil/terminal/QueueCommand.hpp"

namespace krutil_client {
namespace {

constexpr const char* helpText = R"(Python code is evaluated on the engine. A block ends with an empty line.
  :timing on|off      say how long each request took
  :debugger on|off    whether breakpoint() stops here
  :queue              list what runs and what waits on the engine, and what each end can do
  :queue cancel N     cancel the request with this number in the list
  :help               this text
  :quit               leave, as Ctrl-D does
Ctrl-C drops what has been typed, or cancels what runs; a second one within two seconds ends the engine.
At debug> and keyboard>, :c goes on and :q (or Ctrl-D) quits. Lines that are pasted there are sent at once; what :c
leaves behind of them runs at the next prompt or when the code has ended.
)";

// Ctrl-C drops a line, as long as this lives.
class Dropping {
  public:
    explicit Dropping(Interrupt& interrupt)
        : interrupt_(interrupt), before_(interrupt.setAction([] { throw LineDropped(); })) {}
    ~Dropping() { interrupt_.setAction(std::move(before_)); }
    Dropping(const Dropping&) = delete;
    Dropping& operator=(const Dropping&) = delete;

  private:
    Interrupt& interrupt_;
    std::function<void()> before_;
};

bool never() {
    return false;
}

// The next piece of code, or a line that begins with a colon; Done when it was dropped.
ReadLine readCode(const Prompts::Read& read, Interrupt& interrupt, bool terminal) {
    std::optional<Dropping> dropping;
    if (terminal) {
        dropping.emplace(interrupt);
    }
    try {
        ReadLine code = read(">>> ", never);
        while (code.end == ReadLine::End::Newline && !isWhole(code.text)) {
            const ReadLine line = read("... ", never);
            if (line.end != ReadLine::End::Newline) {
                break;
            }
            code.text += "\n" + line.text;
        }
        return code;
    } catch (const LineDropped&) {
        return {ReadLine::End::Done, {}};
    }
}

// Returns whether to stay.
bool obey(Client& client, const std::string& line, Output& out) {
    const std::string command = line.substr(0, line.find_last_not_of(" \t") + 1);
    if (command == ":quit" || command == ":q") {
        return false;
    }
    if (command == ":timing on" || command == ":timing off") {
        client.setTiming(command == ":timing on");
    } else if (command == ":debugger on" || command == ":debugger off") {
        client.setDebugging(command == ":debugger on");
    } else if (command == ":help") {
        out.write(helpText);
    } else if (!obeyQueueCommand(client, command, out)) {
        out.write("There is no command '" + command + "'; :help lists them.\n");
    }
    return true;
}

}  // namespace

ExitCode readAndEvaluate(Client& client, const ReplOptions& options, const Prompts::Read& read, bool terminal,
                         Output& out, Interrupt& interrupt) {
    ExitCode last = ExitCode::Ok;
    try {
        for (;;) {
            const ReadLine code = readCode(read, interrupt, terminal);
            if (code.end == ReadLine::End::EndOfInput) {
                break;
            }
            // A line that was dropped is empty.
            if (code.text[0] == ':') {
                if (!obey(client, code.text, out)) {
                    break;
                }
            } else if (code.text.find_first_not_of(" \t\n") != std::string::npos) {
                EvalOptions eval;
                eval.source = code.text;
                eval.sink = options.sink;
                last = evaluate(client, eval, code.text);
            }
        }
    } catch (const SessionOver& over) {
        // The code has ended the engine with SystemExit, or nothing is left to ask.
        if (over.end().reason != Conversation::SessionEnd::Reason::Finished) {
            client.lost(over, "while it was idle");
        }
        return last;
    }
    return terminal ? ExitCode::Ok : last;
}

}  // namespace krutil_client
