// Recorded sessions in which the engine's part is said to a client once more.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <csignal>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include "programs/support/Program.hpp"
#include "support/FileContent.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using test_support::contentOf;
using test_support::TemporaryDirectory;
using namespace std::string_literals;
using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::StartsWith;

// Lines that come one by one, while the program that reads them sees no end.
class Typist {
  public:
    explicit Typist(std::string pipe) : pipe_(std::move(pipe)) {
        EXPECT_EQ(::mkfifo(pipe_.c_str(), 0600), 0);
        // For reading, too: otherwise this would wait for the reader.
        end_.open(pipe_, std::ios::in | std::ios::out);
        EXPECT_TRUE(end_.is_open());
    }

    void type(const std::string& line) { end_ << line << std::flush; }

    // The command with the pipe as its standard input.
    std::vector<std::string> readBy(const std::vector<std::string>& command) const {
        std::string text = "exec";
        for (const std::string& word : command) {
            text += " " + quotedForShell(word);
        }
        return {"/bin/sh", "-c", text + " < " + quotedForShell(pipe_)};
    }

  private:
    const std::string pipe_;
    std::fstream end_{};
};

class ServedReplayTest : public ::testing::Test {
  protected:
    Ran record(std::vector<std::string> arguments, const Program::Options& how = {}) const {
        arguments.insert(arguments.end(), {"--record", file_});
        return runClient(arguments, how);
    }

    // A client whose engine is the recording. Its standard error has the report, and the exit code of the engine.
    std::vector<std::string> withRecordedEngine(std::vector<std::string> arguments,
                                                const std::string& options = {}) const {
        std::string command;
        for (const std::string& word : clientCommand({"replay", file_, "--serve"})) {
            command += quotedForShell(word) + " ";
        }
        arguments.insert(arguments.end(), {"--engine", command + options + "; echo engine exited with $? >&2"});
        return arguments;
    }

    Ran serve(const std::vector<std::string>& arguments, const Program::Options& how = {}) const {
        return runClient(withRecordedEngine(arguments), how);
    }

    const TemporaryDirectory directory_{};
    const std::string file_ = directory_.file("session.pcapng");
};

TEST_F(ServedReplayTest, ClientGetsWhatTheEngineSaid) {
    const std::vector<std::string> eval{"eval",
                                        "import sys, warnings\n"
                                        "for i in range(500): print(i, flush=i % 100 == 0)\n"
                                        "warnings.warn('careful')\n"
                                        "print('to stderr', file=sys.stderr)\n"
                                        "1 / 0"};
    const Ran recorded = record(eval);
    ASSERT_EQ(recorded.exitCode, 1) << recorded.err;
    const Ran served = serve(eval);
    EXPECT_EQ(served.out, recorded.out);
    EXPECT_EQ(served.err, recorded.err + "2 of 2 messages of the client as in the recording\nengine exited with 0\n");
    EXPECT_EQ(served.exitCode, 1);
}

TEST_F(ServedReplayTest, ArraysThatWereInSharedMemoryTravelAsBytes) {
    const std::string array = directory_.file("array.npy");
    const std::string before = directory_.file("before.npy");
    const std::string now = directory_.file("now.npy");
    ASSERT_EQ(runClient({"call", "numpy.arange", "150000.0", "-o", array}).exitCode, 0);
    ASSERT_EQ(record({"call", "numpy.add", array, array, "-o", before}).exitCode, 0);
    const Ran served = serve({"call", "numpy.add", array, array, "-o", now});
    EXPECT_EQ(served.err, "2 of 2 messages of the client as in the recording\nengine exited with 0\n");
    EXPECT_EQ(served.exitCode, 0);
    EXPECT_EQ(contentOf(now), contentOf(before));

    // Other elements, in frames of their own.
    ASSERT_EQ(runClient({"call", "numpy.ones", "150000", "-o", array}).exitCode, 0);
    const Ran differs = serve({"call", "numpy.add", array, array, "-o", now});
    EXPECT_THAT(
        differs.err,
        MatchesRegex("message 1 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\), frame 1: its 1200000 "
                     "bytes differ from byte 6 on\n"
                     "message 1 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\), frame 3: its 1200000 "
                     "bytes differ from byte 6 on\n"
                     "1 of 2 messages of the client as in the recording\n"
                     "engine exited with 1\n"));
    EXPECT_EQ(contentOf(now), contentOf(before));
}

