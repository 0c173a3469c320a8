#include "krutil/Program.hpp"

#include <fcntl.h>
#include <termios.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "KrutilProtocol.hpp"
#include "common/ProtobufLog.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/LastLine.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/commands/CallCommand.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "krutil/commands/EvalCommand.hpp"
#include "krutil/commands/Repl.hpp"
#include "krutil/commands/ReplayCommand.hpp"
#include "krutil/display/JsonPrinter.hpp"
#include "krutil/display/PersonPrinter.hpp"
#include "krutil/inspect/InspectCommand.hpp"
#include "krutil/inspect/RedactedCopy.hpp"
#include "krutil/session/Client.hpp"
#include "krutil/terminal/EngineHelp.hpp"
#include "krutil/terminal/LineEditor.hpp"
#include "krutil/terminal/LineHistory.hpp"
#include "krutil/terminal/LineReader.hpp"
#include "krutil/terminal/PictureViewer.hpp"
#include "krutil/terminal/Prompts.hpp"

namespace krutil_client {
namespace {

// Descriptors 0 to 2 that the program was started without are taken, so that nothing else is ever mistaken for them.
// Their direction is the wrong one: using them remains an error.
void fillStandardDescriptors() {
    for (const int fd : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        if (::fcntl(fd, F_GETFD) < 0) {
            ::open("/dev/null", fd == STDIN_FILENO ? O_WRONLY : O_RDONLY);
        }
    }
}

bool wantsColor(Color color, const Output& output) {
    if (color != Color::Auto) {
        return color == Color::Always;
    }
    const auto variable = [](const char* name) {
        const char* const value = std::getenv(name);
        return std::string_view(value != nullptr ? value : "");
    };
    return output.isTerminal() && variable("NO_COLOR").empty() && variable("TERM") != "dumb";
}

// What connects the program to whoever started it.
struct Terminal {
    Interrupt interrupt{};
    LastLine lastLine{};
    Output out{STDOUT_FILENO, "standard output", interrupt, &lastLine};
    Output err{STDERR_FILENO, "standard error", interrupt, &lastLine};
    bool edits = false;                          ///< a session has begun whose lines are edited
    std::optional<LineEditor> editor{};          ///< outlives a session, and with it what it remembers
    std::optional<apps::Recording> recording{};  ///< of all sessions
    std::optional<Tracer> tracer{};              ///< of all sessions
    bool engineFilesComplete = true;             ///< those that the engines of all sessions have written
};

std::unique_ptr<Printer> makePrinter(const DisplayOptions& options, Output& out, Output& err) {
    if (options.json) {
        return std::make_unique<JsonPrinter>(out);
    }
    return std::make_unique<PersonPrinter>(
        out, err, PersonStyle{options.warningStack, wantsColor(options.color, err), options.safeText});
}

// A client that asks the person at standard input, if there is one, what the engine wants to know.
class AskingClient {
  public:
    /// On a terminal, lines are edited; code among them is remembered in the file `history`, if it has a name.
    AskingClient(const Options& options, Printer& printer, Terminal& terminal, bool interactive,
                 std::string history = {})
        : client_(options.connection, options.display, printer, terminal.out, terminal.err, terminal.interrupt,
                  interactive,
                  {terminal.recording ? &*terminal.recording : nullptr, terminal.tracer ? &*terminal.tracer : nullptr}),
          help_(client_),
          terminal_(terminal),
          history_(std::move(history)),
          color_(wantsColor(options.display.color, terminal.out)),
          edits_(interactive && terminal.out.hasCursor() && !options.display.json),
          reader_(STDIN_FILENO, client_.conversation(),
                  options.display.json || !terminal.out.isTerminal() ? terminal.err : terminal.out),
          pictures_(client_, printer, terminal.out,
                    options.display.json ? PictureViewer::Way::AllToFiles
                    : edits_             ? PictureViewer::Way::Drawn
                                         : PictureViewer::Way::BestToFile,
                    [this](const std::string& text) { typed_ += text; }),
          prompts_(std::in_place, client_, reading(LineEditor::For::Input), reading(LineEditor::For::Code),
                   options.display.json ? terminal.err : terminal.out) {}

    Client& client() noexcept { return client_; }

    /// Whether lines are edited.
    bool edits() const noexcept { return edits_; }

    /// How code is read. The object must outlive what is returned.
    Prompts::Read readingCode() {
        return [this](const std::string& prompt, const std::function<bool()>& done) {
            return prompts_->readCode(prompt, done);
        };
    }

