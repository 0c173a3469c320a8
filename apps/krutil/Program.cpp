#include "Program.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <iostream>
#include <memory>
#include <optional>
#include <string_view>

#include "CallCommand.hpp"
#include "Client.hpp"
#include "CommandLine.hpp"
#include "EvalCommand.hpp"
#include "Interrupt.hpp"
#include "JsonPrinter.hpp"
#include "KrutilProtocol.hpp"
#include "LineEditor.hpp"
#include "Output.hpp"
#include "PersonPrinter.hpp"
#include "Prompts.hpp"
#include "Repl.hpp"
#include "RunCommand.hpp"
#include "common/ProtobufLog.hpp"

namespace client {
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

std::unique_ptr<Printer> makePrinter(const DisplayOptions& options, Output& out, Output& err) {
    if (options.json) {
        return std::make_unique<JsonPrinter>(out);
    }
    return std::make_unique<PersonPrinter>(out, err, PersonStyle{options.warningStack, wantsColor(options.color, err)});
}

void finish(Client& client) {
    if (const std::string note = client.finish(); !note.empty()) {
        std::cerr << "krutil: " << note << std::endl;
    }
}

// A client that asks the person at standard input, if there is one, what the engine wants to know.
class AskingClient {
  public:
    /// With `history`, a file's name that may be empty, code at prompts is edited on a terminal.
    AskingClient(const Options& options, Printer& printer, Output& out, Output& err, Interrupt& interrupt,
                 bool interactive, const std::optional<std::string>& history = std::nullopt)
        : client_(options.connection, options.display, printer, out, err, interrupt, interactive),
          reader_(STDIN_FILENO, client_.conversation(), options.display.json || !out.isTerminal() ? err : out),
          editor_(history && interactive && out.isTerminal() && !options.display.json
                      ? std::make_unique<LineEditor>(client_.conversation(), *history)
                      : nullptr),
          prompts_(
              client_, [this](const auto& prompt, const auto& done) { return reader_.read(prompt, done); }, read()) {}

    Client& client() noexcept { return client_; }

    /// How code is read. The object must outlive what is returned.
    Prompts::Read read() {
        return [this](const std::string& prompt, const std::function<bool()>& done) {
            return editor_ ? editor_->read(prompt, done) : reader_.read(prompt, done);
        };
    }

  private:
    Client client_;
    LineReader reader_;
    std::unique_ptr<LineEditor> editor_;
    Prompts prompts_;
};

bool standardInputIsTerminal() {
    return ::isatty(STDIN_FILENO) == 1;
}

ExitCode runCommand(const Options& options, const EvalOptions& eval, Printer& printer, Output& out, Output& err,
                    Interrupt& interrupt) {
    const std::string code = readCode(eval);
    AskingClient asking(options, printer, out, err, interrupt, !eval.fromStandardInput && standardInputIsTerminal());
    const ExitCode result = evaluate(asking.client(), eval, code);
    finish(asking.client());
    return result;
}

ExitCode runCommand(const Options& options, const ReplOptions& repl, Printer& printer, Output& out, Output& err,
                    Interrupt& interrupt) {
    const bool terminal = standardInputIsTerminal();
    AskingClient asking(options, printer, out, err, interrupt, terminal,
                        repl.noHistory ? std::string() : defaultHistoryFile());
    const ExitCode result =
        readAndEvaluate(asking.client(), repl, asking.read(), terminal, options.display.json ? err : out, interrupt);
    finish(asking.client());
    return result;
}

ExitCode runCommand(const Options& options, const RunOptions& run, Printer& printer, Output& out, Output& err,
                    Interrupt& interrupt) {
    const std::string program = readProgram(run);
    AskingClient asking(options, printer, out, err, interrupt, standardInputIsTerminal());
    const ExitCode result = runProgramText(asking.client(), run, program);
    finish(asking.client());
    return result;
}

ExitCode runCommand(const Options& options, const CallOptions& call, Printer& printer, Output& out, Output& err,
                    Interrupt& interrupt) {
    PreparedCall prepared = prepareCall(call);
    AskingClient asking(options, printer, out, err, interrupt, standardInputIsTerminal());
    try {
        const ExitCode result = callFunction(asking.client(), call, std::move(prepared), printer, err);
        finish(asking.client());
        return result;
    } catch (const Failure& failure) {
        // What this end cannot send or store is no fault of the session, which ends in good order.
        if (failure.code() == ExitCode::Usage) {
            finish(asking.client());
        }
        throw;
    }
}

ExitCode runReporting(const Options& options) {
    Interrupt interrupt;
    Output out(STDOUT_FILENO, "standard output", interrupt);
    Output err(STDERR_FILENO, "standard error", interrupt);
    const auto printer = makePrinter(options.display, out, err);
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
        return std::visit(
            [&](const auto& command) { return runCommand(options, command, *printer, out, err, interrupt); },
            options.command);
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
    apps::installProtobufLog();
    if (std::get<Options>(parsed).connection.noZeroCopy) {
        // Before the first serializer asks; an engine that is started here inherits it.
        ::setenv("QX_DISABLE_ZEROCOPY", "1", 1);
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

}  // namespace client
