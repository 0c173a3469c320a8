// Code that does odd things to the process it runs in: its requests are answered, or its session ends and says so.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <memory>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using cmddistributor::IIPCancelReply;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using session::SessionEnd;
using testing::HasSubstr;

class HostileCodeTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Cancels code as soon as it has printed "ready".
    Evaluation cancelled(const std::string& code) {
        const IDType id = client().enqueue(code);
        client().awaitEvent([&](const Happening& each) { return each.id == id && each.text == "ready\n"; });
        EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
        return client().await(id);
    }

    void expectStops(const std::string& code) {
        SCOPED_TRACE(code);
        const Evaluation result = cancelled(code);
        ASSERT_TRUE(result.error);
        EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
    }

    // The session is whole: it goes on and ends as agreed.
    void expectWholeSession() {
        EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
        EXPECT_EQ(client().goodbye().reason, SessionEnd::Reason::Finished);
        EXPECT_EQ(engine_.process.wait(), 0);
        EXPECT_EQ(engine_.process.stderrText(), "");
    }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

// The thread sanitizer holds a signal back until the thread calls something that it knows, which a loop in the
// interpreter never does. Tests that need such a signal are a suite of their own, which it does not run.
using InterruptedHostileCodeTest = HostileCodeTest;

TEST_F(HostileCodeTest, OutputThatRaisesIsAnErrorOfTheCode) {
    const Evaluation result = client().eval(
        "import sys\n"
        "class Bad:\n"
        "    def write(self, text): raise ValueError('no room')\n"
        "    flush = write\n"
        "sys.stdout = sys.stderr = Bad()\n"
        "print(1)");
    EXPECT_EQ(result.errorText(), "no room");
    EXPECT_EQ(client().eval("2").shown(), "2\n");
    EXPECT_EQ(client().eval("del sys.stdout, sys.stderr, sys.stdin\nprint(1)").errorText(), "lost sys.stdout");
    expectWholeSession();
}

TEST_F(HostileCodeTest, HooksThatAreNoneAreMissed) {
    EXPECT_EQ(client().eval("import sys\nsys.displayhook = None\n1").errorText(), "'NoneType' object is not callable");
    EXPECT_EQ(client().eval("sys.excepthook = sys.unraisablehook = sys.breakpointhook = None\n1 / 0").errorId(),
              "ZeroDivisionError");
    EXPECT_EQ(client().eval("class D:\n    def __del__(self): 1 / 0\nD()\nNone").errorId(), "TypeError");
    EXPECT_FALSE(client().eval("d = D()\ndel d\nsys.displayhook = sys.__displayhook__").error);
    EXPECT_EQ(client().eval("breakpoint()").errorId(), "TypeError");
    expectWholeSession();
}

