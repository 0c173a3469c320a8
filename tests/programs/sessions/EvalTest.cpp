// Code that is evaluated by an engine in another process.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <csignal>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <sstream>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using nlohmann::json;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

std::vector<json> objects(const std::string& lines) {
    std::vector<json> result;
    std::istringstream in(lines);
    for (std::string line; std::getline(in, line);) {
        result.push_back(json::parse(line));
    }
    return result;
}

std::vector<std::string> eventNames(const std::vector<json>& events) {
    std::vector<std::string> names;
    for (const auto& event : events) {
        names.push_back(event.at("event"));
    }
    return names;
}

void write(const std::string& path, const std::string& content) {
    std::ofstream(path, std::ios::binary) << content;
}

std::string contentOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

TEST(EvalTest, ShowsTheValueOfATrailingExpression) {
    const Ran ran = runClient({"eval", "20 + 22"});
    EXPECT_EQ(ran.out, "42\n");
    EXPECT_EQ(ran.err, "");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, TextGoesToTheStreamThatItWasWrittenTo) {
    const Ran ran =
        runClient({"eval", "import sys\nprint('to out: \u00e4\U0001F600')\nprint('to err', file=sys.stderr)"});
    EXPECT_EQ(ran.out, "to out: \u00e4\U0001F600\n");
    EXPECT_EQ(ran.err, "to err\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, EmptyCodeIsEvaluated) {
    const Ran ran = runClient({"eval", ""});
    EXPECT_EQ(ran.out + ran.err, "");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, CodeAfterTwoDashesMayBeginWithADash) {
    const Ran ran = runClient({"eval", "--", "-1 + 3"});
    EXPECT_EQ(ran.out, "2\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, CodeOfAFile) {
    const test_support::TemporaryDirectory directory;
    write(directory.file("code.py"), "print('from a file')\n6 * 7\n");
    const Ran ran = runClient({"eval", "-f", directory.file("code.py")});
    EXPECT_EQ(ran.out, "from a file\n42\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, CodeOfStandardInput) {
    const Ran ran = runClient({"eval", "-"}, {.input = "print('from standard input')\n"});
    EXPECT_EQ(ran.out, "from standard input\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, CodeOfOneMebibyteOnStandardInput) {
    const std::string text(1U << 20, 'x');
    const Ran ran = runClient({"eval", "-"}, {.input = "print(len('" + text + "'))\n"});
    EXPECT_EQ(ran.out, "1048576\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, AScriptShowsNoValue) {
    const Ran ran = runClient({"eval", "--type", "script", "1 + 1"});
    EXPECT_EQ(ran.out, "");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, ConventionalCodeIsASingleStatement) {
    EXPECT_EQ(runClient({"eval", "--type", "conventional", "x = 1\ny = 2"}).exitCode, 1);
    EXPECT_EQ(runClient({"eval", "--type", "conventional", "x = 1"}).exitCode, 0);
}

TEST(EvalTest, LargeOutputArrivesExactly) {
    const Ran ran = runClient({"eval", "for i in range(100_000): print('%099d' % i)"});
    EXPECT_EQ(ran.exitCode, 0);
    ASSERT_EQ(ran.out.size(), 10'000'000U);
    for (int i = 0; i < 100'000; ++i) {
        const std::string number = std::to_string(i);
        const std::string line = std::string(99 - number.size(), '0') + number + "\n";
        ASSERT_EQ(ran.out.compare(static_cast<std::size_t>(i) * 100, 100, line), 0) << "line " << i;
    }
}

TEST(EvalTest, OneLineOfTenMegabytesArrivesExactly) {
    const Ran ran = runClient({"eval", "--sparingly", "print('\u20ac' * 3_333_333)"});
    EXPECT_EQ(ran.exitCode, 0);
    ASSERT_EQ(ran.out.size(), 10'000'000U);
    for (std::size_t i = 0; i + 1 < ran.out.size(); i += 3) {
        ASSERT_EQ(ran.out.compare(i, 3, "\u20ac"), 0) << "byte " << i;
    }
}

TEST(EvalTest, AnErrorIsShownWithItsFramesAfterItsCauses) {
    const test_support::TemporaryDirectory directory;
    write(directory.file("code.py"),
          "def divide(x):\n"
          "    return 1 / x\n"
          "try:\n"
          "    divide(0)\n"
          "except ZeroDivisionError as error:\n"
          "    raise ValueError('no good') from error\n");
    const Ran ran = runClient({"eval", "-f", directory.file("code.py")});
    EXPECT_EQ(ran.out, "");
    // In this order, each once.
    std::size_t at = 0;
    for (const std::string part :
         {"line 4", "line 2", "divide", "ZeroDivisionError: division by zero\n", "line 6", "ValueError: no good\n"}) {
        const auto found = ran.err.find(part, at);
        ASSERT_NE(found, std::string::npos) << part << " is not where it should be in:\n" << ran.err;
        at = found + part.size();
    }
    EXPECT_EQ(at, ran.err.size()) << ran.err;
    EXPECT_EQ(ran.err.find("ValueError: no good"), ran.err.rfind("ValueError: no good")) << ran.err;
    EXPECT_EQ(ran.exitCode, 1);
}

TEST(EvalTest, ASyntaxErrorIsACompileError) {
    const Ran ran = runClient({"eval", "--json", "def f(:"});
    const auto events = objects(ran.out);
    const auto reply = std::find_if(events.begin(), events.end(), [](const json& e) { return e["event"] == "reply"; });
    ASSERT_NE(reply, events.end());
    EXPECT_EQ(reply->at("ok"), false);
    EXPECT_EQ(reply->at("error").at("status"), "compile error");
    EXPECT_EQ(reply->at("error").at("id"), "SyntaxError");
    EXPECT_EQ(ran.exitCode, 1);
}

TEST(EvalTest, LeavingTheInterpreterWithAnErrorIsAnError) {
    const Ran ran = runClient({"eval", "import sys; print('before'); sys.exit(3)"});
    EXPECT_EQ(ran.out, "before\n");
    EXPECT_THAT(ran.err, HasSubstr("SystemExit: 3\n"));
    EXPECT_EQ(ran.exitCode, 1);
    EXPECT_EQ(runClient({"eval", "raise SystemExit"}).exitCode, 0);
}

TEST(EvalTest, JsonHasEachEventInItsOrderWithTheIdentifierOfTheRequest) {
    const auto events = objects(runClient({"eval", "--json", "print(1)\n2"}).out);
    ASSERT_EQ(eventNames(events), (std::vector<std::string>{"connected", "started", "text", "value", "completed",
                                                            "last", "reply", "shutdown"}));
    const std::string id = events[1].at("request");
    EXPECT_EQ(id.size(), 32U);
    EXPECT_NE(id, std::string(32, '0'));
    for (std::size_t i = 1; i < 7; ++i) {
        EXPECT_EQ(events[i].at("request"), id) << events[i];
    }
    EXPECT_EQ(events[2], json({{"event", "text"}, {"request", id}, {"stream", "output"}, {"text", "1\n"}}));
    EXPECT_EQ(events[3], json({{"event", "value"}, {"request", id}, {"stream", "output"}, {"text", "2\n"}}));
    EXPECT_EQ(events[6], json({{"event", "reply"}, {"request", id}, {"ok", true}}));
    EXPECT_EQ(events[0].at("features"), json({{"SHM", "descriptors"}, {"ZEROCOPY", "enable"}}));
}

TEST(EvalTest, WithoutSharedMemoryASessionHasNoSuchFeature) {
    const auto events = objects(runClient({"eval", "--json", "--no-shared-memory", "1"}).out);
    EXPECT_EQ(events.at(0).at("features"), json({{"ZEROCOPY", "enable"}}));
}

TEST(EvalTest, SignsOfLifeAreForEnginesThatMayBeElsewhere) {
    const auto elsewhere = objects(runClient({"eval", "--json", "--keep-alive", "0.001", "--no-shared-memory",
                                              "--engine", quotedForShell(enginePath()) + " --stdio", "1"})
                                       .out);
    EXPECT_EQ(elsewhere.at(0).at("features"), json({{"KEEPALIVE", "frames"}, {"ZEROCOPY", "enable"}}));
    EXPECT_EQ(elsewhere.back(), json({{"event", "shutdown"}}));
    const auto here = objects(runClient({"eval", "--json", "--keep-alive", "0.001", "--no-shared-memory", "1"}).out);
    EXPECT_EQ(here.at(0).at("features"), json({{"ZEROCOPY", "enable"}}));
}

TEST(EvalTest, OutputArrivesBeforeTheCodeHasEnded) {
    const test_support::TemporaryDirectory directory;
    ASSERT_EQ(::mkfifo(directory.file("go").c_str(), 0600), 0);
    // The code goes on only when its first line has been seen here.
    Program program(
        clientCommand({"eval", "print('first'); open('" + directory.file("go") + "').read(); print('second')"}));
    ASSERT_TRUE(program.waitForOut("first\n"));
    write(directory.file("go"), "x");
    EXPECT_EQ(program.finish().out, "first\nsecond\n");
}

TEST(EvalTest, EchoShowsTheCodeFirst) {
    const Ran ran = runClient({"eval", "--echo", "print('shown')"});
    EXPECT_THAT(ran.out, HasSubstr("print('shown')"));
    EXPECT_TRUE(ran.out.size() > 6 && ran.out.compare(ran.out.size() - 6, 6, "shown\n") == 0) << ran.out;
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, TraceHasALineForEachFrame) {
    const Ran ran = runClient({"eval", "--trace", "print('traced')\n5"});
    EXPECT_EQ(ran.out, "traced\n5\n");
    std::istringstream lines(ran.err);
    std::vector<std::string> frames;
    for (std::string line; std::getline(lines, line);) {
        frames.push_back(line.substr(0, line.find(" bytes")).substr(0, line.rfind(' ', line.find(" bytes") - 1)));
    }
    EXPECT_THAT(frames, ElementsAre("--> stream 1 frame 1 type 29 krutil:EvalIIP",                 //
                                    "--> stream 1 frame 2 last type 27 krutil:IIPEnqueueMessage",  //
                                    "<-- stream 1 frame 1 last type 29 krutil:IIPStartedEvent",    //
                                    "<-- stream 1 frame 1 last type 29 krutil:TextBaseEvent",      //
                                    "<-- stream 1 frame 1 last type 29 krutil:SinkTextEvent",      //
                                    "<-- stream 1 frame 1 last type 29 krutil:IIPCompletedEvent",  //
                                    "<-- stream 1 frame 1 last type 29 krutil:detail::LastIIPEvent",
                                    "<-- stream 1 frame 1 type 29 krutil:IIPResult",
                                    "<-- stream 1 frame 2 last type 29 krutil:IIPReply",
                                    "<-- stream 0 frame 1 last type 29 krutil:QVMShutdownEvent"));
    EXPECT_THAT(ran.err, HasSubstr("cmd: \"print(\\'traced\\')\\n5\""));
    EXPECT_THAT(ran.err, HasSubstr("text: \"traced\\n\""));
    EXPECT_THAT(ran.err, HasSubstr("type: LastIIPEvent"));
}

TEST(EvalTest, TheTraceOfAFileIsThatOfStandardError) {
    const test_support::TemporaryDirectory directory;
    const std::string file = directory.file("trace");
    write(file, "older\n");
    const Ran ran = runClient({"eval", "--trace", "--trace-to", file, "print('traced')\n5"});
    EXPECT_EQ(ran.out, "traced\n5\n");
    EXPECT_THAT(ran.err, HasSubstr("krutil:QVMShutdownEvent"));
    EXPECT_EQ(contentOf(file), ran.err);
    EXPECT_EQ(ran.exitCode, 0);
    const Ran quiet = runClient({"eval", "--trace-to", file, "1"});
    EXPECT_EQ(quiet.out, "1\n");
    EXPECT_EQ(quiet.err, "");
    EXPECT_THAT(contentOf(file), HasSubstr("cmd: \"1\""));
}

TEST(EvalTest, EveryCommandThatBeginsASessionIsTraced) {
    const test_support::TemporaryDirectory directory;
    write(directory.file("program.py"), "print('a program')\n");
    const std::vector<std::vector<std::string>> commands{
        {"eval", "1"}, {"call", "abs", "-1"}, {"run", directory.file("program.py")}, {"repl"}};
    for (auto command : commands) {
        const std::string file = directory.file(command.front());
        command.insert(command.begin() + 1, {"--trace-to", file});
        EXPECT_EQ(runClient(command, {.input = "1\n"}).exitCode, 0) << command.front();
        EXPECT_THAT(contentOf(file), HasSubstr(" krutil:IIPReply ")) << command.front();
    }
}

TEST(EvalTest, ATraceThatCannotBeOpenedIsAUsageErrorBeforeAnEngineIsStarted) {
    const Ran ran =
        runClient({"eval", "--trace-to", "/nonexistent/trace", "--engine", "echo started >&2; exec sleep 600", "1"});
    EXPECT_EQ(ran.err, "krutil: cannot open '/nonexistent/trace' for the trace: No such file or directory\n");
    EXPECT_EQ(ran.exitCode, 2);
}

TEST(EvalTest, ATraceThatFindsNoRoomEndsAndTheSessionGoesOn) {
    const Ran ran = runClient({"eval", "--trace-to", "/dev/full", "print('on')"});
    EXPECT_EQ(ran.out, "on\n");
    EXPECT_EQ(ran.err, "krutil: cannot write to '/dev/full': No space left on device; the trace ends here\n");
    EXPECT_EQ(ran.exitCode, 2);
}

TEST(EvalTest, ADiaryThatFindsNoRoomIsInTheExitCode) {
    const std::string engine = quotedForShell(enginePath()) + " --stdio --diary /dev/full";
    const Ran ran = runClient({"eval", "--diary", "--engine", engine, "print('on')"});
    EXPECT_EQ(ran.out, "on\n");
    EXPECT_EQ(ran.err,
              "krutil-qvm: cannot write to '/dev/full': No space left on device; text for it is lost until there is "
              "room\n"
              "krutil-qvm: '/dev/full' is not complete: 3 bytes are lost\n"
              "krutil: the engine exited with code 3 after it answered: a diary, log or recording of it is not "
              "complete\n");
    EXPECT_EQ(ran.exitCode, 3);
    const Ran failed = runClient({"eval", "--diary", "--engine", engine, "print('on')\n1 / 0"});
    EXPECT_EQ(failed.exitCode, 1);
}

TEST(EvalTest, ATraceIsCompleteUpToWhatEndedTheEngine) {
    const test_support::TemporaryDirectory directory;
    const std::string file = directory.file("trace");
    // Text of one write arrives as one event. What a print writes in two steps may not, when the machine is slow.
    const Ran ran = runClient({"eval", "--trace-to", file,
                               "import os, sys\nsys.stdout.write('last words\\n')\nsys.stdout.flush()\n"
                               "os.kill(os.getpid(), 9)"});
    EXPECT_EQ(ran.exitCode, 3);
    const std::string trace = contentOf(file);
    EXPECT_THAT(trace.substr(trace.rfind('\n', trace.size() - 2) + 1), HasSubstr("text: \"last words\\n\""));
}

TEST(EvalTest, TimingIsToldAfterTheAnswer) {
    const Ran ran = runClient({"eval", "--timing", "print(1)"});
    EXPECT_EQ(ran.out, "1\n");
    EXPECT_THAT(ran.err,
                ::testing::MatchesRegex("krutil: engine ready after [0-9.]+ ms, first output after [0-9.]+ ms, "
                                        "answered after [0-9.]+ ms\n"));
}

TEST(EvalTest, AnotherEngineCommandIsUsed) {
    const Ran ran =
        runClient({"eval", "--engine", "echo starting >&2; exec " + quotedForShell(enginePath()) + " --stdio",
                   "print('through a shell')"});
    EXPECT_EQ(ran.out, "through a shell\n");
    EXPECT_EQ(ran.err, "starting\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(EvalTest, AnEngineThatListensServesSeveralClientsEachWithItsOwnNames) {
    const test_support::TemporaryDirectory directory;
    Program engine({enginePath(), "--listen", directory.file("engine")});
    ASSERT_TRUE(engine.waitForErr("serving "));
    EXPECT_EQ(runClient({"eval", "--connect", directory.file("engine"), "x = 41; x + 1"}).out, "42\n");
    const Ran second = runClient({"eval", "--connect", directory.file("engine"), "'x' in globals()"});
    EXPECT_EQ(second.out, "False\n");
    EXPECT_EQ(second.err, "");
    EXPECT_EQ(second.exitCode, 0);
    engine.signal(SIGTERM);
    engine.finish();
}

TEST(EvalTest, CodeThatIsNotUtf8IsRefusedBeforeAnEngineIsStarted) {
    const test_support::TemporaryDirectory directory;
    write(directory.file("latin1.py"), "print('\xe4')\n");
    const Ran ran = runClient({"eval", "--engine", "echo started >&2", "-f", directory.file("latin1.py")});
    EXPECT_EQ(ran.err, "krutil: '" + directory.file("latin1.py") +
                           "' is not valid UTF-8 (at byte 7); convert it to UTF-8 first\n");
    EXPECT_EQ(ran.exitCode, 2);
    EXPECT_EQ(runClient({"eval", "-"}, {.input = "\xff"}).err,
              "krutil: standard input is not valid UTF-8 (at byte 0); convert it to UTF-8 first\n");
}

TEST(EvalTest, AFileThatIsNotThereIsAUsageError) {
    const Ran ran = runClient({"eval", "-f", "/nonexistent/code.py"});
    EXPECT_EQ(ran.err, "krutil: cannot open '/nonexistent/code.py': No such file or directory\n");
    EXPECT_EQ(ran.exitCode, 2);
}

TEST(EvalTest, CodeLargerThanTheEngineAcceptsIsRefusedHere) {
    const Ran ran =
        runClient({"eval", "--engine", quotedForShell(enginePath()) + " --stdio --limit-tagged-frame 1KiB", "-"},
                  {.input = "#" + std::string(2000, 'x')});
    EXPECT_THAT(ran.err, HasSubstr("its limit \"taggedFrame\" is 1024 bytes"));
    EXPECT_EQ(ran.exitCode, 2);
}

TEST(EvalTest, CtrlCEndsTheSessionAndTheEngine) {
    Program program(
        clientCommand({"eval", "import os, time\nprint(os.getpid(), flush=True)\nwhile True: time.sleep(1)"}));
    ASSERT_TRUE(program.waitForOut("\n"));
    program.signal(SIGINT);
    const Ran ran = program.finish();
    EXPECT_EQ(ran.exitCode, 6) << ran.err;
    EXPECT_EQ(ran.err, "krutil: cancelled\n");
    EXPECT_TRUE(waitUntilGone(std::stoi(ran.out)));
}

TEST(EvalTest, CtrlCWhileTheEngineStarts) {
    Program program(clientCommand({"eval", "--engine", "echo started >&2; exec sleep 600", "1"}));
    ASSERT_TRUE(program.waitForErr("started"));
    program.signal(SIGINT);
    const Ran ran = program.finish();
    EXPECT_EQ(ran.exitCode, 6) << ran.err;
    EXPECT_EQ(ran.err, "started\nkrutil: cancelled\n");
}

TEST(EvalTest, CtrlCWhileNobodyReadsTheOutput) {
    Program program(
        clientCommand({"eval", "import sys\nprint('ready', file=sys.stderr)\nwhile True: print('y' * 1000)"}));
    ASSERT_TRUE(program.waitForErr("ready"));
    program.signal(SIGINT);
    EXPECT_EQ(program.finish().exitCode, 6);
}

TEST(EvalTest, WithoutAStandardOutputTextIsAnErrorOfItsOwn) {
    const Ran ran = run({"/bin/sh", "-c", quotedForShell(clientCommand({}).front()) + " eval 1 >&- <&-"});
    EXPECT_EQ(ran.err, "krutil: cannot write to standard output: Bad file descriptor\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(EvalTest, AReaderThatGoesEndsTheProgramAsItEndsOthers) {
    Program program(clientCommand({"eval", "while True: print('y')"}));
    ASSERT_TRUE(program.waitForOut("y\n"));
    program.closeOut();
    const Ran ran = program.finish();
    EXPECT_EQ(ran.exitCode, 128 + SIGPIPE);
    EXPECT_EQ(ran.err, "");
}

}  // namespace
}  // namespace programs_test