TEST_F(ServedReplayTest, CancelNamesTheRequestThatItNamed) {
    const std::vector<std::string> eval{"eval", "import time; print('begun', flush=True); time.sleep(300)"};
    std::vector<std::string> recorded = eval;
    recorded.insert(recorded.end(), {"--record", file_});
    for (const auto& arguments : {recorded, withRecordedEngine(eval)}) {
        Program client(clientCommand(arguments));
        ASSERT_TRUE(client.waitForOut("begun\n"));
        client.signal(SIGINT);
        const Ran ran = client.finish();
        EXPECT_EQ(ran.exitCode, 6) << ran.err;
        if (arguments != recorded) {
            EXPECT_THAT(ran.err,
                        HasSubstr("3 of 3 messages of the client as in the recording\nengine exited with 0\n"));
        }
    }
}

TEST_F(ServedReplayTest, PromptsAreAnswered) {
    const std::vector<std::string> eval{"eval", "for i in range(2): print('got', input('name? '))"};
    std::vector<std::string> recorded = eval;
    recorded.insert(recorded.end(), {"--record", file_});
    Program::Options options;
    options.terminal = true;
    for (const auto& arguments : {recorded, withRecordedEngine(eval)}) {
        Program client(clientCommand(arguments), options);
        for (const char* name : {"Ada\r", "Ben\r"}) {
            ASSERT_TRUE(client.waitForOut("name? "));
            client.type(name);
        }
        const Ran ran = client.finish();
        EXPECT_THAT(ran.out, HasSubstr("got Ada"));
        EXPECT_THAT(ran.out, HasSubstr("got Ben"));
        EXPECT_EQ(ran.exitCode, 0) << ran.err;
        if (arguments != recorded) {
            EXPECT_THAT(ran.err,
                        HasSubstr("4 of 4 messages of the client as in the recording\nengine exited with 0\n"));
        }
    }
}

TEST_F(ServedReplayTest, SaysWhereTheClientDiffers) {
    ASSERT_EQ(record({"eval", "print('0x123456')"}).exitCode, 0);
    // What looks like an address counts in what a client says.
    const Ran served = serve({"eval", "print('0x123457')"});
    EXPECT_EQ(served.out, "0x123456\n");
    EXPECT_EQ(served.exitCode, 0);
    EXPECT_THAT(served.err,
                MatchesRegex("message 1 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\), frame 1: "
                             "modified: cmd: .*0x123456.* -> .*0x123457.*\n"
                             "message 1 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\), frame 2: "
                             "modified: name: .*0x123456.* -> .*0x123457.*\n"
                             "1 of 2 messages of the client as in the recording\n"
                             "engine exited with 1\n"));
}

TEST_F(ServedReplayTest, SessionEndsInOrderWhereTheRecordingDoesNotTellHowToGoOn) {
    Program::Options lines;
    lines.input = "1 + 1\n";
    ASSERT_EQ(record({"repl"}, lines).exitCode, 0);
    lines.input = "1 + 1\n2 + 2\n";
    const Ran served = serve({"repl"}, lines);
    EXPECT_EQ(served.out, "2\n");
    EXPECT_THAT(served.err, AllOf(MatchesRegex("message 2 of the client, goodbye \\(byte [0-9]+\\): got "
                                               "krutil:IIPEnqueueMessage\n"
                                               "1 of 2 messages of the client as in the recording\n(.*\n)+"),
                                  HasSubstr("krutil: the engine ended the session before it answered\n")));
    EXPECT_EQ(served.exitCode, 3);
}

TEST_F(ServedReplayTest, ClientThatSaysNothingIsGivenUp) {
    ASSERT_EQ(record({"eval", "1"}).exitCode, 0);
    Typist typist(directory_.file("lines"));
    Program client(typist.readBy(clientCommand(withRecordedEngine({"repl"}, "--patience 0.2"))));
    const Ran ran = client.finish();
    EXPECT_THAT(ran.err,
                MatchesRegex("message 1 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\): got nothing "
                             "in time\n"
                             "0 of 2 messages of the client as in the recording\n(.*\n)*"));
}

TEST_F(ServedReplayTest, ClientThatGoesIsLost) {
    Program::Options lines;
    lines.input = "1 + 1\n2 + 2\n";
    ASSERT_EQ(record({"repl"}, lines).exitCode, 0);
    Typist typist(directory_.file("lines"));
    Program client(typist.readBy(clientCommand(withRecordedEngine({"repl"}))));
    typist.type("1 + 1\n");
    ASSERT_TRUE(client.waitForOut("2\n"));
    client.signal(SIGKILL);
    EXPECT_THAT(client.finish().err,
                MatchesRegex("message 2 of the client, krutil:IIPEnqueueMessage \\(byte [0-9]+\\): "
                             "got the end of its stream\n"
                             "1 of 3 messages of the client as in the recording\n"
                             "engine exited with 3\n"));
}

