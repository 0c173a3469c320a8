// Code that goes on from a debug prompt line by line, and the frames around such a prompt.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::DebugLoopEvent;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using krutil::cmddistributor::inEXECUTION_DBQUIT;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;

class SteppingTest : public testing::Test {
  protected:
    SteppingTest() { atPrompt_.mode = DEQUEUE_AT_DEBUG_PROMPT; }

    EngineClient& client() { return engine_.client; }

    Evaluation command(const std::string& code) { return client().eval(code, atPrompt_); }

    // Sends the commands beforehand, one for each stop, and runs the code to its end.
    Evaluation run(const std::string& code, const std::vector<std::string>& commands) {
        std::vector<IDType> sent;
        for (const std::string& each : commands) {
            sent.push_back(client().enqueue("import qvm; qvm." + each + "()", atPrompt_));
        }
        Evaluation result = client().eval(code);
        for (const IDType& each : sent) {
            EXPECT_EQ(client().await(each).errorText(), "");
        }
        return result;
    }

    // Source lines of the stops.
    static std::vector<std::string> stops(const Evaluation& result) {
        std::vector<std::string> lines;
        for (const Happening& each : result.events) {
            const std::size_t line = each.text.find("\n    ");
            if (each.kind == "SinkTextEvent" && each.text.starts_with("Stopped in ")) {
                lines.push_back(line == std::string::npos ? "" : each.text.substr(line + 5));
                lines.back().pop_back();
            }
        }
        return lines;
    }

