// Capabilities of the two ends, and requests that need them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "krutil/capabilities_api/CapabilitiesChanged.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using capabilities::Capability;
using capabilities::CapabilityList;
using cmddistributor::DebugLoopEvent;
using krutil::capabilities_api::CapabilitiesChanged;
using msg_svc::protobuf::ustring_to_utf8;
using testing::Contains;
using testing::ElementsAre;
using testing::Not;

const CapabilityList asking{Capability::InteractiveCommandLine};
const CapabilityList both{Capability::InteractiveCommandLine, Capability::Debugging};

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

TEST(EngineCapabilityTest, EngineStatesItsOwnInTheHandshake) {
    EngineSession engine;
    EXPECT_EQ(engine.client.session().peer().capabilities,
              (CapabilityList{Capability::InteractiveCommandLine, Capability::WebWindow, Capability::Debugging}));
}

TEST(EngineCapabilityTest, RequestThatNeedsMoreThanTheClientHasIsRefused) {
    EngineSession engine({}, {}, asking);
    const Evaluation result = engine.client.eval("print(1)", needing(both));
    EXPECT_THAT(result.kinds(), ElementsAre("IIPDiscardedEvent", "LastIIPEvent"));
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), krutil::cmddistributor::inCOMM_ERROR);
    EXPECT_EQ(result.errorText(), "This request needs capabilities that the client does not have: Debugging.");
    EXPECT_EQ(engine.client.eval("print(1)", needing(asking)).output(), "1\n");
}

TEST(EngineCapabilityTest, RequestThatNeedsMoreThanEitherHasNamesBoth) {
    EngineSession engine({}, {}, {Capability::ModalDialogs});
    const Evaluation result = engine.client.eval("1", needing({Capability::ModalDialogs, Capability::Debugging}));
    EXPECT_EQ(
        result.errorText(),
        "This request needs capabilities that the engine does not have: ModalDialogs. It needs capabilities that the "
        "client does not have: Debugging.");
}

TEST(EngineCapabilityTest, ChangeOfTheClientCounts) {
    EngineSession engine({}, {}, {});
    EXPECT_TRUE(engine.client.eval("1", needing(both)).discarded());
    engine.client.changeCapabilities(both);
    EXPECT_FALSE(engine.client.eval("1", needing(both)).discarded());
    const IDType id = engine.client.enqueue("print(input())");
    engine.client.awaitLoop(id, DebugLoopEvent::ENTER);
    engine.client.eval("now", atPrompt());
    EXPECT_EQ(engine.client.await(id).output(), "now\n");
    engine.client.changeCapabilities({});
    EXPECT_EQ(engine.client.eval("input()").errorId(), "EOFError");
}

class WithdrawalTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    IDType stopped(const std::string& code, const EvalOptions& options = {}) {
        const IDType id = client().enqueue(code, options);
        client().awaitLoop(id, DebugLoopEvent::ENTER);
        return id;
    }

    // Waits until the engine has taken everything that was sent.
    void settle() { client().cancel(IDType::random()); }

    static std::string warningOf(const Evaluation& result) {
        for (const Happening& each : result.events) {
            if (const auto* const issued =
                    dynamic_cast<const korvel::lang::diagnostic::IssuedEnabledWarningEvent*>(each.event.get())) {
                return ustring_to_utf8(issued->getWarning().getMessage());
            }
        }
        return "none";
    }

    EngineSession engine_{{}, {}, both};
};

TEST_F(WithdrawalTest, InputPromptIsAtItsEnd) {
    const IDType id = stopped("input('? ')");
    client().changeCapabilities({Capability::Debugging});
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.errorId(), "EOFError");
    EXPECT_THAT(result.kinds(),
                ElementsAre("IIPStartedEvent", "TextBaseEvent", "IIPSuspendedEvent", "DebugLoopEvent", "DebugLoopEvent",
                            "IIPResumedEvent", "PrintableErrorEvent", "IIPCompletedEvent", "LastIIPEvent"));
    client().changeCapabilities(asking);
    const IDType again = stopped("input('? ')");
    client().eval("line", atPrompt());
    EXPECT_EQ(client().await(again).shown(), "'line'\n");
}

TEST_F(WithdrawalTest, AnswerThatWasSentBeforeCounts) {
    const IDType id = stopped("print(input())");
    const IDType answer = client().enqueue("in time", atPrompt());
    client().changeCapabilities({});
    EXPECT_FALSE(client().await(answer).error);
    EXPECT_EQ(client().await(id).output(), "in time\n");
}

TEST_F(WithdrawalTest, OtherCapabilitiesDoNotMatter) {
    const IDType id = stopped("print(input())");
    client().changeCapabilities(asking);
    settle();
    EXPECT_FALSE(client().eval("still there", atPrompt()).error);
    EXPECT_EQ(client().await(id).output(), "still there\n");
}

