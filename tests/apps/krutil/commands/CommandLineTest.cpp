#include "krutil/commands/CommandLine.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <vector>

namespace krutil_client {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

std::variant<Options, Finished> parse(std::vector<const char*> arguments) {
    arguments.insert(arguments.begin(), "krutil");
    return parseCommandLine(static_cast<int>(arguments.size()), arguments.data());
}

EvalOptions parseEval(const std::vector<const char*>& arguments) {
    return std::get<EvalOptions>(std::get<Options>(parse(arguments)).command);
}

Finished parseFinished(const std::vector<const char*>& arguments) {
    return std::get<Finished>(parse(arguments));
}

TEST(CommandLineTest, CodeAsAnArgument) {
    const EvalOptions eval = parseEval({"eval", "1 + 1"});
    EXPECT_EQ(eval.source, "1 + 1");
    EXPECT_FALSE(eval.fromFile);
    EXPECT_FALSE(eval.fromStandardInput);
    EXPECT_EQ(eval.type, cmddistributor::CodeType::CodeBlockType);
    EXPECT_FALSE(eval.sparingly);
}

TEST(CommandLineTest, CodeOfAFileOrOfStandardInput) {
    const EvalOptions file = parseEval({"eval", "-f", "x.py"});
    EXPECT_EQ(file.source, "x.py");
    EXPECT_TRUE(file.fromFile);
    EXPECT_FALSE(file.fromStandardInput);
    const EvalOptions input = parseEval({"eval", "-"});
    EXPECT_TRUE(input.fromStandardInput);
    EXPECT_FALSE(input.fromFile);
    // A file of that name is a file.
    EXPECT_FALSE(parseEval({"eval", "-f", "./-"}).fromStandardInput);
}

TEST(CommandLineTest, CodeOfAFileHasArguments) {
    EXPECT_EQ(parseEval({"eval", "x"}).arguments, std::nullopt);
    EXPECT_EQ(parseEval({"eval", "-f", "x.py"}).arguments, std::nullopt);
    const EvalOptions file = parseEval({"eval", "-f", "x.py", "--", "-b", "c"});
    EXPECT_EQ(file.source, "x.py");
    EXPECT_EQ(file.arguments, (std::vector<std::string>{"-b", "c"}));
}

TEST(CommandLineTest, KindsOfCode) {
    EXPECT_EQ(parseEval({"eval", "--type", "script", "x"}).type, cmddistributor::CodeType::ScriptType);
    EXPECT_EQ(parseEval({"eval", "--type", "conventional", "x"}).type, cmddistributor::CodeType::ConventionalType);
    EXPECT_EQ(parseEval({"eval", "--type", "block", "x"}).type, cmddistributor::CodeType::CodeBlockType);
}

TEST(CommandLineTest, EachFlagSetsItsOwnOption) {
    const auto flags = [](const char* flag) {
        const Options options = std::get<Options>(parse({"eval", flag, "x"}));
        const EvalOptions eval = std::get<EvalOptions>(options.command);
        return std::vector<bool>{options.display.json, options.display.trace, options.display.timing,
                                 eval.sparingly,       eval.sink.echo,        eval.sink.diary,
                                 eval.sink.log,        eval.sink.hotlinks};
    };
    const std::vector<const char*> names{"--json", "--trace", "--timing", "--sparingly",
                                         "--echo", "--diary", "--log",    "--hotlinks"};
    for (std::size_t i = 0; i < names.size(); ++i) {
        std::vector<bool> expected(names.size(), false);
        expected[i] = true;
        EXPECT_EQ(flags(names[i]), expected) << names[i];
    }
}

TEST(CommandLineTest, AFileForTheTrace) {
    for (const std::vector<const char*>& arguments : {std::vector<const char*>{"eval", "--trace-to", "a file", "x"},
                                                      {"call", "--trace-to", "a file", "abs", "-1"},
                                                      {"run", "--trace-to", "a file", "x.py"},
                                                      {"repl", "--trace-to", "a file"}}) {
        const Options options = std::get<Options>(parse(arguments));
        EXPECT_EQ(options.display.traceFile, "a file");
        EXPECT_FALSE(options.display.trace);
    }
    EXPECT_EQ(std::get<Options>(parse({"eval", "--trace", "x"})).display.traceFile, std::nullopt);
    EXPECT_EQ(std::get<Options>(parse({"call", "--trace-to", "[1", "abs", "[1,2]"})).display.traceFile, "[1");
    EXPECT_EQ(parseFinished({"eval", "x", "--trace-to"}).err,
              "krutil: --trace-to: 1 required FILE missing\nRun krutil --help for help.\n");
}

TEST(CommandLineTest, TheEngine) {
    const auto connection = [](const std::vector<const char*>& arguments) {
        return std::get<Options>(parse(arguments)).connection;
    };
    EXPECT_EQ(connection({"eval", "x"}).engine, std::nullopt);
    EXPECT_EQ(connection({"eval", "x"}).socket, std::nullopt);
    EXPECT_EQ(connection({"eval", "x"}).handshakeTimeout.count(), 10'000);
    EXPECT_EQ(connection({"eval", "x", "--engine", "ssh host krutil-qvm --stdio"}).engine,
              "ssh host krutil-qvm --stdio");
    EXPECT_EQ(connection({"eval", "--connect", "/run/x", "x"}).socket, "/run/x");
    const std::vector<const char*> tls{"eval",  "--connect", "tls://host:1", "--cert",      "certificate",
                                       "--key", "key",       "--ca",         "authorities", "x"};
    EXPECT_EQ(connection(tls).socket, "tls://host:1");
    EXPECT_EQ(connection(tls).certificate, "certificate");
    EXPECT_EQ(connection(tls).key, "key");
    EXPECT_EQ(connection(tls).authorities, "authorities");
    EXPECT_EQ(connection({"eval", "--handshake-timeout", "2.5", "x"}).handshakeTimeout.count(), 2500);
    EXPECT_EQ(connection({"eval", "x"}).keepAlive.count(), 0);
    EXPECT_EQ(connection({"eval", "--keep-alive", "30", "x"}).keepAlive.count(), 30'000);
    EXPECT_EQ(connection({"eval", "--limit-frames", "17", "x"}).limits.frames, 17U);
}

TEST(CommandLineTest, ErrorsSayWhatIsWrongAndWhereHelpIs) {
    const std::vector<std::pair<std::vector<const char*>, std::string>> cases{
        {{"evaluate"}, "krutil: "},
        {{"eval"}, "krutil: CODE or --file is required\n"},
        {{"eval", "x", "-f", "y"}, "krutil: CODE excludes --file\n"},
        {{"eval", "x", "y"}, "krutil: "},
        {{"eval", "-x"}, "krutil: "},
        {{"eval", "--type", "poem", "x"}, "krutil: --type: poem not in {block,conventional,script}\n"},
        {{"eval", "--engine", "a", "--connect", "b", "x"}, "krutil: "},
        {{"eval", "--connect", "tls://a:1", "--key", "b", "x"}, "krutil: --key requires --cert\n"},
        {{"eval", "--connect", "tls://a:1", "--cert", "b", "x"}, "krutil: --cert requires --key\n"},
        {{"eval", "--engine"}, "krutil: --engine: 1 required COMMAND missing\n"},
        {{"eval", "--handshake-timeout", "0", "x"}, "krutil: --handshake-timeout: "},
        {{"eval", "--handshake-timeout", "soon", "x"}, "krutil: "},
        {{"eval", "--limit-tag", "65536", "x"}, "krutil: --limit-tag: expected a number from 1 to 65535"},
        {{"eval", "--record", "r", "--record-size", "1023KiB", "x"},
         "krutil: --record-size: expected a number from 1048576 to "},
        {{"eval", "--record-size", "1MiB", "x"}, "krutil: --record-size requires --record\n"}};
    for (const auto& [arguments, sentence] : cases) {
        const Finished finished = parseFinished(arguments);
        EXPECT_EQ(finished.code, ExitCode::Usage) << sentence;
        EXPECT_EQ(finished.out, "");
        EXPECT_THAT(finished.err, StartsWith(sentence));
        EXPECT_THAT(finished.err, ::testing::EndsWith("\nRun krutil --help for help.\n"));
    }
}

TEST(CommandLineTest, WordsThatNothingTakesAreNamed) {
    const std::vector<std::pair<std::vector<const char*>, std::string>> cases{
        {{"--connect", "engine", "eval", "x"},
         "expected the command before its options, got \"eval\" behind them; write: krutil eval [OPTION...] ..."},
        {{"--json", "more", "words"}, "The following arguments were not expected: more words"},
        {{"1+1"},
         "expected a command (eval, call, run, repl, replay, inspect), got \"1+1\"; code is evaluated by: krutil eval "
         "CODE"},
        {{"evla", "x"},
         "expected a command (eval, call, run, repl, replay, inspect), got \"evla\"; code is evaluated by: krutil eval "
         "CODE"},
        {{"eval", "x", "y"}, "The following argument was not expected: y"},
        {{"eval", "x", "y", "z"}, "The following arguments were not expected: y z"},
        {{"inspect", "--fast", "--small", "file"}, "The following arguments were not expected: --fast --small"}};
    for (const auto& [arguments, sentence] : cases) {
        const Finished finished = parseFinished(arguments);
        EXPECT_EQ(finished.code, ExitCode::Usage);
        EXPECT_EQ(finished.err, "krutil: " + sentence + "\nRun krutil --help for help.\n");
    }
}

TEST(CommandLineTest, WithoutACommandLinesAreRead) {
    EXPECT_FALSE(std::get<ReplOptions>(std::get<Options>(parse({})).command).noHistory);
    EXPECT_FALSE(std::get<ReplOptions>(std::get<Options>(parse({"repl"})).command).noHistory);
    const Options options =
        std::get<Options>(parse({"repl", "--no-history", "--color", "never", "--warning-stack", "--safe-text"}));
    EXPECT_TRUE(std::get<ReplOptions>(options.command).noHistory);
    EXPECT_EQ(options.display.color, Color::Never);
    EXPECT_TRUE(options.display.warningStack);
    EXPECT_TRUE(options.display.safeText);
    EXPECT_EQ(parseFinished({"repl", "--color", "red"}).err,
              "krutil: --color: red not in {always,auto,never}\nRun krutil --help for help.\n");
}

TEST(CommandLineTest, InspectTakesAFileAndFilters) {
    const Options options =
        std::get<Options>(parse({"inspect", "--type", "IIPReply", "--type", "data", "--from", "engine", "--since",
                                 "1.5", "--request", "ab", "--hex", "--json", "-"}));
    const auto& inspect = std::get<InspectOptions>(options.command);
    EXPECT_EQ(inspect.file, "-");
    EXPECT_EQ(inspect.types, (std::vector<std::string>{"IIPReply", "data"}));
    EXPECT_EQ(inspect.from, InspectOptions::Role::Engine);
    EXPECT_EQ(inspect.since, 1.5);
    EXPECT_EQ(inspect.request, "ab");
    EXPECT_TRUE(inspect.hex);
    EXPECT_FALSE(inspect.lint);
    EXPECT_TRUE(options.display.json);
    EXPECT_EQ(parseFinished({"inspect"}).err, "krutil: FILE is required\nRun krutil --help for help.\n");
    EXPECT_EQ(parseFinished({"inspect", "--lint", "--timeline", "f"}).code, ExitCode::Usage);
}

TEST(CommandLineTest, ARedactedCopyIsOfTheWholeRecording) {
    const Options options = std::get<Options>(parse({"inspect", "f", "--redact", "copy"}));
    EXPECT_EQ(std::get<InspectOptions>(options.command).redacted, "copy");
    for (const auto& other :
         std::vector<std::vector<const char*>>{{"--json"}, {"--html", "page"}, {"--type", "data"}}) {
        std::vector<const char*> words{"inspect", "f", "--redact", "copy"};
        words.insert(words.end(), other.begin(), other.end());
        EXPECT_EQ(parseFinished(words).err,
                  std::string("krutil: ") + other.front() + " excludes --redact\nRun krutil --help for help.\n");
    }
}

TEST(CommandLineTest, OptionsWithoutACommandAreThoseOfRepl) {
    const Options options = std::get<Options>(parse({"--connect", "/run/x", "--no-history"}));
    EXPECT_TRUE(std::get<ReplOptions>(options.command).noHistory);
    EXPECT_EQ(options.connection.socket, "/run/x");
    EXPECT_EQ(std::get<Options>(parse({"--engine=an engine"})).connection.engine, "an engine");
    EXPECT_EQ(parseFinished({"--conect", "/run/x"}).code, ExitCode::Usage);
    EXPECT_THAT(parseFinished({"--conect"}).err, HasSubstr("--conect"));
    // A command has its own options behind its name.
    const Finished before = parseFinished({"--connect", "/run/x", "eval", "1"});
    EXPECT_EQ(before.code, ExitCode::Usage);
    EXPECT_THAT(before.err, HasSubstr("eval"));
}

TEST(CommandLineTest, AProgramHasArguments) {
    const Options options = std::get<Options>(parse({"run", "--no-precheck", "a.py", "--", "-b", "c", "-d"}));
    EXPECT_TRUE(options.connection.noPrecheck);
    const EvalOptions run = std::get<EvalOptions>(options.command);
    EXPECT_EQ(run.source, "a.py");
    EXPECT_TRUE(run.fromFile);
    EXPECT_EQ(run.type, cmddistributor::CodeType::ScriptType);
    EXPECT_EQ(run.arguments, (std::vector<std::string>{"-b", "c", "-d"}));
    EXPECT_EQ(std::get<EvalOptions>(std::get<Options>(parse({"run", "a.py"})).command).arguments,
              std::vector<std::string>());
    EXPECT_EQ(parseFinished({"run"}).err, "krutil: FILE is required\nRun krutil --help for help.\n");
}

TEST(CommandLineTest, HelpGoesToStandardOutput) {
    const Finished finished = parseFinished({"--help"});
    EXPECT_EQ(finished.code, ExitCode::Ok);
    EXPECT_EQ(finished.err, "");
    EXPECT_THAT(finished.out, HasSubstr("Usage: krutil [OPTIONS] [SUBCOMMAND]\n"));
    EXPECT_THAT(finished.out, HasSubstr("  eval                          Evaluate code and show what it prints\n"));
    EXPECT_THAT(finished.out,
                HasSubstr("  3  no engine could be started or reached, its stream was lost, or its diary, "
                          "log or recording is\n     not complete\n"));
}

TEST(CommandLineTest, HelpOfACommandFitsInOneHundredColumns) {
    const Finished finished = parseFinished({"eval", "--help"});
    EXPECT_EQ(finished.code, ExitCode::Ok);
    EXPECT_THAT(finished.out, HasSubstr("Usage: krutil eval [OPTIONS] [CODE] [ARG...]\n"));
    for (const auto* option :
         {"-f,--file FILE", "--type TYPE", "--sparingly", "--engine COMMAND", "--connect PATH", "--json", "--trace",
          "--trace-to FILE", "--timing", "--handshake-timeout SECONDS", "--limit-tag SIZE", "--limit-tagged-frame SIZE",
          "--limit-array-message SIZE", "--limit-message SIZE", "--limit-frames COUNT", "--echo", "--diary", "--log",
          "--hotlinks"}) {
        EXPECT_THAT(finished.out, HasSubstr(std::string("\n  ") + option));
    }
    std::size_t begin = 0;
    for (std::size_t end = 0; (end = finished.out.find('\n', begin)) != std::string::npos; begin = end + 1) {
        EXPECT_LE(end - begin, 100U) << finished.out.substr(begin, end - begin);
    }
}

TEST(CommandLineTest, VersionNamesTheBuild) {
    const Finished finished = parseFinished({"--version"});
    EXPECT_EQ(finished.code, ExitCode::Ok);
    EXPECT_THAT(finished.out, ::testing::MatchesRegex("krutil [0-9.]+ \\(krutil_protobuf, .*\\)\n"));
}

}  // namespace
}  // namespace krutil_client
