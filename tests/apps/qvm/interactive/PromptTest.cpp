// Prompts of running code, and the requests that they take.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using krutil::cmddistributor::inEXECUTION_DBQUIT;
using krutil::prompt::InputRequester;
using testing::Contains;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::Not;

EvalOptions at(WhenToDequeue mode) {
    EvalOptions options;
    options.mode = mode;
    return options;
}

// Loops of a request's events: the number of the loop, negative for leaving it.
std::vector<std::pair<DebugLoopEvent::State, InputRequester>> loopsOf(const Evaluation& result) {
    std::vector<std::pair<DebugLoopEvent::State, InputRequester>> loops;
    for (const Happening& each : result.events) {
        if (const auto* const loop = dynamic_cast<const DebugLoopEvent*>(each.event.get())) {
            loops.emplace_back(loop->getLoopState(), loop->getWhichDebugLoop());
        }
    }
    return loops;
}

class EnginePromptTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Runs code up to its first prompt.
    IDType stopped(const std::string& code) {
        const IDType id = client().enqueue(code);
        client().awaitLoop(id, DebugLoopEvent::ENTER);
        return id;
    }

    Evaluation command(const std::string& code) { return client().eval(code, at(DEQUEUE_AT_PROMPT)); }

    static void expectLoop(const Evaluation& result, InputRequester loop) {
        EXPECT_THAT(loopsOf(result), ElementsAre(std::make_pair(DebugLoopEvent::ENTER, loop),
                                                 std::make_pair(DebugLoopEvent::EXIT, loop)));
    }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

TEST_F(EnginePromptTest, AnswerToInputIsTheLineAndNotEvaluated) {
    const IDType id = stopped("line = input('name? ')\nprint([line])");
    const Evaluation answer = command("1 / 0");
    EXPECT_THAT(answer.kinds(), ElementsAre("IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_FALSE(answer.error);
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.output(), "name? ['1 / 0']\n");
    EXPECT_THAT(result.kinds(),
                ElementsAre("IIPStartedEvent", "TextBaseEvent", "IIPSuspendedEvent", "DebugLoopEvent", "DebugLoopEvent",
                            "IIPResumedEvent", "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(result.events[1].text, "name? ");
    expectLoop(result, InputRequester::mnINPUT_PROMPT);
}

TEST_F(EnginePromptTest, EmptyAnswerIsAnEmptyLine) {
    const IDType id = stopped("import sys\nprint([sys.stdin.readline()])");
    command("");
    EXPECT_EQ(client().await(id).output(), "['\\n']\n");
}

TEST_F(EnginePromptTest, AnswerOfSeveralLinesAnswersAsManyReads) {
    const IDType id = stopped("print([input(), input(), input()])");
    command("a\nb\nc");
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.output(), "['a', 'b', 'c']\n");
    expectLoop(result, InputRequester::mnINPUT_PROMPT);
}

TEST_F(EnginePromptTest, LinesThatAreLeftOverAnswerLaterRequests) {
    const IDType id = stopped("print([input()])");
    command("a\nb\nc\n");
    EXPECT_EQ(client().await(id).output(), "['a']\n");
    EXPECT_EQ(client().eval("print([input(), input()])").output(), "['b', 'c']\n");
    const IDType next = stopped("print([input()])");
    command("d");
    EXPECT_EQ(client().await(next).output(), "['d']\n");
}

TEST_F(EnginePromptTest, EndOfInputIsAnEOFError) {
    const IDType id = stopped("input()");
    EXPECT_FALSE(command("\x04").error);
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.errorId(), "EOFError");
    EXPECT_EQ(result.errorText(), "EOF when reading a line");
    const IDType reading = stopped("import sys\nprint([sys.stdin.read()])");
    client().enqueue("one", at(DEQUEUE_AT_PROMPT));
    client().enqueue("two", at(DEQUEUE_AT_PROMPT));
    client().enqueue("\x04", at(DEQUEUE_AT_PROMPT));
    EXPECT_EQ(client().await(reading).output(), "['one\\ntwo\\n']\n");
}

TEST_F(EnginePromptTest, RequestsForLaterWaitAtAnInputPrompt) {
    const IDType id = stopped("x = input()\nprint('first')");
    const IDType idle = client().enqueue("print('idle')");
    const IDType debug = client().enqueue("print('debug')", at(DEQUEUE_AT_DEBUG_PROMPT));
    client().enqueue("line", at(DEQUEUE_AT_NON_DEBUG_PROMPT));
    EXPECT_EQ(client().await(id).output(), "first\n");
    EXPECT_EQ(client().await(idle).output(), "idle\n");
    const IDType stop = stopped("breakpoint()");
    EXPECT_EQ(client().await(debug).output(), "debug\n");
    command("import qvm; qvm.dbcont()");
    client().await(stop);
}

TEST_F(EnginePromptTest, BreakpointEvaluatesInTheStoppedFrame) {
    const IDType id = stopped(
        "def f(a):\n"
        "    b = a * 2\n"
        "    breakpoint()\n"
        "    return a, b\n"
        "print(f(3))");
    EXPECT_EQ(command("a + b").shown(), "9\n");
    EXPECT_EQ(command("[x * a for x in range(3)]").shown(), "[0, 3, 6]\n");
    EXPECT_EQ(command("b = 10\nb").shown(), "10\n");
    EXPECT_EQ(client().eval("a = 'new'", at(DEQUEUE_AT_DEBUG_PROMPT)).errorText(), "");
    EXPECT_EQ(command("1 / 0").errorId(), "ZeroDivisionError");
    EXPECT_FALSE(command("import qvm; qvm.dbcont()").error);
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error) << result.errorText();
    EXPECT_EQ(result.output(), "('new', 10)\n");
    EXPECT_EQ(result.shown(), "Stopped in f (<eval-1>:3)\n    breakpoint()\n");
    expectLoop(result, InputRequester::mnDEBUG_PROMPT);
}

