// How sessions with an engine end, and what happens to what is on its way then.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "common/KrutilSession.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using krutil::cmddistributor::inCOMM_ERROR;
using krutil::cmddistributor::inRUNTIME_ERROR;
using session::SessionEnd;
using testing::ElementsAre;
using testing::HasSubstr;

constexpr char sessionEnded[] = "The session ended before this request was started.";

// The shutdown event is the last thing that came.
void expectShutdown(EngineSession& engine) {
    EXPECT_EQ(engine.client.awaitEnd().reason, SessionEnd::Reason::Finished);
    ASSERT_FALSE(engine.client.background().empty());
    EXPECT_EQ(engine.client.background().back().kind, "QVMShutdownEvent");
    EXPECT_EQ(engine.process.wait(), 0);
}

void expectDiscarded(const Evaluation& result, const std::string& why) {
    EXPECT_TRUE(result.discarded());
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inCOMM_ERROR);
    EXPECT_EQ(result.errorText(), why);
}

TEST(SessionEndTest, GoodbyeAtIdleEndsInTheShutdownEvent) {
    EngineSession engine;
    engine.client.eval("1");
    engine.client.session().sayGoodbye();
    expectShutdown(engine);
    EXPECT_EQ(engine.client.background().size(), 1U);
    EXPECT_EQ(engine.process.stderrText(), "");
}

TEST(SessionEndTest, GoodbyeLetsAllThatCameBeforeItRun) {
    EngineSession engine;
    Gate gate;
    const IDType running = engine.client.enqueue("print('on')\n" + gate.wait() + "\nprint('done')");
    engine.client.awaitText("on");
    const IDType waiting = engine.client.enqueue("print('runs too')");
    engine.client.session().sayGoodbye();
    gate.open();
    EXPECT_EQ(engine.client.await(running).output(), "on\ndone\n");
    const Evaluation result = engine.client.await(waiting);
    EXPECT_EQ(result.output(), "runs too\n");
    EXPECT_FALSE(result.error);
    expectShutdown(engine);
}

TEST(SessionEndTest, RequestsAndAGoodbyeThatComeTogetherAreAllAnswered) {
    EngineSession engine;
    std::vector<IDType> ids;
    for (int i = 0; i < 100; ++i) {
        ids.push_back(engine.client.enqueue("print(" + std::to_string(i) + ")"));
    }
    engine.client.session().sayGoodbye();
    for (int i = 0; i < 100; ++i) {
        EXPECT_EQ(engine.client.await(ids[static_cast<std::size_t>(i)]).output(), std::to_string(i) + "\n");
    }
    expectShutdown(engine);
}

TEST(SessionEndTest, WhatNothingTakesAfterAGoodbyeIsDiscarded) {
    EngineSession engine;
    EvalOptions atDebugPrompt;
    atDebugPrompt.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_DEBUG_PROMPT;
    const IDType never = engine.client.enqueue("print('never')", atDebugPrompt);
    const IDType later = engine.client.enqueue("print('later')");
    engine.client.session().sayGoodbye();
    EXPECT_EQ(engine.client.await(later).output(), "later\n");
    const Evaluation result = engine.client.await(never);
    EXPECT_THAT(result.kinds(), ElementsAre("IIPDiscardedEvent", "LastIIPEvent"));
    expectDiscarded(result, sessionEnded);
    expectShutdown(engine);
}

TEST(SessionEndTest, SystemExitAfterAGoodbyeDiscardsWhatWaits) {
    EngineSession engine;
    Gate gate;
    const IDType running = engine.client.enqueue(gate.wait() + "\nraise SystemExit");
    const IDType waiting = engine.client.enqueue("print('never')");
    engine.client.session().sayGoodbye();
    gate.open();
    EXPECT_FALSE(engine.client.await(running).error);
    expectDiscarded(engine.client.await(waiting), sessionEnded);
    expectShutdown(engine);
}

TEST(SessionEndTest, SystemExitWithoutAFailureIsASuccess) {
    for (const char* code : {"import sys\nsys.exit()", "raise SystemExit", "raise SystemExit(0)", "exit(None)",
                             "class E(SystemExit): pass\nraise E"}) {
        EngineSession engine;
        const Evaluation result = engine.client.eval(code);
        EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent")) << code;
        EXPECT_FALSE(result.error) << code;
        expectShutdown(engine);
    }
}

