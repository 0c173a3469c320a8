// Recorded sessions that are said to an engine once more.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using test_support::TemporaryDirectory;
using ::testing::AllOf;
using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::StartsWith;

class ReplayTest : public ::testing::Test {
  protected:
    void record(std::vector<std::string> arguments, int exitCode = 0) const {
        arguments.insert(arguments.end(), {"--record", file_});
        const Ran ran = runClient(arguments);
        ASSERT_EQ(ran.exitCode, exitCode) << ran.err;
    }

    Ran replay(std::vector<std::string> options = {}, const Program::Options& how = {}) const {
        options.insert(options.begin(), {"replay", file_});
        return run(clientCommand(options), how);
    }

    const TemporaryDirectory directory_{};
    const std::string file_ = directory_.file("session.pcapng");
};

TEST_F(ReplayTest, EngineAnswersAsItDid) {
    // Text in pieces, an address, a warning with its time, an error with its stack.
    record({"eval",
            "import warnings, sys\n"
            "for i in range(2000): print(i, flush=i % 100 == 0)\n"
            "print(object())\n"
            "warnings.warn('careful')\n"
            "print('to stderr', file=sys.stderr)\n"
            "1 / 0"},
           1);
    const Ran ran = replay();
    EXPECT_EQ(ran.err, "");
    EXPECT_EQ(ran.out, "1 of 1 request answered as in the recording\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST_F(ReplayTest, ContentsOfSharedMemoryAreSaidAsBytes) {
    const std::string array = directory_.file("array.npy");
    ASSERT_EQ(runClient({"call", "numpy.arange", "150000.0", "-o", array}).exitCode, 0);
    record({"call", "numpy.add", array, array});
    const Ran ran = replay();
    EXPECT_EQ(ran.out, "1 of 1 request answered as in the recording\n") << ran.err;
    EXPECT_EQ(ran.exitCode, 0);
}

TEST_F(ReplayTest, SaysWhereAnswersDiffer) {
    Program::Options before;
    before.environment = {"KRUTIL_TEST_WORD=before"};
    const Ran recorded =
        runClient({"eval", "import os; print(os.environ['KRUTIL_TEST_WORD'])", "--record", file_}, before);
    ASSERT_EQ(recorded.exitCode, 0) << recorded.err;
    Program::Options now;
    now.environment = {"KRUTIL_TEST_WORD=now"};
    const Ran ran = replay({}, now);
    EXPECT_EQ(ran.err, "");
    EXPECT_THAT(ran.out, MatchesRegex("request 1 on stream 1 \\(krutil:IIPEnqueueMessage\\)\n"
                                      "  message 2, krutil:TextBaseEvent \\(byte [0-9]+\\), frame 1: "
                                      "modified: text: \"before\\\\n\" -> \"now\\\\n\"\n"
                                      "0 of 1 request answered as in the recording\n"));
    EXPECT_EQ(ran.exitCode, 1);
}

TEST_F(ReplayTest, MissingMessagesAreNamed) {
    Program::Options options;
    options.environment = {"KRUTIL_TEST_COUNT=1000"};
    const Ran recorded = runClient({"eval",
                                    "import os, warnings\nfor i in range(int(os.environ['KRUTIL_TEST_COUNT']) // 500): "
                                    "warnings.warn(str(i))",
                                    "--record", file_},
                                   options);
    ASSERT_EQ(recorded.exitCode, 0) << recorded.err;
    options.environment = {"KRUTIL_TEST_COUNT=500"};
    const Ran ran = replay({"--patience", "2"}, options);
    EXPECT_THAT(ran.out, HasSubstr(": got krutil:IIPCompletedEvent\n"));
    EXPECT_EQ(ran.exitCode, 1) << ran.err;
}

TEST_F(ReplayTest, AnswersAtPromptsWaitForTheirPrompt) {
    Program::Options options;
    options.terminal = true;
    Program client(clientCommand({"eval", "for i in range(3): print('got', input('name? '))", "--record", file_}),
                   options);
    for (const char* name : {"Ada\r", "Ben\r", "Cay\r"}) {
        ASSERT_TRUE(client.waitForOut("name? "));
        client.type(name);
    }
    ASSERT_EQ(client.finish().exitCode, 0);
    const Ran ran = replay();
    EXPECT_EQ(ran.out, "4 of 4 requests answered as in the recording\n") << ran.err;
    EXPECT_EQ(ran.exitCode, 0);
}

TEST_F(ReplayTest, ListeningEngineIsReplayedTo) {
    record({"eval", "6 * 7"});
    const std::string socket = directory_.file("engine.sock");
    Program listening({enginePath(), "--listen", socket});
    ASSERT_TRUE(listening.waitForErr("serving "));
    const Ran ran = replay({"--connect", socket});
    EXPECT_EQ(ran.out, "1 of 1 request answered as in the recording\n") << ran.err;
    EXPECT_EQ(ran.exitCode, 0);
}

TEST_F(ReplayTest, RecordingOfAnEngineServesAsWell) {
    const Ran recorded = runClient(
        {"eval", "6 * 7", "--engine", quotedForShell(enginePath()) + " --stdio --record " + quotedForShell(file_)});
    ASSERT_EQ(recorded.exitCode, 0) << recorded.err;
    EXPECT_EQ(replay().out, "1 of 1 request answered as in the recording\n");
}

TEST_F(ReplayTest, SessionThatWasLostMayGoOn) {
    record({"eval", "import os, sys\nprint('last words', flush=True)\nos._exit(7)"}, 3);
    const Ran ran = replay();
    EXPECT_EQ(ran.out, "1 of 1 request answered as in the recording\n") << ran.err;
    EXPECT_EQ(ran.exitCode, 0);
}

TEST_F(ReplayTest, BeginningsOfFramesAreRefused) {
    record({"eval", "print('x' * 1000)", "--record-snap", "40"});
    const Ran ran = replay();
    EXPECT_EQ(ran.out, "");
    EXPECT_THAT(ran.err, AllOf(StartsWith("krutil: cannot replay '" + file_ + "': byte "),
                               EndsWith("bytes of a frame, got 40; record without --record-snap, and with a larger "
                                        "--record-size if there is one\n")));
    EXPECT_EQ(ran.exitCode, 2);
}

TEST_F(ReplayTest, EngineThatIsNoneIsNamed) {
    record({"eval", "1"});
    const Ran printing = replay({"--engine", "echo Welcome to this machine; cat"});
    EXPECT_EQ(printing.err,
              "krutil: the engine does not speak this protocol: it began with \"Welcome to this machine\"\n");
    EXPECT_EQ(printing.exitCode, 4);
    const Ran silent = replay({"--engine", "exit 0"});
    EXPECT_EQ(silent.err, "krutil: the engine sent no first message: its stream ended\n");
    EXPECT_EQ(silent.exitCode, 3);
}

TEST_F(ReplayTest, WhatIsNoRecordingIsRefused) {
    const Ran ran = replay();
    EXPECT_EQ(ran.err, "krutil: cannot read '" + file_ + "': No such file or directory\n");
    EXPECT_EQ(ran.exitCode, 2);
}

}  // namespace
}  // namespace programs_test