TEST_F(EnginePromptTest, BreakpointAtTheTopSharesTheSession) {
    const IDType id = stopped("x = 1\nbreakpoint()\nprint(x)");
    command("x = 2\nimport qvm");
    command("qvm.dbcont()");
    EXPECT_EQ(client().await(id).output(), "2\n");
    EXPECT_EQ(client().eval("x").shown(), "2\n");
}

TEST_F(EnginePromptTest, QuitEndsTheOuterRequest) {
    const IDType id = stopped(
        "import qvm\ntry:\n    breakpoint()\nexcept Exception:\n    print('not this')\nfinally:\n    print('cleanup')");
    EXPECT_FALSE(command("qvm.dbquit()").error);
    const Evaluation result = client().await(id);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_DBQUIT);
    EXPECT_EQ(result.errorId(), "qvm.DebuggerQuit");
    EXPECT_EQ(result.errorText(), "The debugger was left with quit.");
    EXPECT_EQ(result.output(), "cleanup\n");
    EXPECT_THAT(result.kinds(), Not(Contains("PrintableErrorEvent")));
    EXPECT_EQ(client().eval("1").shown(), "1\n");
}

TEST_F(EnginePromptTest, WaysOutNeedAPrompt) {
    EXPECT_EQ(client().eval("import qvm\nqvm.dbcont()").errorText(), "no debug, keyboard or pause prompt is open");
    EXPECT_EQ(client().eval("qvm.dbquit()").errorId(), "RuntimeError");
}

TEST_F(EnginePromptTest, EitherWayOutEndsAPause) {
    for (const char* const way : {"qvm.dbcont()", "qvm.dbquit()"}) {
        const IDType id = stopped("import qvm\nqvm.pause()\nprint('on')");
        EvalOptions atEvents;
        atEvents.mode = DEQUEUE_AT_PPE;
        EXPECT_FALSE(client().eval(way, atEvents).error) << way;
        EXPECT_EQ(client().await(id).output(), "on\n") << way;
    }
}