TEST(SessionEndTest, SystemExitWithAFailureIsARuntimeError) {
    for (const auto& [code, text] :
         {std::pair("raise SystemExit(3)", "3"), std::pair("raise SystemExit('why')", "why"),
          std::pair("class E(SystemExit): pass\nraise E(1 << 80)", "1208925819614629174706176")}) {
        EngineSession engine;
        const Evaluation result = engine.client.eval(std::string("print('x')\n") + code);
        EXPECT_EQ(result.output(), "x\n");
        ASSERT_TRUE(result.error);
        EXPECT_EQ(result.error->getExecutionStatus(), inRUNTIME_ERROR);
        EXPECT_EQ(result.errorId(), "SystemExit");
        EXPECT_EQ(result.errorText(), text);
        expectShutdown(engine);
    }
}

TEST(SessionEndTest, SystemExitDiscardsWhatWaits) {
    EngineSession engine;
    Gate gate;
    const IDType running = engine.client.enqueue("print('on')\n" + gate.wait() + "\nraise SystemExit");
    engine.client.awaitText("on");
    const IDType waiting = engine.client.enqueue("1");
    // Messages are taken in order, so the answer to this one shows that the request waits.
    engine.client.cancel(IDType::random(), false);
    gate.open();
    EXPECT_FALSE(engine.client.await(running).error);
    expectDiscarded(engine.client.await(waiting), sessionEnded);
    expectShutdown(engine);
}

TEST(SessionEndTest, SystemExitOfAThreadEndsOnlyTheThread) {
    EngineSession engine;
    engine.client.eval("import threading\nt = threading.Thread(target=exit)\nt.start()\nt.join()");
    EXPECT_EQ(engine.client.eval("1").shown(), "1\n");
}

TEST(SessionEndTest, EndRunsExitFunctionsAndCompletesFiles) {
    test_support::TemporaryDirectory directory;
    EngineSession engine;
    engine.client.eval("import atexit\natexit.register(print, 'leaving')\nf = open('" + directory.file("f") +
                       "', 'w')\nf.write('kept')");
    engine.client.goodbye();
    EXPECT_EQ(engine.client.backgroundText(), "leaving\n");
    EXPECT_EQ(engine.client.background().back().kind, "QVMShutdownEvent");
    EXPECT_EQ(engine.process.wait(), 0);
    EXPECT_EQ(contentsOf(directory.file("f")), "kept");
}

TEST(SessionEndTest, ThreadsThatGoOnDoNotKeepTheSessionOpen) {
    EngineSession engine;
    engine.client.eval(
        "import threading\n"
        "def chatter():\n"
        "    while True: print('still here')\n"
        "threading.Thread(target=chatter, daemon=True).start()");
    engine.client.awaitText("still here");
    engine.client.session().sayGoodbye();
    expectShutdown(engine);
    EXPECT_EQ(engine.process.stderrText(), "");
}

TEST(SessionEndTest, LostClientEndsRunningCode) {
    EngineSession engine;
    engine.client.enqueue("print('running')\nwhile True: pass");
    engine.client.awaitText("running");
    engine.client.session().close();
    EXPECT_EQ(engine.process.wait(), 3);
    EXPECT_THAT(engine.process.stderrText(), HasSubstr("without the client's goodbye"));
}

TEST(SessionEndTest, LostClientEndsAnIdleEngine) {
    EngineSession engine;
    engine.client.eval("1");
    engine.client.session().close();
    EXPECT_EQ(engine.process.wait(), 3);
}

TEST(SessionEndTest, EngineThatIsKilledIsALostSession) {
    EngineSession engine;
    const IDType id = engine.client.enqueue("import os\nos.abort()");
    EXPECT_EQ(engine.client.awaitEnd().reason, SessionEnd::Reason::Lost);
    EXPECT_THROW(engine.client.await(id), std::runtime_error);
    EXPECT_EQ(engine.process.wait(), -SIGABRT);
}

TEST(SessionEndTest, GarbageInsteadOfAHandshakeIsAViolation) {
    EngineProcess engine({"--stdio"});
    const int connection = engine.connection();
    const std::string garbage = "GET / HTTP/1.1\r\nHost: here\r\n\r\n";
    EXPECT_EQ(::write(connection, garbage.data(), garbage.size()), static_cast<ssize_t>(garbage.size()));
    EXPECT_EQ(engine.wait(), 4);
    EXPECT_THAT(engine.stderrText(), testing::StartsWith("krutil-qvm: "));
    ::close(connection);
}

