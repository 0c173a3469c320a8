// Capabilities of the two ends, and requests that need them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "EngineFixture.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using cmddistributor::DebugLoopEvent;
using krutil::capabilities_api::CapabilitiesChanged;
using testing::Contains;
using testing::ElementsAre;
using testing::Not;

const CapabilityList kAsking{Capability::InteractiveCommandLine};
const CapabilityList kBoth{Capability::InteractiveCommandLine, Capability::Debugging};

EvalOptions needing(const CapabilityList& needed) {
    EvalOptions options;
    options.capabilities = needed;
    return options;
}

EvalOptions atPrompt() {
    EvalOptions options;
    options.mode = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PROMPT;
    return options;
}

TEST(CapabilityTest, EngineStatesItsOwnInTheHandshake) {
    EngineSession engine;
    EXPECT_EQ(engine.client.session().peer().capabilities, kBoth);
}

TEST(CapabilityTest, RequestThatNeedsMoreThanTheClientHasIsRefused) {
    EngineSession engine({}, {}, kAsking);
    const Evaluation result = engine.client.eval("print(1)", needing(kBoth));
    EXPECT_THAT(result.kinds(), ElementsAre("IIPDiscardedEvent", "LastIIPEvent"));
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), krutil::cmddistributor::inCOMM_ERROR);
    EXPECT_EQ(result.errorText(), "This request needs capabilities that the client does not have: Debugging.");
    EXPECT_EQ(engine.client.eval("print(1)", needing(kAsking)).output(), "1\n");
}

TEST(CapabilityTest, RequestThatNeedsMoreThanEitherHasNamesBoth) {
    EngineSession engine({}, {}, {Capability::WebWindow});
    const Evaluation result = engine.client.eval("1", needing({Capability::WebWindow, Capability::Debugging}));
    EXPECT_EQ(
        result.errorText(),
        "This request needs capabilities that the engine does not have: WebWindow. It needs capabilities that the "
        "client does not have: Debugging.");
}

TEST(CapabilityTest, ChangeOfTheClientCounts) {
    EngineSession engine({}, {}, {});
    EXPECT_TRUE(engine.client.eval("1", needing(kBoth)).discarded());
    engine.client.changeCapabilities(kBoth);
    EXPECT_FALSE(engine.client.eval("1", needing(kBoth)).discarded());
    const IDType id = engine.client.enqueue("print(input())");
    engine.client.awaitLoop(id, DebugLoopEvent::ENTER);
    engine.client.eval("now", atPrompt());
    EXPECT_EQ(engine.client.await(id).output(), "now\n");
    engine.client.changeCapabilities({});
    EXPECT_EQ(engine.client.eval("input()").errorId(), "EOFError");
}

TEST(CapabilityTest, EngineSwitchesItsDebuggerAndSaysSo) {
    EngineSession engine({}, {}, kBoth);
    const auto changes = [&engine] {
        std::vector<CapabilitiesChanged> found;
        for (const Happening& each : engine.client.background()) {
            if (const auto* const change = dynamic_cast<const CapabilitiesChanged*>(each.event.get())) {
                found.push_back(*change);
            }
        }
        return found;
    };
    EXPECT_FALSE(engine.client.eval("import qvm\nqvm.debugger(False)\nqvm.debugger(False)", needing(kAsking)).error);
    ASSERT_EQ(changes().size(), 1U);
    EXPECT_EQ(changes()[0].getPreviousCapabilities(), kBoth);
    EXPECT_EQ(changes()[0].getQvmCapabilities(), kAsking);
    EXPECT_EQ(changes()[0].getClientCapabilities(), kBoth);
    EXPECT_EQ(changes()[0].getRequestCapabilities(), kAsking);

    const Evaluation passed = engine.client.eval("breakpoint()");
    EXPECT_THAT(passed.kinds(), Contains("IssuedEnabledWarningEvent"));
    EXPECT_THAT(passed.kinds(), Not(Contains("DebugLoopEvent")));

    engine.client.eval("qvm.debugger()");
    ASSERT_EQ(changes().size(), 2U);
    EXPECT_EQ(changes()[1].getPreviousCapabilities(), kAsking);
    EXPECT_EQ(changes()[1].getQvmCapabilities(), kBoth);
    const IDType id = engine.client.enqueue("breakpoint()");
    engine.client.awaitLoop(id, DebugLoopEvent::ENTER);
    engine.client.eval("qvm.dbcont()", atPrompt());
    EXPECT_FALSE(engine.client.await(id).error);
}

}  // namespace
}  // namespace qvm_test