TEST_F(ServedReplayTest, SessionThatWasLostIsLostAgain) {
    const std::vector<std::string> eval{"eval", "import os\nprint('last words', flush=True)\nos._exit(7)"};
    ASSERT_EQ(record(eval).exitCode, 3);
    const Ran served = serve(eval);
    EXPECT_EQ(served.out, "last words\n");
    EXPECT_THAT(served.err, HasSubstr("1 of 1 message of the client as in the recording\nengine exited with 0\n"));
    EXPECT_EQ(served.exitCode, 3);
}

TEST_F(ServedReplayTest, RecordingOfAnEngineServesAsWell) {
    const Ran recorded = runClient(
        {"eval", "6 * 7", "--engine", quotedForShell(enginePath()) + " --stdio --record " + quotedForShell(file_)});
    ASSERT_EQ(recorded.exitCode, 0) << recorded.err;
    const Ran served = serve({"eval", "6 * 7"});
    EXPECT_EQ(served.out, "42\n");
    EXPECT_EQ(served.err, "2 of 2 messages of the client as in the recording\nengine exited with 0\n");
}

TEST_F(ServedReplayTest, FeaturesAreSettledAsTheyWere) {
    ASSERT_EQ(record({"eval", "1"}).exitCode, 0);
    const Ran served = serve({"eval", "1", "--no-zero-copy"});
    // What the other end says may come before or behind it.
    EXPECT_THAT(served.err, HasSubstr("krutil: the session is refused: feature \"ZEROCOPY\": the client accepts "
                                      "\"disable\", the engine \"enable\""));
    EXPECT_EQ(served.exitCode, 5);
}

TEST_F(ServedReplayTest, RefusalOfTheClientIsShown) {
    ASSERT_EQ(record({"eval", "1"}).exitCode, 0);
    Program::Options client;
    // A first message without a body, and a verdict.
    client.input = "\x89KRUTIL\n\x01\0\0\0\0\0\0\0\x04\0\0\0\x1a\x02no"s;
    const Ran ran = run(clientCommand({"replay", file_, "--serve"}), client);
    EXPECT_EQ(ran.err, "krutil: the client refuses the session: no\n");
    EXPECT_EQ(ran.exitCode, 5);
}

TEST_F(ServedReplayTest, RecordingsThatCannotBeServedAreRefused) {
    const auto refusal = [this] { return run(clientCommand({"replay", file_, "--serve"})); };
    ASSERT_EQ(record({"eval", "print('x' * 1000)", "--record-snap", "40"}).exitCode, 0);
    EXPECT_THAT(refusal().err, AllOf(StartsWith("krutil: cannot replay '" + file_ + "': byte "),
                                     EndsWith("; record without --record-snap, and with a larger --record-size if "
                                              "there is one\n")));
    EXPECT_EQ(refusal().exitCode, 2);

    ASSERT_EQ(record({"eval", "1"}).exitCode, 0);
    const std::string once = contentOf(file_);
    std::ofstream(file_, std::ios::binary | std::ios::app) << once;
    EXPECT_EQ(refusal().err, "krutil: cannot replay '" + file_ + "' to a client: expected one session, got 2\n");
    EXPECT_EQ(refusal().exitCode, 2);

    ASSERT_EQ(record({"eval", "for i in range(40): print('x' * 40000, flush=True)", "--record-size", "1M"}).exitCode,
              0);
    EXPECT_EQ(refusal().err, "krutil: cannot replay '" + file_ +
                                 "' to a client: expected a session from its beginning, got the later part of one; "
                                 "record with a larger --record-size\n");
    EXPECT_EQ(refusal().exitCode, 2);
}

TEST_F(ServedReplayTest, WhoIsNoClientIsNamed) {
    ASSERT_EQ(record({"eval", "1"}).exitCode, 0);
    Program::Options input;
    const Ran silent = run(clientCommand({"replay", file_, "--serve"}), input);
    EXPECT_EQ(silent.err, "krutil: the client sent no first message: its stream ended\n");
    EXPECT_EQ(silent.exitCode, 3);
    input.input = "GET / HTTP/1.1\r\n";
    const Ran foreign = run(clientCommand({"replay", file_, "--serve"}), input);
    EXPECT_EQ(foreign.err, "krutil: the client does not speak this protocol: it began with \"GET / HTTP/1.1\\r\"\n");
    EXPECT_EQ(foreign.exitCode, 4);
    input.terminal = true;
    EXPECT_THAT(run(clientCommand({"replay", file_, "--serve"}), input).err,
                StartsWith("krutil: with --serve, standard input and output carry the session with a client: "));
}

}  // namespace
}  // namespace programs_test
