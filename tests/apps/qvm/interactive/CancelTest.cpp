// Cancels: what becomes of the request, and what the reply to the cancel says.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <random>
#include <typeinfo>

#include "apps/qvm/calls/CallFixture.hpp"
#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using cmddistributor::IIPCancelReply;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using testing::Contains;
using testing::ElementsAre;
using testing::Not;

class EngineCancelTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Waits until the code of a request is running.
    IDType running(const std::string& code) { return startedBy("print('ready\\n', end='')\n" + code); }

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

    // Cancels running code, which has a second to end. A machine that is busy with other things may need longer now and
    // then, but not each time.
    void expectStops(const std::string& code) {
        std::chrono::steady_clock::duration fastest = patience;
        for (int i = 0; i < 5 && fastest > std::chrono::seconds(1); ++i) {
            const IDType id = running(code);
            const auto begin = std::chrono::steady_clock::now();
            EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
            expectInterrupted(client().await(id));
            fastest = std::min(fastest, std::chrono::steady_clock::now() - begin);
            EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
        }
        EXPECT_LT(fastest, std::chrono::seconds(1)) << code;
    }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

// The thread sanitizer holds a signal back until the thread calls something that it knows, which a loop in the
// interpreter never does. Tests that need such a signal are a suite of their own, which it does not run.
using InterruptedCodeTest = EngineCancelTest;

TEST_F(InterruptedCodeTest, TightLoopStops) {
    expectStops("while True: pass");
}

TEST_F(EngineCancelTest, SleepStops) {
    expectStops("import time\ntime.sleep(1000)");
}

TEST_F(EngineCancelTest, SystemCallStops) {
    expectStops("import os\nos.read(os.pipe()[0], 1)");
}

TEST_F(EngineCancelTest, WaitForAThreadStops) {
    expectStops("import threading\nthreading.Event().wait()");
}

TEST_F(EngineCancelTest, WaitForAProgramStops) {
    expectStops("import subprocess\nsubprocess.run(['sleep', '1000'])");
}

TEST_F(EngineCancelTest, CompilationStops) {
    expectStops(
        "exec('x = ' + ' + '.join(str(i) for i in range(3)))\nwhile True: compile('x = 1\\n' * 1000, 'f', 'exec')");
}

TEST_F(InterruptedCodeTest, SlowTextOfAValueStops) {
    expectStops("class Slow:\n    def __repr__(self):\n        while True: pass\nSlow()");
}

// Body of a function that goes on for ever.
constexpr const char* endless = "    print('ready\\n', end='')\n    while True: pass\n";

TEST_F(InterruptedCodeTest, EndlessCodeStopsWhereverItIsCalledFrom) {
    const std::string endlessText = "class E(Exception):\n    def __str__(self): endless()\n";
    const std::string endlessEnd = "class D:\n    def __del__(self): endless()\n";
    const std::vector<std::pair<const char*, std::string>> places{
        {"text of an error", endlessText + "raise E"},
        {"texts of many causes", endlessText + "e = E()\nfor i in range(50):\n    e, e.__cause__ = E(), e\nraise e"},
        {"second text of an error",
         "class E(Exception):\n    asked = False\n    def __str__(self):\n        if E.asked: endless()\n"
         "        E.asked = True\n        return ''\nraise E"},
        {"cause of an error", "class E(Exception):\n    __cause__ = property(lambda self: endless())\nraise E"},
        {"note of an error", endlessText + "e = ValueError()\ne.__notes__ = [E()]\nraise e"},
        {"making of an error", "class E(Exception):\n    def __init__(self): endless()\nraise E"},
        {"text of a value", "class V:\n    def __repr__(self): endless()\nV()"},
        {"display hook", "import sys\nsys.displayhook = lambda value: endless()\n1"},
        {"hook for errors", endlessText + "import sys\ntry: raise E\nexcept E: sys.excepthook(*sys.exc_info())"},
        {"printing of an error", endlessText + "import traceback\ntry: raise E\nexcept E: traceback.print_exc()"},
        {"text of a warning",
         "class W(UserWarning):\n    def __str__(self): endless()\nimport warnings\nwarnings.warn(W())"},
        {"taker of warnings", "import warnings\nwarnings.showwarning = lambda *a: endless()\nwarnings.warn('w')"},
        {"import",
         "import sys\nclass F:\n    def find_spec(self, *a): endless()\nsys.meta_path.insert(0, F())\nimport nothing"},
        {"finaliser", endlessEnd + "D()\nprint('not reached')"},
        {"finalisers", endlessEnd + "many = [D() for i in range(50)]\ndel many\nprint('not reached')"},
        {"finaliser of a local variable", endlessEnd + "def f():\n    d = D()\n    1 / 0\nf()"},
        {"finaliser after a call", endlessEnd + "def f(): d = D()\nf()\nprint('not reached')"},
        {"callback of a weak reference",
         "import weakref\nclass C: pass\nc = C()\nr = weakref.ref(c, lambda r: endless())\ndel c\nprint('not "
         "reached')"},
        {"exit function", "import atexit\natexit.register(endless)\natexit._run_exitfuncs()\nprint('not reached')"},
    };
    for (const auto& [place, code] : places) {
        SCOPED_TRACE(place);
        const IDType id = startedBy(std::string("def endless():\n") + endless + code);
        EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
        const Evaluation result = client().await(id);
        expectInterrupted(result);
        EXPECT_EQ(result.output().find("not reached"), std::string::npos);
        EXPECT_EQ(result.errors(), "");
        client().eval(
            "import atexit, sys, warnings\n"
            "atexit._clear()\n"
            "sys.displayhook = sys.__displayhook__\n"
            "sys.meta_path[:] = [each for each in sys.meta_path if type(each).__name__ != 'F']\n"
            "warnings.showwarning = warnings._showwarning_orig");
        EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
    }
}

