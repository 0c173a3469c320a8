// Engines that cannot be had, or that go: the client says what happened and never hangs.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <fstream>
#include <nlohmann/json.hpp>

#include "programs/support/Program.hpp"
#include "support/TemporaryDirectory.hpp"

namespace programs_test {
namespace {

using ::testing::AnyOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

TEST(LostEngineTest, KilledInTheMiddle) {
    const Ran ran = runClient({"eval", "print('so far', flush=True)\nimport os\nos.kill(os.getpid(), 9)"});
    EXPECT_EQ(ran.out, "so far\n");
    EXPECT_EQ(ran.err, "krutil: the engine was killed by signal 9 (Killed) before it answered\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, KilledInTheMiddleOfAConnection) {
    const test_support::TemporaryDirectory directory;
    Program engine({enginePath(), "--listen", directory.file("engine")});
    ASSERT_TRUE(engine.waitForErr("serving "));
    const Ran ran = runClient({"eval", "--connect", directory.file("engine"), "import os\nos.kill(os.getpid(), 9)"});
    EXPECT_THAT(ran.err, StartsWith("krutil: the engine was lost before it answered: "));
    EXPECT_EQ(ran.exitCode, 3);
    // One session's end is not another's.
    EXPECT_EQ(runClient({"eval", "--connect", directory.file("engine"), "1"}).out, "1\n");
}

TEST(LostEngineTest, ExitsInTheMiddle) {
    const Ran ran = runClient({"eval", "import os\nos._exit(17)"});
    EXPECT_EQ(ran.err, "krutil: the engine exited with code 17 before it answered\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, TheFailureIsAnObjectToo) {
    const Ran ran = runClient({"eval", "--json", "import os\nos.kill(os.getpid(), 9)"});
    const std::string last = ran.out.substr(ran.out.rfind('\n', ran.out.size() - 2) + 1);
    EXPECT_EQ(nlohmann::json::parse(last),
              nlohmann::json({{"event", "failure"},
                              {"exitCode", 3},
                              {"text", "the engine was killed by signal 9 (Killed) before it answered"}}));
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, ExitsAtOnce) {
    const Ran ran = runClient({"eval", "--engine", "exit 7", "1"});
    EXPECT_EQ(ran.err, "krutil: the engine exited with code 7 before the session began\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, IsNoCommand) {
    const Ran ran = runClient({"eval", "--engine", "no-such-command", "1"});
    EXPECT_THAT(ran.err,
                HasSubstr("krutil: the engine exited with code 127 (the shell did not find the command) before "
                          "the session began\n"));
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, ShowsSomethingElseThanASession) {
    const Ran ran = runClient({"eval", "--engine", "echo hello", "1"});
    EXPECT_EQ(
        ran.err,
        "krutil: the command of --engine printed \"hello\\n\" before the session began. Perhaps a start-up script of "
        "the shell there, such as .bashrc, prints on standard output: let it do so in interactive shells only, or "
        "on standard error\n");
    EXPECT_EQ(ran.exitCode, 4);
}

TEST(LostEngineTest, IsPrecededByTextOfAScript) {
    const Ran ran =
        runClient({"eval", "--engine",
                   "printf 'Welcome,\\033[31m friend\\n'; exec " + quotedForShell(enginePath()) + " --stdio", "1"});
    EXPECT_EQ(
        ran.err,
        "krutil: the command of --engine printed \"Welcome,\\x1b[31m friend\\n\" before the session began. Perhaps "
        "a start-up script of the shell there, such as .bashrc, prints on standard output: let it do so in "
        "interactive shells only, or on standard error\n");
    EXPECT_EQ(ran.exitCode, 4);
}

TEST(LostEngineTest, IsBehindARelayThatCuts) {
    // The shell is the relay: it ends well, though the session did not.
    const Ran ran = runClient({"eval", "--engine", quotedForShell(enginePath()) + " --stdio; exit 0",
                               "print('so far', flush=True)\nimport os\nos._exit(9)"});
    EXPECT_EQ(ran.out, "so far\n");
    EXPECT_EQ(
        ran.err,
        "krutil: the stream to the engine was cut before it answered: the stream ended between two messages, before "
        "the engine's shutdown event; the command of --engine exited with code 0, as relays do\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, IsAClientItself) {
    const Ran ran = runClient({"eval", "--engine", "cat", "1"});
    EXPECT_EQ(ran.err,
              "krutil: the session is refused: role: a session needs a client and an engine, this end is a client, the "
              "other end is a client\n");
    EXPECT_EQ(ran.exitCode, 5);
}

TEST(LostEngineTest, SaysNothing) {
    const Ran ran = runClient({"eval", "--engine", "exec sleep 600", "--handshake-timeout", "0.05", "1"});
    EXPECT_EQ(ran.err,
              "krutil: the handshake timed out after 50 milliseconds: 0 of 16 bytes of the peer's first message had "
              "arrived\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, IsNotListening) {
    const test_support::TemporaryDirectory directory;
    const Ran ran = runClient({"eval", "--connect", directory.file("nobody"), "1"});
    EXPECT_EQ(ran.err, "krutil: cannot connect to '" + directory.file("nobody") + "': No such file or directory\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineForkTest, LeavesItsStreamToAnotherProcess) {
    // The shell that was to be the engine ends; a process that it started holds the stream and says nothing.
    const Ran ran = runClient({"eval", "--engine", fakeEngine("leaves-its-stream"), "1"});
    EXPECT_EQ(ran.err, "krutil: the engine exited with code 4 before it answered\n");
    EXPECT_EQ(ran.exitCode, 3);
}

TEST(LostEngineTest, DoesNotEndAfterTheAnswer) {
    const Ran ran = runClient({"eval", "--engine", "exec " + fakeEngine("ignores-goodbye"), "1"});
    EXPECT_EQ(ran.err, "krutil: the engine did not end after it answered, and was killed\n");
    EXPECT_EQ(ran.exitCode, 0);
}

TEST(LostClientTest, IsTheEndOfItsEngine) {
    Program program(
        clientCommand({"eval", "import os, time\nprint(os.getpid(), flush=True)\nwhile True: time.sleep(1)"}));
    ASSERT_TRUE(program.waitForOut("\n"));
    program.signal(SIGKILL);
    const Ran ran = program.finish();
    EXPECT_EQ(ran.exitCode, 128 + SIGKILL);
    EXPECT_TRUE(waitUntilGone(std::stoi(ran.out)));
}

// A whole session is relayed once to know its length, then cut at as many places.
class CutSessionTest : public ::testing::TestWithParam<unsigned> {
  protected:
    static constexpr unsigned cuts = 14;
    // One text in one piece: the two sessions must be equally long, and texts that follow each other may share an
    // event.
    static constexpr const char* code = "__import__('sys').stdout.write('a' * 400 + '\\n') and None";

    static std::string relay(const std::string& howMuch) {
        return "exec " + fakeEngine("cut " + howMuch + " " + quotedForShell(enginePath()) + " --stdio");
    }
};

TEST_P(CutSessionTest, IsAnEngineThatWasLost) {
    const test_support::TemporaryDirectory directory;
    ASSERT_EQ(runClient({"eval", "--engine", relay("count " + quotedForShell(directory.file("count"))), code}).exitCode,
              0);
    unsigned long length = 0;
    std::ifstream(directory.file("count")) >> length;
    ASSERT_GT(length, 500U);
    // The shutdown event that ends the session is no part of an answer, and identifiers vary by a few bytes.
    const unsigned long answer = length - 100;
    const unsigned long cut = answer * GetParam() / (cuts - 1);
    const Ran ran = runClient({"eval", "--engine", relay(std::to_string(cut)), code});
    EXPECT_THAT(ran.err, AnyOf("krutil: the engine exited with code 9 before it answered\n",
                               "krutil: the engine exited with code 9 before the session began\n"));
    EXPECT_EQ(ran.exitCode, 3);
}

INSTANTIATE_TEST_SUITE_P(EachPlace, CutSessionTest, ::testing::Range(0U, 14U));

}  // namespace
}  // namespace programs_test