TEST_F(EnginePromptTest, WhatIsLeftOfABatchIsRequeuedAndReactivated) {
    Gate gate;
    const IDType outer = client().enqueue("import qvm\n" + gate.wait() + "\nbreakpoint()");
    const IDType first = client().enqueue("qvm.dbcont()", at(DEQUEUE_AT_PROMPT));
    const IDType second = client().enqueue("print('second')", at(DEQUEUE_AT_PROMPT));
    gate.open();
    client().await(first);
    EXPECT_FALSE(client().await(outer).error);
    const Evaluation result = client().await(second);
    EXPECT_THAT(result.kinds(), ElementsAre("IIPRequeuedEvent", "IIPReactivatedEvent", "IIPStartedEvent",
                                            "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(EnginePromptTest, RequestOfABatchCanBeCancelled) {
    Gate gate;
    Gate inside;
    const IDType outer = client().enqueue("import qvm\n" + gate.wait() + "\nbreakpoint()");
    const IDType first = client().enqueue(inside.wait() + "\nqvm.dbcont()", at(DEQUEUE_AT_PROMPT));
    const IDType second = client().enqueue("print('second')", at(DEQUEUE_AT_PROMPT));
    gate.open();
    client().awaitKind(first, "IIPStartedEvent");
    EXPECT_EQ(client().cancel(second), cmddistributor::IIPCancelReply::SUCCESSFUL_CANCEL);
    EXPECT_THAT(client().await(second).kinds(), ElementsAre("IIPDiscardedEvent", "LastIIPEvent"));
    inside.open();
    EXPECT_FALSE(client().await(first).error);
    EXPECT_FALSE(client().await(outer).error);
}

TEST_F(EnginePromptTest, PromptsNest) {
    const IDType outer = stopped("import qvm\nx = 'outer'\nbreakpoint()\nprint('outer done')");
    const IDType inner = client().enqueue("def g():\n    y = 'inner'\n    breakpoint()\n    return y\nprint(g())",
                                          at(DEQUEUE_AT_PROMPT));
    client().awaitLoop(inner, DebugLoopEvent::ENTER);
    EXPECT_EQ(command("y = 'changed'\nx + y").shown(), "'outerchanged'\n");
    command("qvm.dbcont()");
    EXPECT_EQ(client().await(inner).output(), "changed\n");
    const IDType asking = client().enqueue("print(input('? '))", at(DEQUEUE_AT_PROMPT));
    client().awaitLoop(asking, DebugLoopEvent::ENTER);
    command("answer");
    EXPECT_EQ(client().await(asking).output(), "? answer\n");
    command("qvm.dbcont()");
    EXPECT_EQ(client().await(outer).output(), "outer done\n");
}

TEST_F(EnginePromptTest, KeyboardEvaluatesWhereItWasCalled) {
    const IDType id = stopped("import qvm\ndef f():\n    v = 1\n    qvm.keyboard()\n    return v\nprint(f())");
    const IDType debug = client().enqueue("v = 0", at(DEQUEUE_AT_DEBUG_PROMPT));
    EXPECT_FALSE(client().eval("v = 7", at(DEQUEUE_AT_NON_DEBUG_PROMPT)).error);
    command("qvm.dbcont()");
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.output(), "7\n");
    expectLoop(result, InputRequester::mnKEYBOARD_PROMPT);
    EXPECT_EQ(client().cancel(debug), cmddistributor::IIPCancelReply::SUCCESSFUL_CANCEL);
    client().await(debug);
}

TEST_F(EnginePromptTest, PauseEndsWithAnAnswer) {
    for (const WhenToDequeue mode : {DEQUEUE_AT_PAUSE, DEQUEUE_AT_PROMPT}) {
        const IDType id = stopped("import qvm\nqvm.pause()\nprint('on')");
        EXPECT_EQ(client().eval("print('meanwhile')", at(DEQUEUE_AT_PPE)).output(), "meanwhile\n");
        EXPECT_FALSE(client().eval("", at(mode)).error);
        const Evaluation result = client().await(id);
        EXPECT_EQ(result.output(), "on\n");
        expectLoop(result, InputRequester::mnPAUSE_PROMPT);
    }
}

TEST_F(EnginePromptTest, PauseEndsAfterItsSeconds) {
    const Evaluation result = client().eval("import qvm\nqvm.pause(0.01)\nprint('on')");
    EXPECT_EQ(result.output(), "on\n");
    expectLoop(result, InputRequester::mnPAUSE_PROMPT);
}

TEST_F(EnginePromptTest, ExitAtAPromptEndsTheSession) {
    const IDType id = stopped("breakpoint()\nprint('not reached')");
    command("raise SystemExit");
    EXPECT_EQ(client().await(id).output(), "");
    EXPECT_EQ(client().awaitEnd().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(EnginePromptTest, GoodbyeClosesPrompts) {
    const IDType id = stopped("breakpoint()");
    EXPECT_EQ(client().goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(client().await(id).error->getExecutionStatus(), inEXECUTION_DBQUIT);
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(EnginePromptTest, GoodbyeLetsAnOpenPromptTakeItsAnswersFirst) {
    const IDType id = stopped("def f():\n    v = 1\n    breakpoint()\n    return v\nprint(f())");
    const IDType change = client().enqueue("v = 2", at(DEQUEUE_AT_DEBUG_PROMPT));
    const IDType leave = client().enqueue("import qvm; qvm.dbcont()", at(DEQUEUE_AT_PROMPT));
    const IDType after = client().enqueue("print('at idle')", at(DEQUEUE_AT_PROMPT));
    EXPECT_EQ(client().goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_FALSE(client().await(change).error);
    EXPECT_FALSE(client().await(leave).error);
    EXPECT_EQ(client().await(id).output(), "2\n");
    EXPECT_EQ(client().await(after).output(), "at idle\n");
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(EnginePromptTest, PromptsThatOpenAfterAGoodbyeTakeTheirAnswersAndThenClose) {
    Gate gate;
    const IDType id = client().enqueue("import qvm\n" + gate.wait() +
                                       "\nprint([input(), input()])\n"
                                       "qvm.pause()\n"
                                       "try: input()\nexcept EOFError as e: print(e)\n"
                                       "qvm.keyboard()\nprint('not reached')");
    const IDType first = client().enqueue("one", at(DEQUEUE_AT_PROMPT));
    const IDType second = client().enqueue("two", at(DEQUEUE_AT_NON_DEBUG_PROMPT));
    const IDType idle = client().enqueue("print('idle')");
    client().session().sayGoodbye();
    gate.open();
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.output(), "['one', 'two']\nEOF when reading a line\n");
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_DBQUIT);
    EXPECT_FALSE(client().await(first).error);
    EXPECT_FALSE(client().await(second).error);
    EXPECT_EQ(client().await(idle).output(), "idle\n");
    EXPECT_EQ(client().awaitEnd().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(engine_.process.wait(), 0);
}

TEST_F(EnginePromptTest, PauseAtAGoodbyeTakesItsAnswerFirst) {
    const IDType id = stopped("import qvm\nqvm.pause()\nprint('on')");
    const IDType meanwhile = client().enqueue("print('meanwhile')", at(DEQUEUE_AT_PPE));
    EXPECT_EQ(client().goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(client().await(meanwhile).output(), "meanwhile\n");
    EXPECT_EQ(client().await(id).output(), "on\n");
}

TEST_F(EnginePromptTest, AnswerToAPauseThatIsOverFeedsNoInput) {
    const IDType id = stopped("import qvm\nqvm.pause(0.001)\nprint([input()])");
    client().awaitEvent([&](const Happening& each) {
        const auto* const loop = dynamic_cast<const DebugLoopEvent*>(each.event.get());
        return loop != nullptr && loop->getLoopState() == DebugLoopEvent::ENTER &&
               loop->getWhichDebugLoop() == InputRequester::mnINPUT_PROMPT;
    });
    const IDType stray = client().enqueue("", at(DEQUEUE_AT_PAUSE));
    // Messages are taken in order, so the answer to this one shows that the stray one waits.
    EXPECT_EQ(client().cancel(stray, false), cmddistributor::IIPCancelReply::SUCCESSFUL_CANCEL);
    const IDType late = client().enqueue("", at(DEQUEUE_AT_PAUSE));
    command("meant for input");
    EXPECT_EQ(client().await(id).output(), "['meant for input']\n");
    const Evaluation taken = client().await(late);
    EXPECT_FALSE(taken.error);
    EXPECT_THAT(taken.kinds(), ElementsAre("IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(EnginePromptTest, LostClientEndsTheEngineAtAPrompt) {
    stopped("input()");
    client().session().close(std::chrono::milliseconds(0));
    EXPECT_EQ(engine_.process.wait(), 3);
}

TEST_F(EnginePromptTest, ThreadsGoOnAndTheirTextBelongsToNoRequest) {
    const IDType id = stopped(
        "import threading\n"
        "go = threading.Event()\n"
        "def write():\n"
        "    go.wait()\n"
        "    print('of the thread', flush=True)\n"
        "thread = threading.Thread(target=write)\n"
        "thread.start()\n"
        "breakpoint()");
    command("go.set()\nthread.join()");
    command("import qvm; qvm.dbcont()");
    EXPECT_EQ(client().await(id).output(), "");
    EXPECT_EQ(client().backgroundText(), "of the thread\n");
}

TEST_F(EnginePromptTest, OtherThreadsHaveNoPrompts) {
    const Evaluation result = client().eval(
        "import threading\n"
        "def ask():\n"
        "    try: input()\n"
        "    except EOFError as error: global caught; caught = error\n"
        "thread = threading.Thread(target=ask)\n"
        "thread.start()\n"
        "thread.join()\n"
        "print(repr(caught))");
    EXPECT_EQ(result.output(), "EOFError('EOF when reading a line')\n");
}

TEST_F(EnginePromptTest, SignalHandlerAtAPromptWritesToNoRequest) {
    const IDType id = stopped(
        "import os, signal\n"
        "signal.signal(signal.SIGUSR1, lambda *a: print('handled', flush=True))\n"
        "breakpoint()");
    engine_.process.signal(SIGUSR1);
    client().awaitText("handled");
    command("import qvm; qvm.dbcont()");
    EXPECT_EQ(client().await(id).output(), "");
    EXPECT_EQ(client().backgroundText(), "handled\n");
}

class NoPromptTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    EngineSession engine_;
};

TEST_F(NoPromptTest, InputOfAClientThatCannotBeAskedIsAtItsEnd) {
    const Evaluation result = client().eval("input('name? ')");
    EXPECT_EQ(result.errorId(), "EOFError");
    EXPECT_EQ(result.output(), "name? ");
    EXPECT_EQ(client().eval("import sys\nsys.stdin.readline()").shown(), "''\n");
    EXPECT_EQ(client().eval("sys.stdin.read()").shown(), "''\n");
}

TEST_F(NoPromptTest, BreakpointWarnsAndGoesOn) {
    const Evaluation result = client().eval("breakpoint()\nprint('on')");
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "on\n");
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "IssuedWarningEvent", "IssuedEnabledWarningEvent",
                                            "TextBaseEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(NoPromptTest, KeyboardAndPauseGoOn) {
    const Evaluation result = client().eval("import qvm\nqvm.keyboard()\nqvm.pause()\nqvm.pause(0.001)\nprint('on')");
    EXPECT_FALSE(result.error) << result.errorText();
    EXPECT_EQ(result.output(), "on\n");
    EXPECT_THAT(result.kinds(), Contains("IssuedEnabledWarningEvent").Times(2));
    EXPECT_THAT(result.kinds(), Not(Contains("DebugLoopEvent")));
}

}  // namespace
}  // namespace qvm_test
