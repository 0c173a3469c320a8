// Cancels: what becomes of the request, and what the reply to the cancel says.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "EngineFixture.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using cmddistributor::IIPCancelReply;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using testing::Contains;
using testing::ElementsAre;
using testing::Not;

class CancelTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Waits until the code of a request is running.
    IDType running(const std::string& code) { return startedBy("print('ready')\n" + code); }

    // The same for code that prints "ready" itself.
    IDType startedBy(const std::string& code) {
        const IDType id = client().enqueue(code);
        client().awaitEvent([&](const Happening& each) { return each.id == id && each.text == "ready\n"; });
        return id;
    }

    static void expectInterrupted(const Evaluation& result) {
        ASSERT_TRUE(result.error);
        EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
        EXPECT_EQ(result.errorId(), "KeyboardInterrupt");
        EXPECT_THAT(result.kinds(), Not(Contains("PrintableErrorEvent")));
        EXPECT_FALSE(result.discarded());
    }

    // Cancels running code, which has a second to end.
    void expectStops(const std::string& code) {
        const IDType id = running(code);
        const auto begin = std::chrono::steady_clock::now();
        EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
        expectInterrupted(client().await(id));
        EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(1)) << code;
        EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
    }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

TEST_F(CancelTest, TightLoopStops) {
    expectStops("while True: pass");
}

TEST_F(CancelTest, SleepStops) {
    expectStops("import time\ntime.sleep(1000)");
}

TEST_F(CancelTest, SystemCallStops) {
    expectStops("import os\nos.read(os.pipe()[0], 1)");
}

TEST_F(CancelTest, WaitForAThreadStops) {
    expectStops("import threading\nthreading.Event().wait()");
}

TEST_F(CancelTest, WaitForAProgramStops) {
    expectStops("import subprocess\nsubprocess.run(['sleep', '1000'])");
}

TEST_F(CancelTest, CompilationStops) {
    expectStops(
        "exec('x = ' + ' + '.join(str(i) for i in range(3)))\nwhile True: compile('x = 1\\n' * 1000, 'f', 'exec')");
}

TEST_F(CancelTest, SlowTextOfAValueStops) {
    expectStops("class Slow:\n    def __repr__(self):\n        while True: pass\nSlow()");
}

TEST_F(CancelTest, InputStops) {
    const IDType id = client().enqueue("input('name? ')");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    expectInterrupted(result);
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "TextBaseEvent", "IIPSuspendedEvent", "DebugLoopEvent",
                                            "DebugLoopEvent", "IIPResumedEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(CancelTest, EndlessOutputToAClientThatDoesNotReadStops) {
    Gate stopped;
    const IDType id = client().enqueue("try:\n    while True: print('x' * 1000)\nfinally:\n    " + stopped.wait());
    client().awaitText("xxx");
    client().stopReading();
    const session::framing::StreamID cancel = client().startCancel(id);
    // The code ends while nothing is read: only then is there a reader of the gate.
    stopped.open();
    client().readOn();
    EXPECT_EQ(client().awaitCancel(cancel), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(id));
    EXPECT_EQ(client().eval("1").shown(), "1\n");
}

TEST_F(CancelTest, QueuedRequestIsDiscarded) {
    Gate gate;
    const IDType busy = client().enqueue(gate.wait());
    const IDType queued = client().enqueue("print('never')");
    EXPECT_EQ(client().cancel(queued, false), IIPCancelReply::SUCCESSFUL_CANCEL);
    const Evaluation result = client().await(queued);
    EXPECT_THAT(result.kinds(), ElementsAre("IIPDiscardedEvent", "LastIIPEvent"));
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(result.errorId(), "KeyboardInterrupt");
    EXPECT_EQ(result.errorText(), "The request was cancelled before it was started.");
    gate.open();
    EXPECT_FALSE(client().await(busy).error);
}

TEST_F(CancelTest, RunningRequestGoesOnUnlessAskedFor) {
    Gate gate;
    const IDType id = running(gate.wait() + "\nprint('whole')");
    EXPECT_EQ(client().cancel(id, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING);
    gate.open();
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "ready\nwhole\n");
}

