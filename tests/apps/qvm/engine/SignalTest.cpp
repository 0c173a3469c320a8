// Signals that whoever started an engine sends to its process.
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

void expectEndOf(const std::string& code, int number) {
    EngineSession busy;
    const IDType id = busy.client.enqueue(code);
    busy.client.awaitText("running");
    busy.process.signal(number);
    EXPECT_EQ(busy.client.awaitEnd().reason, session::SessionEnd::Reason::Lost) << number;
    EXPECT_THROW(busy.client.await(id), std::runtime_error) << number;
    EXPECT_EQ(busy.process.wait(), -number);
}

TEST(EngineSignalTest, TerminationEndsAnEngineWithoutAShutdownEvent) {
    for (const int number : {SIGTERM, SIGHUP}) {
        EngineSession idle;
        idle.client.eval("1");
        idle.process.signal(number);
        EXPECT_EQ(idle.client.awaitEnd().reason, session::SessionEnd::Reason::Lost) << number;
        EXPECT_TRUE(idle.client.background().empty()) << number;
        EXPECT_EQ(idle.process.wait(), -number);

        expectEndOf("import time\nprint('running')\nwhile True: time.sleep(0.001)", number);
    }
}

// The thread sanitizer delivers no signal to a loop without calls.
TEST(TerminatedLoopTest, EndsWithoutAShutdownEvent) {
    for (const int number : {SIGTERM, SIGHUP}) {
        expectEndOf("print('running')\nwhile True: pass", number);
    }
}

TEST(EngineSignalTest, CodeMayHandleTermination) {
    EngineSession engine;
    engine.client.eval("import signal\nsignal.signal(signal.SIGTERM, lambda *ignored: print('told'))");
    const IDType id = engine.client.enqueue("import time\nprint('running')\nwhile True: time.sleep(0.001)");
    engine.client.awaitText("running");
    engine.process.signal(SIGTERM);
    engine.client.awaitText("told");
    engine.client.cancel(id);
    EXPECT_EQ(engine.client.await(id).output(), "running\ntold\n");
}

TEST(EngineSignalTest, InterruptEndsAnEngineThatHasNoSessionYet) {
    EngineProcess engine({"--stdio"});
    const int connection = engine.connection();
    char first = 0;
    ASSERT_EQ(::read(connection, &first, 1), 1);
    engine.signal(SIGINT);
    EXPECT_EQ(engine.wait(), -SIGINT);
    ::close(connection);
}

TEST(EngineSignalTest, InterruptThatIsIgnoredAtTheStartStaysIgnored) {
    // As the client starts its engine.
    const auto before = ::signal(SIGINT, SIG_IGN);
    EngineSession engine;
    ::signal(SIGINT, before);
    const Evaluation result = engine.client.eval(
        "import os, signal\n"
        "os.kill(os.getpid(), signal.SIGINT)\n"
        "print('on')");
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "on\n");
}

TEST(EngineSignalTest, BrokenPipesAreIgnored) {
    EngineSession engine;
    engine.client.eval("1");
    engine.process.signal(SIGPIPE);
    EXPECT_EQ(engine.client.eval("print('on')").output(), "on\n");
}

}  // namespace
}  // namespace qvm_test