TEST_F(InterruptedCodeTest, ErrorWhoseTextWasInterruptedIsTheCause) {
    const IDType id = client().enqueue(std::string("class E(Exception):\n    def __str__(self):\n    ") +
                                       "    print('ready\\n', end='')\n        while True: pass\n"
                                       "try: 1 / 0\nexcept ZeroDivisionError: raise E");
    client().awaitText("ready");
    client().cancel(id);
    const Evaluation result = client().await(id);
    expectInterrupted(result);
    EXPECT_EQ(result.errorText(), "The request was interrupted while its error was formatted.");
    ASSERT_EQ(result.error->getCauses().size(), 1U);
    const cmddistributor::RuntimeException& error = result.error->getCauses()[0];
    EXPECT_EQ(error.GetID(), "__main__.E");
    EXPECT_EQ(error.GetUnicodeMessageTxt(), u"<unprintable __main__.E object>");
    EXPECT_EQ(error.getStackFrames().back().line, 6);
    ASSERT_EQ(error.getCauses().size(), 1U);
    EXPECT_EQ(error.getCauses()[0].GetUnicodeMessageTxt(), u"division by zero");
}

TEST_F(InterruptedCodeTest, SessionEndsThoughTheTextOfItsLastErrorWasInterrupted) {
    const IDType id = startedBy(std::string("class E(SystemExit):\n    def __str__(self):\n    ") +
                                "    print('ready\\n', end='')\n        while True: pass\nraise E(3)");
    client().cancel(id);
    expectInterrupted(client().await(id));
    EXPECT_EQ(client().awaitEnd().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(InterruptedCodeTest, EndlessSearchForAFunctionStops) {
    client().eval("import types\nm = types.ModuleType('m')\nm.__getattr__ = lambda name: endless()\ndef endless():\n" +
                  std::string(endless));
    const IDType id = client().enqueue(callOf("m.function", {}));
    client().awaitText("ready");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(id));
}

TEST_F(EngineCancelTest, InputStops) {
    const IDType id = client().enqueue("input('name? ')");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    expectInterrupted(result);
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "TextBaseEvent", "IIPSuspendedEvent", "DebugLoopEvent",
                                            "DebugLoopEvent", "IIPResumedEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(EngineCancelTest, EndlessOutputToAClientThatDoesNotReadStops) {
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

TEST_F(EngineCancelTest, QueuedRequestIsDiscarded) {
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

TEST_F(EngineCancelTest, RunningRequestGoesOnUnlessAskedFor) {
    Gate gate;
    const IDType id = running(gate.wait() + "\nprint('whole')");
    EXPECT_EQ(client().cancel(id, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING);
    gate.open();
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "ready\nwhole\n");
}

TEST_F(EngineCancelTest, FinishedAndUnknownRequestsAreDone) {
    const IDType id = client().enqueue("1");
    client().await(id);
    EXPECT_EQ(client().cancel(id), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(id, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(IDType::random()), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
    EXPECT_EQ(client().cancel(IDType()), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE);
}

TEST_F(InterruptedCodeTest, CodeMayCatchTheInterruptAndGoOn) {
    const IDType id = startedBy(
        "try:\n    print('ready\\n', end='')\n    while True: pass\nexcept KeyboardInterrupt:\n    print('caught')");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "ready\ncaught\n");
}

TEST_F(InterruptedCodeTest, SecondCancelInterruptsAgain) {
    const IDType id = startedBy(
        "try:\n    print('ready\\n', end='')\n    while True: pass\nexcept KeyboardInterrupt:\n    print('caught')\n"
        "while True: pass");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    client().awaitText("caught");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    expectInterrupted(client().await(id));
}

TEST_F(InterruptedCodeTest, OwnHandlerOfTheInterruptSignalDoesNotMatter) {
    client().eval("import signal\nsignal.signal(signal.SIGINT, signal.SIG_IGN)");
    expectStops("while True: pass");
}

TEST_F(InterruptedCodeTest, CleanupOfInterruptedCodeRuns) {
    const IDType id =
        startedBy("try:\n    print('ready\\n', end='')\n    while True: pass\nfinally:\n    print('cleaned up')");
    client().cancel(id);
    const Evaluation result = client().await(id);
    expectInterrupted(result);
    EXPECT_EQ(result.output(), "ready\ncleaned up\n");
}

TEST_F(EngineCancelTest, ThousandsOfCancelsReachNoOtherRequest) {
    // Each cancelled request is followed by one that must not notice.
    constexpr int rounds = 2000;
    int cancelled = 0;
    for (int i = 0; i < rounds; ++i) {
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

// In place of what the thread sanitizer cannot show, because no signal reaches this code there: calls are interrupted
// at all moments, most of them about when they end. Each of them ends once, with its value or with the interruption, as
// the reply to the cancel says; the call behind it has its value. A second reply to one request would end the session.
TEST_F(InterruptedCodeTest, InterruptsAtAnyMomentEndOnlyTheCallThatIsMeant) {
#if defined(KRUTIL_SANITIZED)
    constexpr std::uint64_t rounds = 300;
#else
    constexpr std::uint64_t rounds = 5'000;
#endif
    client().eval("def count(number):\n    for i in range(5_000): pass\n    return number\n");
    const auto numbered = [](std::uint64_t number) {
        Array array = ArrayFactory().createArray(ElementType::UInt64, {1});
        std::memcpy(array.mutableData(), &number, sizeof number);
        return callOf("count", {array});
    };
    const auto numberIn = [](const Evaluation& call) {
        std::uint64_t number = 0;
        std::memcpy(&number, outputsOf(call).at(0).data(), sizeof number);
        return number;
    };
    std::mt19937 random(1);
    std::chrono::nanoseconds usual = std::chrono::microseconds(100);
    std::uint64_t interrupted = 0;
    std::uint64_t returned = 0;
    for (std::uint64_t i = 0; i < rounds; ++i) {
        const IDType meant = client().enqueue(numbered(2 * i));
        const IDType next = client().enqueue(numbered(2 * i + 1));
        // Not a wait for anything, but a moment of chance.
        const auto moment =
            std::chrono::steady_clock::now() + usual * std::uniform_int_distribution<int>(0, 200)(random) / 100;
        while (std::chrono::steady_clock::now() < moment) {
        }
        const IIPCancelReply::CancelStatus status = client().cancel(meant);
        const Evaluation result = client().await(meant);
        if (status == IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_DONE) {
            ASSERT_FALSE(result.error) << i << " " << result.errorText();
            ASSERT_EQ(numberIn(result), 2 * i);
            ++returned;
            usual = usual * 9 / 10;
        } else {
            ASSERT_TRUE(result.error) << i << " " << status;
            ASSERT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC) << i;
            ASSERT_EQ(result.errorId(), "KeyboardInterrupt") << i;
            const cmddistributor::IIPResult& plain = *result.reply->getResult();
            ASSERT_EQ(typeid(plain), typeid(cmddistributor::IIPResult)) << i << " has outputs as well";
            ASSERT_EQ(result.discarded(), status == IIPCancelReply::SUCCESSFUL_CANCEL) << i;
            ++interrupted;
            usual = usual * 11 / 10 + std::chrono::nanoseconds(1'000);
        }
        const Evaluation untouched = client().await(next);
        ASSERT_FALSE(untouched.error) << i << " " << untouched.errorText();
        ASSERT_EQ(numberIn(untouched), 2 * i + 1);
    }
    EXPECT_GT(interrupted, rounds / 10);
    EXPECT_GT(returned, rounds / 10);
    EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
}

TEST_F(EngineCancelTest, CancelOfTheOuterRequestEndsItsPrompt) {
    const IDType outer = client().enqueue("breakpoint()\nprint('not reached')");
    client().awaitLoop(outer, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().cancel(outer, false), IIPCancelReply::UNABLE_TO_CANCEL_ALREADY_RUNNING);
    EXPECT_EQ(client().cancel(outer), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(outer);
    expectInterrupted(result);
    EXPECT_EQ(result.output(), "");
}

TEST_F(InterruptedCodeTest, CancelOfAnInnerRequestEndsOnlyThat) {
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

TEST_F(InterruptedCodeTest, CancelOfTheOuterRequestInterruptsTheInnerOneFirst) {
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