TEST(SessionEndTest, ClientThatLeavesBeforeTheHandshakeIsLost) {
    EngineProcess engine({"--stdio"});
    ::close(engine.connection());
    EXPECT_EQ(engine.wait(), 3);
}

TEST(SessionEndTest, SilentClientIsGivenUp) {
    EngineProcess engine({"--stdio", "--handshake-timeout", "0.01"});
    EXPECT_EQ(engine.wait(), 3);
}

TEST(SessionEndTest, WrongVersionIsRefused) {
    EngineProcess engine({"--stdio"});
    session::SessionConfig config = apps::krutilSession(session::Role::Client);
    config.version = {2, 0};
    const int connection = engine.connection();
    EXPECT_THROW(session::Session::open(connection, connection, std::move(config)), session::HandshakeRefused);
    EXPECT_EQ(engine.wait(), 5);
    EXPECT_THAT(engine.stderrText(), HasSubstr("version"));
}

TEST(EngineUsageTest, SizesAreNeitherNegativeNorTooLargeToHold) {
    for (const std::string size : {"-1", "0", "99999999999999999999"}) {
        EngineProcess engine({"--stdio", "--max-queued-bytes", size});
        EXPECT_EQ(engine.wait(), 2);
        EXPECT_THAT(engine.stderrText(), HasSubstr("--max-queued-bytes: expected a number from 1 to"));
        EXPECT_THAT(engine.stderrText(), HasSubstr("got " + size + "\n"));
    }
}

TEST(EngineUsageTest, ExactlyOnePlaceToServe) {
    for (const std::vector<std::string>& arguments :
         {std::vector<std::string>{}, {"--stdio", "--listen", "x"}, {"--listen", ""}}) {
        EngineProcess engine(arguments);
        EXPECT_EQ(engine.wait(), 2);
        EXPECT_THAT(engine.stderrText(), HasSubstr("Exactly one of --stdio, --listen and --listen-fds is required"));
    }
    EngineProcess unknown({"--nonsense"});
    EXPECT_EQ(unknown.wait(), 2);
}

TEST(EngineUsageTest, FileThatCannotBeWrittenIsNamed) {
    EngineProcess engine({"--stdio", "--log", "/nonexistent/log"});
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(), "krutil-qvm: Cannot append to \"/nonexistent/log\": No such file or directory\n");
}

TEST(QueueBoundTest, RequestBeyondTheCountIsAnsweredAtOnce) {
    EngineSession engine({"--max-queued", "1"});
    Gate gate;
    const IDType running = engine.client.enqueue("print('on')\n" + gate.wait());
    engine.client.awaitText("on");
    const IDType waiting = engine.client.enqueue("2");
    const std::string full =
        "The engine's queue is full: 1 requests wait already, which is the engine's bound. Send this one again when "
        "some are done.";
    expectDiscarded(engine.client.eval("3"), full);
    expectDiscarded(engine.client.eval("4"), full);
    gate.open();
    engine.client.await(running);
    EXPECT_EQ(engine.client.await(waiting).shown(), "2\n");
    EXPECT_EQ(engine.client.eval("5").shown(), "5\n");
}

TEST(QueueBoundTest, RequestBeyondTheBytesIsAnsweredAtOnce) {
    EngineSession engine({"--max-queued-bytes", "10KiB"});
    const Evaluation result = engine.client.eval("'" + std::string(10'000, 'x') + "'");
    expectDiscarded(result,
                    "The engine's queue is full: with this request, those that wait would hold more than 10240 bytes, "
                    "which is the engine's bound. Send it again when some are done, or send less at a time.");
    EXPECT_EQ(engine.client.eval("5").shown(), "5\n");
}

TEST(QueueBoundTest, RequestsRunInTheOrderOfTheirArrival) {
    EngineSession engine;
    std::vector<IDType> ids;
    for (int i = 0; i < 200; ++i) {
        ids.push_back(engine.client.enqueue("print(" + std::to_string(i) + ")"));
    }
    for (int i = 0; i < 200; ++i) {
        EXPECT_EQ(engine.client.await(ids[static_cast<std::size_t>(i)]).output(), std::to_string(i) + "\n");
    }
}

}  // namespace
}  // namespace qvm_test