TEST_F(WithdrawalTest, DebugPromptGoesOn) {
    const IDType id = stopped("breakpoint()\nprint('on')");
    client().changeCapabilities(asking);
    const Evaluation result = client().await(id);
    EXPECT_FALSE(result.error);
    EXPECT_EQ(result.output(), "on\n");
    EXPECT_EQ(warningOf(result), "breakpoint() goes on: the client has no debugger any more");
    EXPECT_THAT(result.kinds(),
                ElementsAre("IIPStartedEvent", "SinkTextEvent", "IIPSuspendedEvent", "DebugLoopEvent", "DebugLoopEvent",
                            "IIPResumedEvent", "IssuedWarningEvent", "IssuedEnabledWarningEvent", "TextBaseEvent",
                            "IIPCompletedEvent", "LastIIPEvent"));
}

TEST_F(WithdrawalTest, RequestAtAPromptRunsToItsEnd) {
    Gate gate;
    const IDType outer = stopped("breakpoint()\nprint('on')");
    const IDType inner = client().enqueue(gate.wait() + "\nprint('inner')", atPrompt());
    client().awaitKind(inner, "IIPStartedEvent");
    client().changeCapabilities({});
    settle();
    gate.open();
    EXPECT_EQ(client().await(inner).output(), "inner\n");
    EXPECT_EQ(client().await(outer).output(), "on\n");
}

TEST_F(WithdrawalTest, NestedPromptsEndFromTheInnermost) {
    const IDType outer = stopped("breakpoint()\nprint('on')");
    const IDType inner = stopped("input()", atPrompt());
    client().changeCapabilities({});
    EXPECT_EQ(client().await(inner).errorId(), "EOFError");
    EXPECT_EQ(client().await(outer).output(), "on\n");
}

TEST_F(WithdrawalTest, KeyboardAndPauseGoOn) {
    const IDType keyboard = stopped("import qvm\nqvm.keyboard()\nprint('on')");
    client().changeCapabilities({});
    const Evaluation left = client().await(keyboard);
    EXPECT_EQ(left.output(), "on\n");
    EXPECT_EQ(warningOf(left), "qvm.keyboard() goes on: the client cannot be asked any more");

    client().changeCapabilities(both);
    const IDType pause = stopped("qvm.pause()\nprint('on')");
    client().changeCapabilities({});
    const Evaluation paused = client().await(pause);
    EXPECT_EQ(paused.output(), "on\n");
    EXPECT_EQ(warningOf(paused), "qvm.pause() goes on: the client cannot be asked");
}

TEST_F(WithdrawalTest, PauseLastsItsSecondsAllTheSame) {
    const IDType id = stopped("import qvm\nqvm.pause(1000)\nprint('over')");
    client().changeCapabilities({});
    client().awaitLoop(id, DebugLoopEvent::EXIT);
    // Only a cancel ends it now.
    client().awaitKind(id, "IIPResumedEvent");
    EXPECT_EQ(client().cancel(id), cmddistributor::IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    EXPECT_EQ(result.errorId(), "KeyboardInterrupt");
    EXPECT_EQ(warningOf(result), "none");
}

TEST(EngineCapabilityTest, EngineSwitchesItsDebuggerAndSaysSo) {
    EngineSession engine({}, {}, both);
    const auto changes = [&engine] {
        std::vector<CapabilitiesChanged> found;
        for (const Happening& each : engine.client.background()) {
            if (const auto* const change = dynamic_cast<const CapabilitiesChanged*>(each.event.get())) {
                found.push_back(*change);
            }
        }
        return found;
    };
    EXPECT_FALSE(engine.client.eval("import qvm\nqvm.debugger(False)\nqvm.debugger(False)", needing(asking)).error);
    ASSERT_EQ(changes().size(), 1U);
    EXPECT_EQ(changes()[0].getPreviousCapabilities(), both);
    EXPECT_EQ(changes()[0].getQvmCapabilities(),
              (CapabilityList{Capability::InteractiveCommandLine, Capability::WebWindow}));
    EXPECT_EQ(changes()[0].getClientCapabilities(), both);
    EXPECT_EQ(changes()[0].getRequestCapabilities(), asking);

    const Evaluation passed = engine.client.eval("breakpoint()");
    EXPECT_THAT(passed.kinds(), Contains("IssuedEnabledWarningEvent"));
    EXPECT_THAT(passed.kinds(), Not(Contains("DebugLoopEvent")));

    engine.client.eval("qvm.debugger()");
    ASSERT_EQ(changes().size(), 2U);
    EXPECT_EQ(changes()[1].getPreviousCapabilities(), asking);
    EXPECT_EQ(changes()[1].getQvmCapabilities(), engine.client.session().peer().capabilities);
    const IDType id = engine.client.enqueue("breakpoint()");
    engine.client.awaitLoop(id, DebugLoopEvent::ENTER);
    engine.client.eval("qvm.dbcont()", atPrompt());
    EXPECT_FALSE(engine.client.await(id).error);
}

}  // namespace
}  // namespace qvm_test
