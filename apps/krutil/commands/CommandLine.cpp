#include "krutil/commands/CommandLine.hpp"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <array>
#include <map>
#include <memory>
#include <sstream>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "common/Build.hpp"
#include "common/HelpFormatter.hpp"
#include "common/LimitOptions.hpp"
#include "common/RecordOptions.hpp"

namespace krutil_client {
namespace {

constexpr const char* exitCodes = R"(Exit codes:
  0  ok
  1  the code or the function raised an error
  2  the command line, the code text or a file cannot be used, a recording or a trace is not
     complete, or an argument is larger than the engine accepts
  3  no engine could be started or reached, its stream was lost, or its diary, log or recording is
     not complete
  4  the engine broke the protocol, or a recording that is checked does
  5  the engine refused: the ends do not fit (protocol version or features), or it is full
  6  cancelled)";

// A time of a millisecond to a day, in seconds. Its default is what `time` holds, 0 for none.
void addSecondsOption(CLI::App& app, const std::string& name, std::chrono::milliseconds& time,
                      const std::string& description, const std::string& group) {
    auto* const option =
        app.add_option_function<double>(
               name,
               [&time](const double& seconds) {
                   time = std::chrono::milliseconds(static_cast<std::chrono::milliseconds::rep>(seconds * 1'000.0));
               },
               description)
            ->check(CLI::Range(0.001, 86'400.0).description(""))
            ->type_name("SECONDS")
            ->group(group);
    if (time.count() > 0) {
        option->default_str(std::to_string(time.count() / 1'000));
    }
}

// Which engine.
void addEngineOptions(CLI::App& app, ConnectionOptions& options) {
    auto* engine =
        app.add_option("--engine", options.engine,
                       "Start the engine with this shell command, for example 'ssh HOST krutil-qvm --stdio'; "
                       "otherwise krutil-qvm beside this program, or on PATH")
            ->type_name("COMMAND")
            ->group("Engine");
    app.add_option("--connect", options.socket,
                   "Connect to the engine that listens at this Unix socket, or to a TLS proxy before engines as "
                   "tls://HOST:PORT")
        ->type_name("PATH")
        ->excludes(engine)
        ->group("Engine");
    auto* key =
        app.add_option(
               "--key", options.key,
               "For TLS, the key of the certificate: a PEM file, without a passphrase and closed to other users")
            ->type_name("FILE")
            ->group("Engine");
    auto* certificate =
        app.add_option("--cert", options.certificate, "For TLS, the certificate that this program shows: a PEM file")
            ->type_name("FILE")
            ->needs(key)
            ->group("Engine");
    key->needs(certificate);
    app.add_option("--ca", options.authorities,
                   "For TLS, the authorities that the proxy's certificate is checked with: a PEM file")
        ->type_name("FILE")
        ->group("Engine");
    addSecondsOption(app, "--handshake-timeout", options.handshakeTimeout,
                     "How long the engine may take to start and answer", "Engine");
    addSecondsOption(
        app, "--keep-alive", options.keepAlive,
        "How often a sign of life is exchanged with an engine behind --engine or TLS, for proxies that end "
        "idle connections; otherwise never",
        "Engine");
}

// What is agreed with it, too.
void addConnectionOptions(CLI::App& app, ConnectionOptions& options) {
    addEngineOptions(app, options);
    app.add_flag(
           "--no-zero-copy", options.noZeroCopy,
           "Copy arrays into their messages, as QX_DISABLE_ZEROCOPY=1 does; both ends must. An engine that is started "
           "here is told so, any other needs the option as well")
        ->group("Engine");
    app.add_flag("--no-shared-memory", options.noSharedMemory,
                 "Send large arrays as bytes, also to an engine of this machine that could read them where they are")
        ->group("Engine");
    app.add_flag(
           "--no-precheck", options.noPrecheck,
           "Do not look for numbers that the protocol does not know before a message is read; one that comes then "
           "ends this program at once")
        ->group("Engine");
    apps::addLimitOptions(app, options.limits);
}

void addDisplayOptions(CLI::App& app, DisplayOptions& options) {
    app.add_flag("--json", options.json, "Print one JSON object a line for each event, and nothing else")
        ->group("Display");
    app.add_flag("--trace", options.trace, "Print each frame of the session to standard error")->group("Display");
    app.add_option("--trace-to", options.traceFile,
                   "Write each frame of the session to this file, which is emptied first")
        ->type_name("FILE")
        ->group("Display");
    apps::addRecordOptions(app, options.record, "Display",
                           "Record the session in this file, which is emptied first, for Wireshark and other readers "
                           "of pcapng");
    app.add_flag("--timing", options.timing, "Say how long things took")->group("Display");
    static const std::map<std::string, Color> colors{
        {"auto", Color::Auto}, {"always", Color::Always}, {"never", Color::Never}};
    app.add_option_function<std::string>(
           "--color", [&options](const std::string& name) { options.color = colors.at(name); },
           "Colour errors, warnings and code that is typed: auto (on a terminal, unless NO_COLOR is set), always or "
           "never")
        ->check(CLI::IsMember(&colors))
        ->type_name("WHEN")
        ->default_str("auto")
        ->group("Display");
    app.add_flag("--warning-stack", options.warningStack, "Show where each warning was issued")->group("Display");
    app.add_flag("--safe-text", options.safeText,
                 "Show control characters of what programs print, and controls of direction, as escapes; "
                 "newline and tab stay. --json always does that")
        ->group("Display");
}

void addSinkOptions(CLI::App& app, SinkOptions& options) {
    app.add_flag("--diary", options.diary, "Add the text to the engine's diary as well")->group("Request");
    app.add_flag("--log", options.log, "Write the text to the engine's log as well")->group("Request");
    app.add_flag("--hotlinks", options.hotlinks, "Let a terminal show hyperlinks")->group("Request");
}

void addSparingly(CLI::App& app, bool& sparingly) {
    app.add_flag("--sparingly", sparingly, "Let the engine send output in large pieces instead of line by line")
        ->group("Request");
}

std::string notExpected(const std::vector<std::string>& words) {
    std::string text =
        words.size() > 1 ? "The following arguments were not expected:" : "The following argument was not expected:";
    for (const std::string& word : words) {
        text += ' ' + word;
    }
    return text;
}

// Words of a file's code come after two dashes, so that code beside a file is found to be one too many.
void addEval(CLI::App& app, Options& options, EvalOptions& eval, bool twoDashes) {
    auto* command = app.add_subcommand("eval", "Evaluate code and show what it prints");
    auto* code =
        command
            ->add_option("CODE",
                         "The code, or - for standard input; after -- it may begin with a dash. Not with --file")
            ->type_name("");
    const auto words = std::make_shared<std::vector<std::string>>();
    command->add_option("ARG", *words, "With --file, after --: what the code finds in sys.argv after the file's name")
        ->type_name("");
    auto* file = command->add_option("-f,--file", "Take the code from a file")->expected(1)->type_name("FILE");
    static const std::map<std::string, cmddistributor::CodeType> types{
        {"block", cmddistributor::CodeType::CodeBlockType},
        {"script", cmddistributor::CodeType::ScriptType},
        {"conventional", cmddistributor::CodeType::ConventionalType}};
    command
        ->add_option_function<std::string>(
            "--type", [&eval](const std::string& name) { eval.type = types.at(name); },
            "How the code is read: block (statements; the value of a trailing expression is shown), script (a whole "
            "file) "
            "or conventional (one statement)")
        ->check(CLI::IsMember(&types))
        ->type_name("TYPE")
        ->default_str("block")
        ->group("Request");
    addSparingly(*command, eval.sparingly);
    command->add_flag("--echo", eval.sink.echo, "Show the code before what it prints")->group("Request");
    addSinkOptions(*command, eval.sink);
    addDisplayOptions(*command, options.display);
    addConnectionOptions(*command, options.connection);
    command->footer(exitCodes);
    command->callback([&options, &eval, twoDashes, code, words, file] {
        if (code->count() == 0 && file->count() == 0) {
            throw CLI::RequiredError("CODE or --file");
        }
        eval.fromFile = file->count() > 0;
        eval.source = (eval.fromFile ? file : code)->results().front();
        eval.fromStandardInput = !eval.fromFile && eval.source == "-";
        if (eval.fromFile && code->count() > 0 && !twoDashes) {
            throw CLI::ExcludesError("CODE", "--file");
        }
        if (!eval.fromFile && !words->empty()) {
            throw CLI::ParseError(notExpected(*words), CLI::ExitCodes::ExtrasError);
        }
        std::vector<std::string> arguments = code->results();
        arguments.insert(arguments.end(), words->begin(), words->end());
        if (eval.fromFile && !arguments.empty()) {
            eval.arguments = std::move(arguments);
        }
        options.command = eval;
    });
}

constexpr const char* promptHelp = R"(Prompts:
  Code that reads a line, pauses or stops at breakpoint() asks for it here if standard input is a
  terminal. At debug> and keyboard> lines are evaluated where the code stands; :c goes on, :q (or
  Ctrl-D) quits, :queue lists requests and :queue cancel N cancels one. Ctrl-C cancels; a second
  one within two seconds ends the engine.)";

void addRun(CLI::App& app, Options& options, EvalOptions& run) {
    auto* command = app.add_subcommand("run", "Run a Python script from a file");
    command->add_option("FILE", run.source, "The script, a file of this machine; the engine gets its text")
        ->required()
        ->type_name("");
    command
        ->add_option(
            "ARG", run.arguments.emplace(),
            "What the script finds in sys.argv after its name; put -- before the first one if any begins with a dash")
        ->type_name("");
    addSparingly(*command, run.sparingly);
    addSinkOptions(*command, run.sink);
    addDisplayOptions(*command, options.display);
    addConnectionOptions(*command, options.connection);
    command->footer(std::string(promptHelp) + "\n\n" + exitCodes);
    command->callback([&options, &run] {
        run.fromFile = true;
        run.type = cmddistributor::CodeType::ScriptType;
        options.command = run;
    });
}

void addRepl(CLI::App& app, Options& options, ReplOptions& repl) {
    auto* command = app.add_subcommand("repl", "Evaluate code line by line, as krutil without a command does");
    command->add_flag("--no-history", repl.noHistory, "Keep no history of the lines that are typed")->group("Display");
    addSinkOptions(*command, repl.sink);
    addDisplayOptions(*command, options.display);
    addConnectionOptions(*command, options.connection);
    command->footer(std::string(promptHelp) + "\n\n" + exitCodes);
    command->callback([&options, &repl] { options.command = repl; });
}

constexpr const char* replayCodes = R"(Exit codes of replay:
  0  the other end spoke as in the recording
  1  it said something else
  2  the command line or the recording cannot be used
  3  no engine could be started or reached, or the stream of the other end was lost
  4  the other end broke the protocol
  5  the other end refuses the session
  6  cancelled)";

void addReplay(CLI::App& app, Options& options, ReplayOptions& replay) {
    auto* command = app.add_subcommand(
        "replay",
        "Say to an engine what the client of a recording has said, and show where the engine answers otherwise; or the "
        "engine's part to a client");
    command->add_option("FILE", replay.file, "The recording; - for standard input")->required()->type_name("");
    auto* serve = command
                      ->add_flag("--serve", replay.serve,
                                 "Say to a client at standard input and output what the engine has said, and show on "
                                 "standard error where the client says something else; for --engine of a client")
                      ->group("Request");
    addSecondsOption(*command, "--patience", replay.patience,
                     "How much longer than in the recording an answer may take", "Request");
    addEngineOptions(*command, options.connection);
    serve->excludes("--engine")->excludes("--connect");
    command->footer(replayCodes);
    command->callback([&options, &replay] { options.command = replay; });
}

// Options without a command are those of the one that needs no name.
bool beginsOptionsOfRepl(const std::string& argument) {
    constexpr std::array<std::string_view, 3> ofTheProgram{"-h", "--help", "--version"};
    return argument.starts_with('-') && argument != "--" &&
           std::find(ofTheProgram.begin(), ofTheProgram.end(), argument) == ofTheProgram.end();
}

constexpr const char* argumentForms = R"(Arguments:
  7  3.5  1e3  1+2j  true       a number or a truth value
  [1,2,3]  [[1,2.5],[3,4]]      an array, with one dimension for each level of lists
  '"text"'                      a text in double quotes, with quotes around them for the shell
  FILE.npy  @FILE               the array of a .npy file, sent from the file without a copy
After -- an argument may begin with a dash; a negative number may at any place.)";

// What begins and ends with a bracket is taken apart at its commas by the parser of the command line, unless there is a
// space before it, which an array's literal may begin with. The value of an option is no literal.
std::vector<std::string> withLiteralsKept(const CLI::App& app, int argc, const char* const* argv) {
    std::vector<std::string> arguments(argv + std::min(argc, 1), argv + argc);
    if (arguments.empty() || arguments[0] != "call") {
        return arguments;
    }
    const CLI::App& call = *app.get_subcommand(arguments[0]);
    const auto takesValue = [&call](const std::string& argument) {
        const CLI::Option* const option = argument.starts_with('-') ? call.get_option_no_throw(argument) : nullptr;
        return option != nullptr && option->get_items_expected_max() > 0;
    };
    bool options = true;
    for (std::size_t i = 1; i < arguments.size(); ++i) {
        if (arguments[i].starts_with('[') && !(options && takesValue(arguments[i - 1]))) {
            arguments[i].insert(0, 1, ' ');
        }
        options = options && arguments[i] != "--";
    }
    return arguments;
}

void addCall(CLI::App& app, Options& options, CallOptions& call) {
    auto* command = app.add_subcommand("call", "Call a function with arrays and show what it returns");
    command->add_option("FUNCTION", call.function, "Name of the function, for example numpy.linalg.svd")
        ->required()
        ->type_name("");
    auto* arguments = command->add_option("ARG", call.arguments, "Literals and .npy files, see below")->type_name("");
    auto* outputs = command
                        ->add_option("--nout", call.outputs,
                                     "How many outputs are wanted; otherwise one, or as many as there are --output")
                        ->check(CLI::Range(std::size_t{0}, std::size_t{65'535}).description(""))
                        ->type_name("COUNT")
                        ->group("Request");
    command
        ->add_option("-o,--output", call.files,
                     "Write an output to this .npy file instead of showing it; once for each, in order")
        ->allow_extra_args(false)
        ->type_name("FILE")
        ->group("Request");
    addSparingly(*command, call.sparingly);
    addSinkOptions(*command, call.sink);
    addDisplayOptions(*command, options.display);
    addConnectionOptions(*command, options.connection);
    command->footer(std::string(argumentForms) + "\n\n" + exitCodes);
    command->callback([&options, &call, arguments, outputs] {
        // As they were typed: a conversion would take {} for none.
        call.arguments = arguments->results();
        for (std::string& argument : call.arguments) {
            if (argument.starts_with(" [")) {
                argument.erase(0, 1);
            }
        }
        if (outputs->count() == 0) {
            call.outputs = std::max<std::size_t>(call.files.size(), 1);
        }
        options.command = call;
    });
}

// Instead of all that inspect prints.
void addPage(CLI::App& inspection, InspectOptions& inspect) {
    auto* html = inspection
                     .add_option("--html", inspect.html,
                                 "Write a page for a browser to this new file, or - for standard output: requests as "
                                 "lanes on an axis of time, and their messages as marks")
                     ->type_name("OUT")
                     ->group("Display");
    for (const char* const other : {"--frames", "--fields", "--hex", "--json", "--timeline", "--lint"}) {
        html->excludes(inspection.get_option(other));
    }
}

// Of the whole recording.
void addCopy(CLI::App& inspection, InspectOptions& inspect) {
    auto* copy = inspection
                     .add_option("--redact", inspect.redacted,
                                 "Write a copy without text and numbers to this new file, so that it can go into a "
                                 "report of a fault")
                     ->type_name("OUT")
                     ->group("Display");
    for (CLI::Option* const other : inspection.get_options()) {
        if (other != copy && other->get_single_name() != "FILE" && other != inspection.get_help_ptr()) {
            copy->excludes(other);
        }
    }
}

void addInspect(CLI::App& app, Options& options, InspectOptions& inspect) {
    auto* command = app.add_subcommand("inspect", "Show what is in a recording of sessions");
    command->add_option("FILE", inspect.file, "A file that --record has written, or - for standard input")
        ->required()
        ->type_name("");
    command->add_flag("--frames", inspect.frames, "Show the frames of each message")->group("Display");
    command->add_flag("--fields", inspect.fields, "Show the frames and the fields in them")->group("Display");
    command->add_flag("--hex", inspect.hex, "Show the frames and their bytes")->group("Display");
    auto* json =
        command->add_flag("--json", inspect.json, "Print one JSON object a line for each message")->group("Display");
    auto* timeline =
        command->add_flag("--timeline", inspect.timeline, "Show for each request what happened to it, and when")
            ->excludes(json)
            ->group("Display");
    command
        ->add_flag("--lint", inspect.lint,
                   "Show no messages, but where a session breaks a rule: the file, the byte, and what was expected")
        ->excludes(timeline)
        ->group("Display");
    addPage(*command, inspect);
    command
        ->add_option("--request", inspect.request,
                     "Only messages of the request whose identifier begins with these hexadecimal digits")
        ->type_name("ID")
        ->group("Filter");
    command->add_option("--type", inspect.types, "Only messages of this type, IIPReply for example; may be repeated")
        ->allow_extra_args(false)
        ->type_name("NAME")
        ->group("Filter");
    static const std::map<std::string, InspectOptions::Role> roles{{"client", InspectOptions::Role::Client},
                                                                   {"engine", InspectOptions::Role::Engine}};
    command
        ->add_option_function<std::string>(
            "--from", [&inspect](const std::string& name) { inspect.from = roles.at(name); },
            "Only messages that this end has sent: client or engine")
        ->check(CLI::IsMember(&roles))
        ->type_name("END")
        ->group("Filter");
    command->add_option("--since", inspect.since, "Only messages from this time on, counted from the first packet")
        ->type_name("SECONDS")
        ->default_str("")
        ->group("Filter");
    command->add_option("--until", inspect.until, "Only messages up to this time")
        ->type_name("SECONDS")
        ->default_str("")
        ->group("Filter");
    addCopy(*command, inspect);
    command->footer(exitCodes);
    command->callback([&options, &inspect] {
        options.display.json = inspect.json;
        options.command = inspect;
    });
}

// All commands and options, and what parsing fills in.
struct OptionTable {
    // Words tell whether two dashes come.
    explicit OptionTable(const std::vector<std::string>& words);

    Options options;
    EvalOptions eval;
    CallOptions call;
    EvalOptions run;
    ReplOptions repl;
    ReplayOptions replay;
    InspectOptions inspect;
    CLI::App app{
        "Evaluates code on an engine in another process. Without a command, code is read line by line; the options are "
        "those of repl.",
        "krutil"};
};

OptionTable::OptionTable(const std::vector<std::string>& words) {
    options.command = repl;
    app.set_version_flag("--version", apps::buildString("krutil"), "Print the version and exit");
    app.set_help_flag("-h,--help", "Print this help and exit");
    app.require_subcommand(0, 1);
    app.footer(exitCodes);
    app.formatter(std::make_shared<apps::HelpFormatter>());
    addEval(app, options, eval, std::find(words.begin(), words.end(), "--") != words.end());
    addCall(app, options, call);
    addRun(app, options, run);
    addRepl(app, options, repl);
    addReplay(app, options, replay);
    addInspect(app, options, inspect);
}

// Why nothing takes these words. Options that come first are those of the repl.
std::string describeExtras(const CLI::App& app, const std::vector<std::string>& extras, bool optionsFirst) {
    const auto commands = app.get_subcommands(nullptr);
    if (optionsFirst) {
        const auto isExtra = [&extras](const CLI::App* command) {
            return std::find(extras.begin(), extras.end(), command->get_name()) != extras.end();
        };
        if (const auto found = std::find_if(commands.begin(), commands.end(), isExtra); found != commands.end()) {
            const std::string name = (*found)->get_name();
            return "expected the command before its options, got \"" + name + "\" behind them; write: krutil " + name +
                   " [OPTION...] ...";
        }
    } else if (app.get_subcommands().empty()) {
        std::string names;
        for (const CLI::App* const command : commands) {
            names += names.empty() ? "" : ", ";
            names += command->get_name();
        }
        return "expected a command (" + names + "), got \"" + extras.front() +
               "\"; code is evaluated by: krutil eval CODE";
    }
    return notExpected(extras);
}

}  // namespace

void describeCommandLine(const std::function<void(const CLI::App&)>& describe) {
    describe(OptionTable({}).app);
}

std::variant<Options, Finished> parseCommandLine(int argc, const char* const* argv) {
    OptionTable table(std::vector<std::string>(argv, argv + argc));
    CLI::App& app = table.app;
    auto arguments = withLiteralsKept(app, argc, argv);
    const bool optionsFirst = !arguments.empty() && beginsOptionsOfRepl(arguments.front());
    if (optionsFirst) {
        arguments.insert(arguments.begin(), "repl");
    }
    const auto refused = [](const std::string& why) {
        return Finished{ExitCode::Usage, {}, "krutil: " + why + "\nRun krutil --help for help.\n"};
    };
    try {
        std::reverse(arguments.begin(), arguments.end());
        app.parse(std::move(arguments));
    } catch (const CLI::ExtrasError&) {
        return refused(describeExtras(app, app.remaining(true), optionsFirst));
    } catch (const CLI::ParseError& error) {
        std::ostringstream out;
        std::ostringstream err;
        app.exit(error, out, err);
        // Help and version are no errors.
        if (error.get_exit_code() == static_cast<int>(CLI::ExitCodes::Success)) {
            return Finished{ExitCode::Ok, out.str(), {}};
        }
        return refused(error.what());
    }
    return table.options;
}

}  // namespace krutil_client