TEST_F(HostileCodeTest, RequestsWithoutBuiltinsFailAndAreAnswered) {
    EXPECT_EQ(client().eval("import builtins\nbuiltins.__dict__.clear()\n1").errorId(), "NameError");
    EXPECT_EQ(client().eval("1").errorId(), "NameError");
    EXPECT_EQ(client().goodbye().reason, SessionEnd::Reason::Finished);
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(HostileCodeTest, RequestsWithoutModulesGoOn) {
    EXPECT_EQ(client().eval("import sys\nsys.modules.clear()\n1 / 0").errorId(), "ZeroDivisionError");
    expectWholeSession();
}

TEST_F(HostileCodeTest, ClosedStandardDescriptorsAreMissedByNobody) {
    EXPECT_EQ(client().eval("import os, time\nfor i in range(3): os.close(i)\nprint('on')").output(), "on\n");
    // A thread that no longer has anything to wait for would take all the time that there is.
    EXPECT_EQ(client().eval("b = time.process_time()\ntime.sleep(0.5)\nprint(time.process_time() - b < 0.05)").output(),
              "True\n");
    expectWholeSession();
}

TEST_F(HostileCodeTest, ClosedDescriptorsOfTheEngineEndTheSession) {
    client().enqueue("import os\nos.closerange(3, 1000)");
    EXPECT_EQ(client().awaitEnd().reason, SessionEnd::Reason::Lost);
    EXPECT_EQ(engine_.process.wait(), 3);
}

// Code that lists the engine's descriptors.
const std::string own =
    "import fcntl, os\n"
    "own = []\n"
    "for n in range(3, 200):\n"
    "    try:\n"
    "        if fcntl.fcntl(n, fcntl.F_GETFD) & fcntl.FD_CLOEXEC: own.append(n)\n"
    "    except OSError: pass\n";

TEST_F(HostileCodeTest, EachDescriptorOfTheEngineIsMissed) {
    const std::string count = client().eval(own + "print(len(own))").output();
    ASSERT_GT(std::stoi(count), 10);
    for (int i = 0; i < std::stoi(count); ++i) {
        EngineSession engine;
        engine.client.enqueue(own + "os.close(own[" + std::to_string(i) + "])");
        EXPECT_EQ(engine.client.awaitEnd().reason, SessionEnd::Reason::Lost) << i;
        EXPECT_EQ(engine.process.wait(), 3) << i;
    }
}

TEST_F(HostileCodeTest, OtherFilesInPlaceOfTheEnginesEndTheSession) {
    client().enqueue("import os\nfor n in range(3, 300): os.dup2(0, n)");
    EXPECT_EQ(client().awaitEnd().reason, SessionEnd::Reason::Lost);
    EXPECT_EQ(engine_.process.wait(), 3);
}

TEST_F(HostileCodeTest, OtherFilesInPlaceOfTheEnginesEndTheSessionThoughTheCodeGoesOn) {
    client().enqueue("import os, time\nfor n in range(3, 300): os.dup2(0, n)\ntime.sleep(1000)");
    EXPECT_EQ(client().awaitEnd().reason, SessionEnd::Reason::Lost);
    EXPECT_EQ(engine_.process.wait(), 3);
}

TEST_F(HostileCodeTest, EachDescriptorOfTheEngineIsMissedWhenAnotherFileHasItsNumber) {
    const std::string count = client().eval(own + "print(len(own))").output();
    ASSERT_GT(std::stoi(count), 10);
    // All at a time: each engine looks when it has had nothing to do for a while.
    std::vector<std::unique_ptr<EngineSession>> engines;
    for (int i = 0; i < std::stoi(count); ++i) {
        engines.push_back(std::make_unique<EngineSession>());
        engines.back()->client.enqueue(own + "os.dup2(0, own[" + std::to_string(i) + "], inheritable=False)");
    }
    for (std::size_t i = 0; i < engines.size(); ++i) {
        EXPECT_EQ(engines[i]->process.wait(), 3) << i;
    }
}

TEST_F(HostileCodeTest, ClosedDescriptorsAreNamedAsTheReason) {
    client().enqueue("import os\nos.closerange(3, 50)");
    engine_.process.awaitStderr(
        "krutil-qvm: Running code has closed descriptors of the engine, so its session cannot go on.\n");
    EXPECT_EQ(engine_.process.wait(), 3);
}

TEST_F(HostileCodeTest, DeepRecursionIsAnErrorAndShownInShort) {
    const Evaluation result = client().eval("import sys\nsys.setrecursionlimit(100_000)\ndef f(): f()\nf()");
    EXPECT_EQ(result.errorId(), "RecursionError");
    EXPECT_LE(result.error->getStackFrames().size(), 1001U);
    expectWholeSession();
}

TEST_F(HostileCodeTest, RecursionThatLeavesTheStackEndsTheSession) {
#if defined(KRUTIL_SANITIZED)
    GTEST_SKIP() << "A sanitizer reports the signal.";
#endif
    client().enqueue(
        "import resource, sys\nresource.setrlimit(resource.RLIMIT_CORE, (0, 0))\nsys.setrecursionlimit(10**6)\n"
        "class A:\n    def __repr__(self): return repr(self)\nA()");
    EXPECT_EQ(client().awaitEnd().reason, SessionEnd::Reason::Lost);
    EXPECT_EQ(engine_.process.wait(), -SIGSEGV);
}

TEST_F(InterruptedHostileCodeTest, BlockedSignalsDoNotKeepACancelOut) {
    expectStops(
        "import signal\nsignal.pthread_sigmask(signal.SIG_BLOCK, signal.valid_signals())\n"
        "print('ready\\n', end='')\nwhile True: pass");
    expectStops(
        "signal.pthread_sigmask(signal.SIG_SETMASK, range(1, signal.NSIG))\nprint('ready\\n', end='')\nwhile True: "
        "pass");
    expectWholeSession();
}

TEST_F(InterruptedHostileCodeTest, HandlersOfAllSignalsDoNotKeepACancelOut) {
    EXPECT_EQ(client()
                  .eval("import signal\nrefused = []\n"
                        "for s in signal.valid_signals():\n"
                        "    try: signal.signal(s, lambda *a: None)\n"
                        "    except OSError as e: refused.append((s, e.errno))\n"
                        "refused == [(9, 22), (19, 22), (signal.SIGRTMAX - 3, 22)]")
                  .shown(),
              "True\n");
    expectStops("print('ready\\n', end='')\nwhile True: pass");
    expectWholeSession();
}

TEST_F(InterruptedHostileCodeTest, HandlersThatRaiseEndTheCodeThatTheyInterrupt) {
    client().eval(
        "import os, signal\n"
        "def bad(*a): raise ValueError('from a handler')\n"
        "for s in (signal.SIGINT, signal.SIGALRM, signal.SIGCHLD): signal.signal(s, bad)");
    EXPECT_EQ(client().eval("os.kill(os.getpid(), signal.SIGINT)\nwhile True: pass").errorText(), "from a handler");
    EXPECT_EQ(client().eval("signal.setitimer(signal.ITIMER_REAL, 0.001)\nwhile True: pass").errorText(),
              "from a handler");
    EXPECT_EQ(client().eval("os.system('true')\nwhile True: pass").errorText(), "from a handler");
    // Nothing is interrupted at idle.
    engine_.process.signal(SIGALRM);
    client().awaitText("from a handler");
    expectStops("print('ready\\n', end='')\nwhile True: pass");
    expectWholeSession();
}

TEST_F(InterruptedHostileCodeTest, TracersThatRaiseOrLoopAreCodeLikeAnyOther) {
    client().eval(
        "import sys\n"
        "def bad(*a): raise ValueError('tracer')\n"
        "def endless(*a):\n"
        "    sys.settrace(None)\n"
        "    sys.setprofile(None)\n"
        "    print('ready\\n', end='')\n"
        "    while True: pass");
    for (const std::string set : {"sys.settrace", "sys.setprofile"}) {
        SCOPED_TRACE(set);
        EXPECT_EQ(client().eval(set + "(bad)\nlen('x')\n(lambda: 0)()").errorText(), "tracer");
        EXPECT_EQ(client().eval("1").shown(), "1\n");
        expectStops(set + "(endless)\nlen('x')\n(lambda: 0)()");
    }
    // Set for the next request, they meet the engine's own code.
    EXPECT_FALSE(client().eval("nothing = sys.settrace(bad)").error);
    EXPECT_EQ(client().eval("1").errorText(), "tracer");
    EXPECT_FALSE(client().eval("nothing = sys.settrace(endless)").error);
    expectStops("1");
    expectWholeSession();
}

TEST_F(InterruptedHostileCodeTest, AsynchronousCodeStops) {
    // Not a loop of short tasks: an interrupt between taking one from the event loop and running it loses the task, for
    // which the library then waits when it cleans up.
    for (const char* body : {"await asyncio.sleep(1000)", "while True: pass"}) {
        expectStops(std::string("import asyncio\nasync def main():\n    print('ready\\n', end='')\n    ") + body +
                    "\nasyncio.run(main())");
    }
    EXPECT_EQ(client().eval("async def value(): return 7\nasyncio.run(value())").shown(), "7\n");
    expectWholeSession();
}

TEST_F(InterruptedHostileCodeTest, InterruptThatAGeneratorSwallowsIsGoneAndTheNextIsNot) {
    const IDType id = client().enqueue(
        "def stubborn():\n"
        "    try:\n"
        "        print('ready\\n', end='')\n"
        "        while True: pass\n"
        "    except KeyboardInterrupt: yield 'swallowed'\n"
        "for each in stubborn():\n"
        "    print(each)\n"
        "    while True: pass");
    client().awaitText("ready");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    client().awaitText("swallowed");
    EXPECT_EQ(client().cancel(id), IIPCancelReply::PENDING_CANCEL);
    EXPECT_EQ(client().await(id).errorId(), "KeyboardInterrupt");
    expectWholeSession();
}

TEST_F(HostileCodeTest, ThreadsThatFailOrExitEndAlone) {
    client().eval(
        "import sys, threading\n"
        "def bad(*a): raise ValueError('hook')\n"
        "threading.excepthook = bad\n"
        "for what in (bad, sys.exit, lambda: sys.exit('text')):\n"
        "    thread = threading.Thread(target=what)\n"
        "    thread.start()\n"
        "    thread.join()\n"
        "threading.excepthook = threading.__excepthook__\n"
        "class E(Exception):\n"
        "    def __str__(self): raise KeyboardInterrupt\n"
        "def fail(): raise E\n"
        "thread = threading.Thread(target=fail)\n"
        "thread.start()\n"
        "thread.join()");
    EXPECT_THAT(client().backgroundText(), HasSubstr("Exception in threading.excepthook:"));
    expectWholeSession();
}

TEST_F(HostileCodeTest, SpawnedProcessOfTheLibraryWorks) {
    EXPECT_EQ(client()
                  .eval("import multiprocessing\n"
                        "process = multiprocessing.get_context('spawn').Process(target=print, args=('spawned',))\n"
                        "process.start()\nprocess.join()\nprocess.exitcode")
                  .shown(),
              "0\n");
    EXPECT_THAT(client().backgroundText(), HasSubstr("spawned\n"));
    expectWholeSession();
}

TEST_F(HostileCodeTest, ChildThatGoesOnDoesNotHoldTheSession) {
    const std::string child = client()
                                  .eval(
                                      "import os, time\n"
                                      "pid = os.fork()\n"
                                      "while pid == 0: time.sleep(1000)\n"
                                      "pid")
                                  .shown();
    expectWholeSession();
    EXPECT_EQ(::kill(std::stoi(child), SIGKILL), 0);
}

TEST_F(HostileCodeTest, CyclesAreLeftWithoutACollector) {
    EXPECT_EQ(client().eval("import gc\ngc.disable()\na = []\na.append(a)\ndel a\ngc.collect() > 0").shown(), "True\n");
    expectWholeSession();
}

TEST_F(HostileCodeTest, EndlessExitFunctionEndsWithTheClient) {
    client().eval(
        "import atexit\n"
        "def endless():\n"
        "    print('leaving')\n"
        "    while True: pass\n"
        "atexit.register(endless)");
    client().session().sayGoodbye();
    client().awaitText("leaving");
    client().session().close(std::chrono::milliseconds(0));
    EXPECT_EQ(engine_.process.wait(), 3);
}

}  // namespace
}  // namespace qvm_test