    /// Ends the session as Client::finish() does. Who leaves at once is asked nothing more.
    void finish(Leave leave) {
        if (leave == Leave::AtOnce) {
            prompts_.reset();
        }
        if (const std::string note = client_.finish(leave); !note.empty()) {
            std::cerr << "krutil: " << note << std::endl;
        }
        terminal_.engineFilesComplete = terminal_.engineFilesComplete && client_.engineFilesComplete();
    }

  private:
    Prompts::Read reading(LineEditor::For what) {
        return [this, what](const std::string& prompt, const std::function<bool()>& done) {
            if (!edits_) {
                return reader_.read(prompt, done);
            }
            // Most commands end without a question.
            if (!terminal_.editor) {
                terminal_.editor.emplace(terminal_.out, terminal_.lastLine, history_, color_);
                if (const std::string& refusal = terminal_.editor->historyRefusal(); !refusal.empty()) {
                    terminal_.err.write("krutil: " + refusal + "\n");
                }
            }
            terminal_.editor->type(std::exchange(typed_, {}));
            return terminal_.editor->read(client_.conversation(), complete_, what, prompt, done);
        };
    }

    Client client_;
    EngineHelp help_;
    const Complete complete_ = [this](const std::wstring& text, std::size_t cursor) {
        return help_.complete(text, cursor);
    };
    Terminal& terminal_;
    const std::string history_;
    const bool color_;
    const bool edits_;
    LineReader reader_;
    PictureViewer pictures_;
    std::string typed_;  ///< by a person, while nobody read
    std::optional<Prompts> prompts_;
};

bool standardInputIsTerminal() {
    return ::isatty(STDIN_FILENO) == 1;
}

// Does a command's work in the session, and ends that in good order. Returns what the work does.
template <class Work>
auto inSession(AskingClient& asking, const Work& work) {
    std::optional<decltype(work())> result;
    try {
        result = work();
    } catch (const Failure& failure) {
        // What this end cannot send or store is no fault of the session.
        if (failure.code() == ExitCode::Usage) {
            asking.finish(Leave::AtOnce);
        }
        throw;
    } catch (const Cancelled&) {
        asking.finish(Leave::AtOnce);
        throw;
    }
    asking.finish(Leave::WhenAnswered);
    return *result;
}

ExitCode runCommand(const Options& options, const EvalOptions& eval, Printer& printer, Terminal& terminal) {
    const std::string code = readCode(eval);
    AskingClient asking(options, printer, terminal, !eval.fromStandardInput && standardInputIsTerminal());
    return inSession(asking, [&] { return evaluate(asking.client(), eval, code); });
}

// One session of the line editor, or of lines that come from elsewhere.
ReplEnd runSession(const Options& options, const ReplOptions& repl, Printer& printer, Terminal& terminal) {
    const bool person = standardInputIsTerminal();
    AskingClient asking(options, printer, terminal, person, repl.noHistory ? std::string() : defaultHistoryFile());
    terminal.edits = asking.edits();
    const Person who = !person ? Person::None : asking.edits() ? Person::Edits : Person::Types;
    return inSession(asking, [&] {
        return readAndEvaluate(asking.client(), repl, asking.readingCode(), who,
                               options.display.json ? terminal.err : terminal.out, terminal.interrupt);
    });
}

// Returns whether a person wants another session in the place of one that is lost.
bool wantsAnother(Terminal& terminal) {
    // What was typed for the session that is lost is no answer.
    ::tcflush(STDIN_FILENO, TCIFLUSH);
    terminal.err.write("krutil: what the session held is lost; Enter starts a new one, Ctrl-D leaves ");
    std::array<char, 256> answer{};
    ssize_t got = -1;
    try {
        while (got < 0) {
            terminal.interrupt.waitForInput(STDIN_FILENO);
            got = ::read(STDIN_FILENO, answer.data(), answer.size());
            if (got < 0 && errno != EINTR) {
                got = 0;
            }
        }
    } catch (const Cancelled&) {
        got = 0;
    }
    if (got > 0) {
        // The terminal has shown the newline by itself.
        terminal.lastLine.take();
        return true;
    }
    terminal.err.write("\n");
    return false;
}

ExitCode runCommand(const Options& options, const ReplOptions& repl, Printer& printer, Terminal& terminal) {
    for (;;) {
        try {
            const ReplEnd end = runSession(options, repl, printer, terminal);
            if (!end.restart) {
                return end.code;
            }
            terminal.err.write("krutil: a new session; what the last one held is gone\n");
        } catch (const Failure& failure) {
            // An engine that cannot be used at all is no session that was lost. The question is for who sees it.
            const bool lost = failure.code() == ExitCode::Stream || failure.code() == ExitCode::Cancelled;
            if (!terminal.edits || !terminal.err.isTerminal() || !lost) {
                throw;
            }
            terminal.err.write(std::string("krutil: ") + failure.what() + "\n");
            if (!wantsAnother(terminal)) {
                return failure.code();
            }
        }
    }
}

ExitCode runCommand(const Options& options, const CallOptions& call, Printer& printer, Terminal& terminal) {
    PreparedCall prepared = prepareCall(call);
    AskingClient asking(options, printer, terminal, standardInputIsTerminal());
    return inSession(asking,
                     [&] { return callFunction(asking.client(), call, std::move(prepared), printer, terminal.err); });
}

ExitCode runCommand(const Options& options, const ReplayOptions& replay, Printer&, Terminal& terminal) {
    if (replay.serve) {
        return serveRecording(options.connection, replay, terminal.err, terminal.interrupt);
    }
    return replayRecording(options.connection, replay, terminal.out, terminal.interrupt);
}

ExitCode runCommand(const Options&, const InspectOptions& inspect, Printer&, Terminal& terminal) {
    if (!inspect.redacted.empty()) {
        if (const auto note = redactRecording(inspect.file, inspect.redacted, terminal.interrupt)) {
            terminal.err.write("krutil: " + *note + "\n");
        }
        return ExitCode::Ok;
    }
    return inspectRecording(inspect, terminal.out, terminal.err, terminal.interrupt);
}

void startRecording(const apps::RecordOptions& options, Terminal& terminal) {
    if (options.file.empty()) {
        return;
    }
    try {
        terminal.recording.emplace(options, [](const std::string& sentence) {
            std::cerr << "krutil: " + sentence + "\n" << std::flush;
        });
    } catch (const std::runtime_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
}

ExitCode runReporting(const Options& options) {
    Terminal terminal;
    const auto printer = makePrinter(options.display, terminal.out, terminal.err);
    const auto report = [&](ExitCode code, const std::string& sentence) {
        std::cerr << "krutil: " << sentence << std::endl;
        try {
            printer->failed(static_cast<int>(code), sentence);
        } catch (const std::exception&) {
            // What the program ends for is said already, and counts.
        }
        return code;
    };
    try {
        startRecording(options.display.record, terminal);
        if (options.display.trace || options.display.traceFile) {
            terminal.tracer.emplace(options.display.trace, options.display.traceFile);
        }
        const ExitCode code = std::visit(
            [&](const auto& command) { return runCommand(options, command, *printer, terminal); }, options.command);
        if (code != ExitCode::Ok) {
            return code;
        }
        const bool recorded = (!terminal.recording || terminal.recording->isComplete()) &&
                              (!terminal.tracer || terminal.tracer->isComplete());
        return !recorded ? ExitCode::Usage : !terminal.engineFilesComplete ? ExitCode::Stream : ExitCode::Ok;
    } catch (const Failure& failure) {
        return report(failure.code(), failure.what());
    } catch (const Cancelled& cancelled) {
        return report(ExitCode::Cancelled, cancelled.what());
    }
}

}  // namespace

int runProgram(int argc, const char* const* argv) {
    fillStandardDescriptors();
    const auto parsed = parseCommandLine(argc, argv);
    if (const auto* finished = std::get_if<Finished>(&parsed)) {
        std::cout << finished->out << std::flush;
        std::cerr << finished->err << std::flush;
        return static_cast<int>(finished->code);
    }
    // A reader that has gone is an error of a write, so that the engine is ended in good order first.
    std::signal(SIGPIPE, SIG_IGN);
    // A file that must not grow any more is one, too.
    std::signal(SIGXFSZ, SIG_IGN);
    // Whoever ignores this one has the program begin so, and it would not see how its engine ends.
    std::signal(SIGCHLD, SIG_DFL);
    apps::installProtobufLog();
    if (std::get<Options>(parsed).connection.noZeroCopy) {
        // Before the first serializer asks; an engine that is started here inherits it.
        ::setenv("QX_DISABLE_ZEROCOPY", "1", 1);
    }
    if (std::holds_alternative<InspectOptions>(std::get<Options>(parsed).command)) {
        // Recorded arrays are read in both forms, whatever sessions of this process were to do.
        ::unsetenv("QX_DISABLE_ZEROCOPY");
    }
    try {
        krutil::protobuf::KrutilProtocol::init();
        return static_cast<int>(runReporting(std::get<Options>(parsed)));
    } catch (const OutputClosed&) {
        std::signal(SIGPIPE, SIG_DFL);
        std::raise(SIGPIPE);
    } catch (const std::exception& error) {
        std::cerr << "krutil: " << error.what() << std::endl;
    }
    return static_cast<int>(ExitCode::Stream);
}

}  // namespace krutil_client
