// Code that awaits at its top level.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::CodeType;
using cmddistributor::DebugLoopEvent;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using testing::HasSubstr;

class AwaitTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }
    std::string shown(const std::string& code) { return client().eval(code).shown(); }

    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
};

// A loop in the interpreter, which the thread sanitizer lets no signal reach.
using InterruptedAwaitTest = AwaitTest;

TEST_F(AwaitTest, ExpressionsStatementsAndBlocksAwait) {
    client().eval("import asyncio\nasync def twice(n):\n    await asyncio.sleep(0)\n    return 2 * n");
    EXPECT_EQ(shown("await twice(4)"), "8\n");
    EXPECT_EQ(client().eval("x = await twice(5)").errorText(), "");
    EXPECT_EQ(shown("x"), "10\n");
    EXPECT_EQ(shown("y = await twice(x)\nfor n in range(2):\n    y += await twice(n)\ny + await twice(1)"), "24\n");
    EXPECT_EQ(shown("[await twice(n) for n in range(3)]"), "[0, 2, 4]\n");
    EvalOptions statement;
    statement.codeType = CodeType::ConventionalType;
    EXPECT_EQ(client().eval("await twice(6)", statement).shown(), "12\n");
}

TEST_F(AwaitTest, WhatOneRequestBeginsTheNextAwaits) {
    client().eval("import asyncio");
    EXPECT_EQ(client()
                  .eval("event = asyncio.Event(); task = asyncio.ensure_future(event.wait(), "
                        "loop=(await asyncio.sleep(0)) or asyncio.get_running_loop())")
                  .errorText(),
              "");
    client().eval("event.set()");
    EXPECT_EQ(shown("await task"), "True\n");
    EXPECT_EQ(shown("asyncio.run(asyncio.sleep(0, 'own loop'))"), "'own loop'\n");
    EXPECT_EQ(shown("await asyncio.sleep(0, 'as before')"), "'as before'\n");
}

TEST_F(AwaitTest, ErrorsHaveTheStackOfTheCode) {
    const Evaluation result = client().eval("async def f():\n    1 / 0\nawait f()");
    EXPECT_EQ(result.errorId(), "ZeroDivisionError");
    // Those of the code; none of the loop.
    EXPECT_EQ(result.error->getStackFrames().size(), 2U);
}

TEST_F(AwaitTest, ACancelEndsItWithItsFinallyClauses) {
    const IDType id = client().enqueue(
        "import asyncio\n"
        "try:\n"
        "    asyncio.get_running_loop().call_soon(print, 'waits')\n"
        "    await asyncio.sleep(1000)\n"
        "finally:\n"
        "    await asyncio.sleep(0)\n"
        "    print('cleaned')");
    client().awaitText("waits");
    client().cancel(id);
    const Evaluation result = client().await(id);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_THAT(result.output(), HasSubstr("cleaned\n"));
    EXPECT_EQ(shown("await asyncio.sleep(0, 'next')"), "'next'\n");
}

TEST_F(InterruptedAwaitTest, ACancelEndsABusyCoroutineToo) {
    const IDType id =
        client().enqueue("import asyncio\nawait asyncio.sleep(0)\nprint('spins', flush=True)\nwhile True: pass");
    client().awaitText("spins");
    client().cancel(id);
    EXPECT_EQ(client().await(id).error->getExecutionStatus(), inEXECUTION_CTRLC);
    EXPECT_EQ(shown("await asyncio.sleep(0, 'next')"), "'next'\n");
}

TEST_F(AwaitTest, AtAPromptItAwaitsWhereNoLoopIsHeldUp) {
    EvalOptions atPrompt;
    atPrompt.mode = DEQUEUE_AT_DEBUG_PROMPT;
    client().eval("import asyncio");
    const IDType id = client().enqueue("def f(local):\n    breakpoint()\n    print(local)\nf(1)");
    client().awaitLoop(id, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().eval("local = await asyncio.sleep(0, local + 1)", atPrompt).errorText(), "");
    client().eval("import qvm; qvm.dbcont()", atPrompt);
    EXPECT_EQ(client().await(id).output(), "2\n");

    const IDType held = client().enqueue("async def g():\n    breakpoint()\nawait g()");
    client().awaitLoop(held, DebugLoopEvent::ENTER);
    EXPECT_EQ(client().eval("await asyncio.sleep(0)", atPrompt).errorText(),
              "await cannot be used at a prompt that holds up code of an event loop");
    client().eval("import qvm; qvm.dbcont()", atPrompt);
    EXPECT_EQ(client().await(held).errorText(), "");
}

TEST_F(AwaitTest, CodeThatDoesNotAwaitImportsNothingForIt) {
    client().eval("x = 1\nx + 1");
    EXPECT_EQ(shown("import sys\n'asyncio' in sys.modules"), "False\n");
}

}  // namespace
}  // namespace qvm_test