TEST_F(CancelTest, FinishedAndUnknownRequestsAreDone) {
    const IDType id = client().enqueue("1");
    client().await(id);
    EXPECT_EQ(client().cancel(id), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(id, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(IDType::random()), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(IDType()), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
}

TEST_F(CancelTest, CodeMayCatchTheInterruptAndGoOn) {
    const IDType id =
        startedBy("try:\n    print('ready')\n    while True: pass\nexcept KeyboardInterrupt:\n    print('caught')");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "ready\ncaught\n");
}

TEST_F(CancelTest, SecondCancelInterruptsAgain) {
    const IDType id = startedBy(
        "try:\n    print('ready')\n    while True: pass\nexcept KeyboardInterrupt:\n    print('caught')\n"
        "while True: pass");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    client().awaitText("caught");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(id));
}

TEST_F(CancelTest, OwnHandlerOfTheInterruptSignalDoesNotMatter) {
    client().eval("import signal\nsignal.signal(signal.SIGINT, signal.SIG_IGN)");
    expectStops("while True: pass");
}

TEST_F(CancelTest, CleanupOfInterruptedCodeRuns) {
    const IDType id = startedBy("try:\n    print('ready')\n    while True: pass\nfinally:\n    print('cleaned up')");
    client().cancel(id);
    const Evaluation result = client().await(id);
    expectInterrupted(result);
    EXPECT_EQ(result.output(), "ready\ncleaned up\n");
}

TEST_F(CancelTest, ThousandsOfCancelsReachNoOtherRequest) {
    // Each cancelled request is followed by one that must not notice.
    constexpr int kRounds = 2000;
    int cancelled = 0;
    for (int i = 0; i < kRounds; ++i) {
        const IDType meant = client().enqueue("sum(range(" + std::to_string(i % 500) + "))");
        const session::framing::StreamID cancel = client().startCancel(meant);
        const IDType next = client().enqueue(std::to_string(i));
        const IIPCancelReply::CancelStatus status = client().awaitCancel(cancel);
        const Evaluation result = client().await(meant);
        // The reply states a fact.
        if (status == IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE) {
            ASSERT_FALSE(result.error) << i;
        } else {
            ASSERT_TRUE(result.error) << i << " " << status;
            ASSERT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC) << i;
            ASSERT_EQ(result.discarded(), status == IIPCancelReply::SUCCESSFUL_CANCEL) << i;
            ++cancelled;
        }
        const Evaluation untouched = client().await(next);
        ASSERT_FALSE(untouched.error) << i << untouched.errorText();
        ASSERT_EQ(untouched.shown(), std::to_string(i) + "\n");
    }
    EXPECT_GT(cancelled, 0);
}

TEST_F(CancelTest, CancelOfTheOuterRequestEndsItsPrompt) {
    const IDType outer = client().enqueue("breakpoint()\nprint('not reached')");
    client().awaitLoop(outer, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().cancel(outer, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING);
    EXPECT_EQ(client().cancel(outer), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(outer);
    expectInterrupted(result);
    EXPECT_EQ(result.output(), "");
}

TEST_F(CancelTest, CancelOfAnInnerRequestEndsOnlyThat) {
    const IDType outer = client().enqueue("breakpoint()\nprint('reached')");
    client().awaitLoop(outer, DebugLoopEvent::ENTER);
    EvalOptions atPrompt;
    atPrompt.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_DEBUG_PROMPT;
    const IDType inner = client().enqueue("print('inner')\nwhile True: pass", atPrompt);
    client().awaitText("inner");
    EXPECT_EQ(client().cancel(inner), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(inner));
    EXPECT_EQ(client().eval("1 + 1", atPrompt).shown(), "2\n");
    EXPECT_FALSE(client().eval("import qvm\nqvm.dbcont()", atPrompt).error);
    const Evaluation result = client().await(outer);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "reached\n");
}

TEST_F(CancelTest, CancelOfTheOuterRequestInterruptsTheInnerOneFirst) {
    const IDType outer = client().enqueue("breakpoint()");
    client().awaitLoop(outer, DebugLoopEvent::ENTER);
    EvalOptions atPrompt;
    atPrompt.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_DEBUG_PROMPT;
    const IDType inner = client().enqueue("print('inner')\nwhile True: pass", atPrompt);
    client().awaitText("inner");
    EXPECT_EQ(client().cancel(outer), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(inner));
    expectInterrupted(client().await(outer));
    EXPECT_EQ(client().eval("1").shown(), "1\n");
}

}  // namespace
}  // namespace qvm_test
