#include "krutil/commands/Repl.hpp"

#include <algorithm>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "krutil/commands/EvalCommand.hpp"
#include "krutil/terminal/Asides.hpp"
#include "krutil/terminal/EngineHelp.hpp"
#include "krutil/terminal/PromptCommands.hpp"
#include "krutil/terminal/PythonInput.hpp"
#include "krutil/terminal/QueueCommand.hpp"

namespace krutil_client {
namespace {

// Values of more elements a level are cut where a person reads them.
constexpr int shownElements = 1000;

constexpr const char* helpText = R"(Python code is evaluated on the engine. A block ends with an empty line.
  :timing on|off      say how long each request took
  :debugger on|off    whether breakpoint() stops here
  :queue              list what runs and what waits, and what each end can do
  :queue cancel N     cancel the request with this number in the list
  :full               show the last value whole
  :restart            end the session, and start a new one without its names
  ?NAME, NAME?        tell about a name
  :help               this text
  :quit               leave, as Ctrl-D does
Ctrl-C drops what has been typed, or cancels what runs; a second one within two
seconds ends the engine. Tab completes, and lists when it is pressed again. Up
and Down move in a block and through the history, Ctrl-P and Ctrl-N only through
the history, Ctrl-R searches it. A value of more than 1,000 elements is cut.
At debug> and keyboard>, :c goes on and :q (or Ctrl-D) quits; :help there tells
the rest. Lines that are pasted there are sent at once; what :c leaves behind of
them runs at the next prompt or when the code has ended.
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

enum class Next { Stay, Leave, Restart };

Next obey(Client& client, const std::string& command, Output& out) {
    if (command == ":quit" || command == ":q") {
        return Next::Leave;
    }
    if (command == ":restart") {
        return Next::Restart;
    }
    if (command == ":timing on" || command == ":timing off") {
        client.setTiming(command == ":timing on");
    } else if (command == ":debugger on" || command == ":debugger off") {
        client.setDebugging(command == ":debugger on");
    } else if (command == ":timing" || command == ":debugger") {
        out.write("Write '" + command + " on' or '" + command + " off'.\n");
    } else if (command == ":help") {
        out.write(helpText);
    } else if (!obeyQueueCommand(client, command, out)) {
        out.write("There is no command '" + command + "'; :help lists them.\n");
    }
    return Next::Stay;
}

// One line: what is at the other end, and where help is.
void greet(Client& client, EngineHelp& help, Output& out) {
    const std::string build = client.conversation().session().peer().build;
    const std::string version = help.pythonVersion();
    out.write(build.substr(0, build.find(" (")) + (version.empty() ? "" : ", Python " + version) +
              "; :help tells what to type, Ctrl-D leaves\n");
}

}  // namespace

ReplEnd readAndEvaluate(Client& client, const ReplOptions& options, const Prompts::Read& read, Person person,
                        Output& out, Interrupt& interrupt) {
    ReplEnd end;
    EngineHelp help(client);
    const auto inspect = [&help](const std::string& name) { return help.inspect(name); };
    try {
        if (person == Person::Edits) {
            help.shorten(shownElements);
            greet(client, help, out);
        }
        for (;;) {
            const ReadLine code = readCode(read, interrupt, person != Person::None);
            if (code.end == ReadLine::End::EndOfInput) {
                break;
            }
            const std::string line = code.text.substr(0, code.text.find_last_not_of(" \t\n") + 1);
            if (line.empty() || answerAside(line, inspect, out)) {
                continue;
            }
            const auto known = promptCommand(line, false);
            const bool full = known && !known->leaves;
            if (line[0] == ':' && !full) {
                const Next next = obey(client, line, out);
                if (next == Next::Stay) {
                    continue;
                }
                if (next == Next::Restart) {
                    // Nobody waits for what they would still do.
                    const auto left = client.requests().unanswered();
                    std::for_each(left.rbegin(), left.rend(), [&client](const auto& each) { client.cancel(each); });
                    end.restart = true;
                }
                break;
            }
            EvalOptions eval;
            eval.source = full ? known->code : code.text;
            eval.sink = options.sink;
            end.code = evaluate(client, eval, eval.source);
        }
    } catch (const SessionOver& over) {
        // The code has ended the engine with SystemExit, or nothing is left to ask.
        if (over.end().reason != Conversation::SessionEnd::Reason::Finished) {
            client.lost(over, "while it was idle");
        }
        return end;
    }
    if (person != Person::None) {
        end.code = ExitCode::Ok;
    }
    return end;
}

}  // namespace krutil_client