    EvalOptions atPrompt_;
    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

constexpr char code[] =
    "def inner(n):\n"
    "    n += 1\n"
    "    return n\n"
    "def outer():\n"
    "    breakpoint()\n"
    "    a = inner(1)\n"
    "    b = inner(a)\n"
    "    return b\n"
    "x = outer()\n"
    "y = x\n";

TEST_F(SteppingTest, NextStopsAtEachLineOfTheFrameAndThenInItsCaller) {
    const Evaluation result = run(code, {"next", "next", "next", "next", "dbcont"});
    EXPECT_THAT(stops(result), ElementsAre("breakpoint()", "a = inner(1)", "b = inner(a)", "return b", "y = x"));
    EXPECT_EQ(result.errorText(), "");
    EXPECT_EQ(client().eval("y").shown(), "3\n");
}

TEST_F(SteppingTest, StepStopsInFunctionsThatAreCalled) {
    const Evaluation result = run(code, {"step", "step", "step", "step", "next", "dbcont"});
    EXPECT_THAT(stops(result),
                ElementsAre("breakpoint()", "a = inner(1)", "n += 1", "return n", "b = inner(a)", "return b"));
}

TEST_F(SteppingTest, StopsHaveTheEventsOfABreakpoint) {
    EXPECT_THAT(run("breakpoint()\nx = 1", {"step", "dbcont"}).kinds(),
                ElementsAre("IIPStartedEvent", "SinkTextEvent", "IIPSuspendedEvent", "DebugLoopEvent", "DebugLoopEvent",
                            "IIPResumedEvent", "SinkTextEvent", "IIPSuspendedEvent", "DebugLoopEvent", "DebugLoopEvent",
                            "IIPResumedEvent", "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(SteppingTest, SteppingEndsWithTheCode) {
    run("breakpoint()\nx = 1", {"step", "step"});
    EXPECT_THAT(run("breakpoint()\n[1, 2]", {"step", "step"}).shown(), EndsWith("[1, 2]\n"));
    run("def f():\n    breakpoint()\n    1 / 0\ntry:\n    f()\nfinally:\n    pass", {"next", "next", "next"});
    EXPECT_THAT(stops(client().eval("def g():\n    return 1\nx = g()")), ElementsAre());
    EXPECT_EQ(client().eval("import sys; print(sys.gettrace())").output(), "None\n");
}

TEST_F(SteppingTest, TracerOfTheCodeComesBack) {
    run("import sys\ndef tracer(*arguments): return tracer\nsys.settrace(tracer)\nbreakpoint()\nx = 1",
        {"step", "dbcont"});
    EXPECT_EQ(client().eval("print(sys.gettrace() is tracer)\nsys.settrace(None)").output(), "True\n");
}

TEST_F(SteppingTest, VariablesOfEachStopAreReadAndAssigned) {
    const IDType id = client().enqueue(code);
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    command("import qvm; qvm.next()");
    command("import qvm; qvm.next()");
    EXPECT_EQ(command("a").shown(), "2\n");
    EXPECT_EQ(command("a = 40").errorText(), "");
    command("import qvm; qvm.dbcont()");
    EXPECT_EQ(client().await(id).errorText(), "");
    EXPECT_EQ(client().eval("y").shown(), "41\n");
}

TEST_F(SteppingTest, CodeIsEvaluatedInTheFrameThatUpAndDownSelect) {
    const IDType id = client().enqueue(
        "def f(n):\n"
        "    deep = n\n"
        "    breakpoint()\n"
        "def g():\n"
        "    high = 1\n"
        "    f(2)\n"
        "    print(high)\n"
        "g()\n");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    EXPECT_EQ(command("import qvm; qvm.up()").shown(), "g (<eval-1>:6)\n    f(2)\n");
    EXPECT_EQ(command("high").shown(), "1\n");
    EXPECT_EQ(command("high = 5").errorText(), "");
    EXPECT_EQ(command("deep").errorId(), "NameError");
    EXPECT_EQ(command("import qvm; qvm.where()").shown(),
              "  <module> (<eval-1>:8)\n    g()\n"
              "> g (<eval-1>:6)\n    f(2)\n"
              "  f (<eval-1>:3)\n    breakpoint()\n");
    EXPECT_EQ(command("import qvm; qvm.up()").shown(), "<module> (<eval-1>:8)\n    g()\n");
    EXPECT_EQ(command("import qvm; qvm.up()").errorText(), "This is the outermost frame of the code that is held up.");
    EXPECT_EQ(command("import qvm; qvm.down(); qvm.down()").shown(),
              "g (<eval-1>:6)\n    f(2)\nf (<eval-1>:3)\n    breakpoint()\n");
    EXPECT_EQ(command("import qvm; qvm.down()").errorText(), "This is the innermost frame: the code is held up here.");
    EXPECT_EQ(command("deep").shown(), "2\n");
    EXPECT_EQ(command("import qvm; qvm.list()").shown(),
              "    1    def f(n):\n"
              "    2        deep = n\n"
              "    3 ->     breakpoint()\n"
              "    4    def g():\n"
              "    5        high = 1\n"
              "    6        f(2)\n"
              "    7        print(high)\n"
              "    8    g()\n");
    command("import qvm; qvm.dbcont()");
    EXPECT_EQ(client().await(id).output(), "5\n");
}

TEST_F(SteppingTest, NextInACallersFrameGoesOnToItsNextLine) {
    const IDType id = client().enqueue("def f():\n    breakpoint()\n    x = 1\n    x = 2\nf()\ny = 1");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    command("import qvm; qvm.up(); qvm.next()");
    EXPECT_THAT(command("import qvm; qvm.where()").shown(), HasSubstr("> <module> (<eval-1>:6)\n    y = 1\n"));
    command("import qvm; qvm.dbcont()");
    client().await(id);
}

TEST_F(SteppingTest, CodeAtAPromptIsSteppedThroughToo) {
    const IDType id = client().enqueue("breakpoint()\nx = 1\ny = 2");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    command("import qvm; qvm.step()");
    const IDType inner = client().enqueue("breakpoint()\nz = 1", atPrompt_);
    client().awaitLoop(inner, DebugLoopEvent::ENTER);
    command("import qvm; qvm.step()");
    command("import qvm; qvm.step()");
    EXPECT_THAT(stops(client().await(inner)), ElementsAre("breakpoint()", "z = 1"));
    command("import qvm; qvm.step()");
    command("import qvm; qvm.dbcont()");
    EXPECT_THAT(stops(client().await(id)), ElementsAre("breakpoint()", "x = 1", "y = 2"));
}

TEST_F(SteppingTest, QuitAndCancelEndTheCodeAtAStop) {
    EXPECT_EQ(run(code, {"next", "dbquit"}).error->getExecutionStatus(), inEXECUTION_DBQUIT);
    const IDType id = client().enqueue(code);
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    command("import qvm; qvm.next()");
    client().cancel(id);
    EXPECT_EQ(client().await(id).error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(client().eval("import sys; print(sys.gettrace())").output(), "None\n");
}

TEST_F(SteppingTest, WithoutAPromptThereIsNothingToStep) {
    for (const char* const name : {"step", "next", "up", "down", "list", "where"}) {
        EXPECT_EQ(client().eval("import qvm; qvm." + std::string(name) + "()").errorText(),
                  "no debug or keyboard prompt is open");
    }
}

}  // namespace
}  // namespace qvm_test
