#include "qvm/requests/Prompts.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <chrono>

#include "apps/qvm/requests/ServedClient.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using capabilities::CapabilityList;
using krutil::prompt::InputRequester;
using qvm::Cancellation;
using qvm::PromptEnd;
using qvm::Prompts;
using qvm::Request;
using qvm::RequestQueue;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr auto keyboard = InputRequester::mnKEYBOARD_PROMPT;
constexpr auto debug = InputRequester::mnDEBUG_PROMPT;
constexpr auto pause = InputRequester::mnPAUSE_PROMPT;

// Prompts of a request that runs, which is number 1. The test is the thread that runs code.
class PromptsTest : public testing::Test, protected qvm::PromptHost {
  protected:
    PromptsTest() {
        // An interrupt comes with a signal, whose default would end the process.
        struct sigaction action {};
        action.sa_handler = [](int) {};
        ::sigaction(Cancellation::signal(), &action, nullptr);
        capabilities_.setClient({Capability::InteractiveCommandLine, Capability::Debugging});
        outer_ = client_.send({});
        begin(outer_);
    }

    bool interrupted() override { return cancellation_.takeInterrupt(); }
    void unlocked(const std::function<void()>& wait) override {
        if (beforeWait_) {
            beforeWait_();
        }
        wait();
    }
    void settle() override { ++settled_; }

    void begin(const Request& request) {
        cancellation_.begin(request.id());
        output_.begin(request);
        prompts_.begin(request);
    }

    void end() {
        prompts_.end();
        output_.end();
        cancellation_.end();
    }

    // A request that waits for a prompt.
    Request wait(std::uint64_t number, WhenToDequeue mode = DEQUEUE_AT_PROMPT, const std::u16string& code = u"code") {
        RequestParts parts;
        parts.number = number;
        parts.mode = mode;
        parts.code = code;
        return wait(parts);
    }

    Request wait(const RequestParts& parts) {
        Request request = client_.send(parts);
        EXPECT_EQ(queue_.put(request), RequestQueue::Put::Taken);
        return request;
    }

    // Runs requests at a prompt: notes each, does what `during` says while it runs, and ends it.
    PromptEnd takeCommands(InputRequester loop, RequestQueue::Deadline deadline = {}) {
        return prompts_.takeCommands(loop, deadline, [this](const Request& request) {
            output_.begin(request);
            prompts_.begin(request);
            ran_.push_back(request.id().lo());
            const bool goesOn = !during_ || during_(request);
            end();
            return goesOn;
        });
    }

    ServedClient client_;
    RequestQueue queue_{{}};
    qvm::TextOutput output_{{},
                            [this](const qvm::TextTarget& target, std::u16string text) {
                                client_.announcer().announceText(target, std::move(text));
                            },
                            [](qvm::FlushTimer::Time) {}};
    Cancellation cancellation_;
    qvm::Capabilities capabilities_{{Capability::InteractiveCommandLine, Capability::Debugging}};
    Prompts prompts_{queue_, client_.announcer(), output_, cancellation_, capabilities_, *this};
    Request outer_;
    std::function<void()> beforeWait_;
    std::function<bool(const Request&)> during_;
    std::vector<std::uint64_t> ran_;
    int settled_ = 0;
};

TEST_F(PromptsTest, RequestRunsUnlessItsPromptHoldsItUp) {
    EXPECT_EQ(prompts_.current()->id(), outer_.id());
    EXPECT_FALSE(prompts_.isInner());
    wait(2, DEQUEUE_AT_PPE);
    beforeWait_ = [&] { EXPECT_EQ(prompts_.current(), nullptr); };
    during_ = [&](const Request& request) {
        EXPECT_EQ(prompts_.current()->id(), request.id());
        EXPECT_TRUE(prompts_.isInner());
        return prompts_.leave(PromptEnd::Continued);
    };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2));
    EXPECT_EQ(prompts_.current()->id(), outer_.id());
    end();
    EXPECT_EQ(prompts_.current(), nullptr);
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 3", "1 exit 3", "1 resumed"));
}

TEST_F(PromptsTest, RequestThatLacksNothingIsAdmitted) {
    RequestParts parts;
    parts.number = 2;
    parts.needs = {Capability::Debugging};
    EXPECT_TRUE(prompts_.admit(client_.send(parts)));
    EXPECT_THAT(client_.received(), IsEmpty());
}

TEST_F(PromptsTest, RequestThatNeedsWhatOneEndLacksIsRefusedAndHasEnded) {
    RequestParts parts;
    parts.number = 2;
    parts.needs = {Capability::Swing};
    const Request request = client_.send(parts);
    cancellation_.begin(request.id());
    EXPECT_FALSE(prompts_.admit(request));
    EXPECT_EQ(cancellation_.cancel(request.id(), true), Cancellation::Effect::NotRunning);
    EXPECT_THAT(client_.received(),
                ElementsAre("2 discarded", "2 last",
                            "2 reply 5 This request needs capabilities that the engine does not have: Swing. It needs "
                            "capabilities that the client does not have: Swing."));
}

TEST_F(PromptsTest, InputIsTheTextOfTheNextRequest) {
    wait(2, DEQUEUE_AT_PPE);
    wait(3, DEQUEUE_AT_PROMPT, u"an answer");
    std::u16string text;
    EXPECT_EQ(prompts_.takeText(text), PromptEnd::Continued);
    EXPECT_EQ(text, u"an answer");
    EXPECT_EQ(settled_, 1);
    EXPECT_EQ(cancellation_.cancel(foundation::msg_svc::exchange::IDType(0, 3), true),
              Cancellation::Effect::NotRunning);
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 2", "3 started", "3 completed", "3 last",
                                                "3 reply", "1 exit 2", "1 resumed"));
}

TEST_F(PromptsTest, OutputSoFarStandsBeforeThePrompt) {
    output_.write(qvm::TextSource::Output, u"name? ");
    wait(2);
    std::u16string text;
    prompts_.takeText(text);
    output_.write(qvm::TextSource::Output, u"thanks\n");
    EXPECT_THAT(client_.received(),
                ElementsAre("1 text 0 name? ", "1 suspended", "1 enter 2", "2 started", "2 completed", "2 last",
                            "2 reply", "1 exit 2", "1 resumed", "1 text 0 thanks\n"));
}

TEST_F(PromptsTest, EndOfTransmissionIsTheEndOfInput) {
    wait(2, DEQUEUE_AT_PROMPT, u"\u0004");
    std::u16string text;
    EXPECT_EQ(prompts_.takeText(text), PromptEnd::EndOfInput);
}

TEST_F(PromptsTest, CallAtAnInputPromptIsRefusedAndTheNextLineTaken) {
    RequestParts call;
    call.number = 2;
    call.mode = DEQUEUE_AT_PROMPT;
    call.function = "len";
    wait(call);
    wait(3, DEQUEUE_AT_PROMPT, u"line");
    std::u16string text;
    EXPECT_EQ(prompts_.takeText(text), PromptEnd::Continued);
    EXPECT_EQ(text, u"line");
    EXPECT_EQ(settled_, 2);
    EXPECT_THAT(client_.received(),
                ElementsAre("1 suspended", "1 enter 2", "2 discarded", "2 last",
                            "2 reply 5 An input prompt takes a line of text, not a function call.", "3 started",
                            "3 completed", "3 last", "3 reply", "1 exit 2", "1 resumed"));
}

TEST_F(PromptsTest, WhatThePromptLeavesBehindGoesBackAndIsTakenByTheNextOne) {
    wait(2);
    wait(3);
    during_ = [&](const Request&) { return prompts_.leave(PromptEnd::Continued); };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2));
    EXPECT_EQ(takeCommands(debug), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2, 3));
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 3", "3 requeued", "1 exit 3", "1 resumed",
                                                "1 suspended", "1 enter 1", "3 reactivated", "1 exit 1", "1 resumed"));
}

TEST_F(PromptsTest, RequestsThatNeedMoreThanThereIsAreRefusedAtAPromptToo) {
    RequestParts parts;
    parts.number = 2;
    parts.mode = DEQUEUE_AT_PROMPT;
    parts.needs = {Capability::Swing};
    wait(parts);
    wait(3);
    during_ = [&](const Request&) { return prompts_.leave(PromptEnd::Quit); };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Quit);
    EXPECT_THAT(ran_, ElementsAre(3));
    EXPECT_EQ(settled_, 2);
}

TEST_F(PromptsTest, RequestThatEndsTheSessionEndsThePrompt) {
    wait(2);
    wait(3);
    during_ = [](const Request&) { return false; };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Exit);
    EXPECT_THAT(ran_, ElementsAre(2));
}

TEST_F(PromptsTest, OnlyAPromptForCommandsCanBeLeft) {
    EXPECT_FALSE(prompts_.leave(PromptEnd::Continued));
    wait(2);
    during_ = [&](const Request&) {
        // Another prompt, for a line, inside the one that is left.
        wait(3, DEQUEUE_AT_PROMPT, u"line");
        beforeWait_ = [&] { EXPECT_FALSE(prompts_.leave(PromptEnd::Quit)); };
        std::u16string text;
        EXPECT_EQ(prompts_.takeText(text), PromptEnd::Continued);
        beforeWait_ = nullptr;
        return prompts_.leave(PromptEnd::Quit);
    };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Quit);
    EXPECT_THAT(client_.received(),
                ElementsAre("1 suspended", "1 enter 3", "2 suspended", "2 enter 2", "3 started", "3 completed",
                            "3 last", "3 reply", "2 exit 2", "2 resumed", "1 exit 3", "1 resumed"));
}

TEST_F(PromptsTest, PauseEndsWithTheFirstRequestThatIsNoAside) {
    wait(2, DEQUEUE_AT_PPE);
    wait(3, DEQUEUE_AT_PAUSE);
    wait(4, DEQUEUE_AT_PAUSE);
    EXPECT_EQ(takeCommands(pause), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2, 3));
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 4", "4 requeued", "1 exit 4", "1 resumed"));
}

TEST_F(PromptsTest, PauseHasNothingToQuit) {
    wait(2, DEQUEUE_AT_PPE);
    during_ = [&](const Request&) { return prompts_.leave(PromptEnd::Quit); };
    EXPECT_EQ(takeCommands(pause), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2));
}

TEST_F(PromptsTest, PauseIsOverAfterItsTime) {
    EXPECT_EQ(takeCommands(pause, std::chrono::steady_clock::now()), PromptEnd::Continued);
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 4", "1 exit 4", "1 resumed"));
}

TEST_F(PromptsTest, AfterAGoodbyeWhatIsDueIsTakenAndThenThePromptCloses) {
    wait(2);
    queue_.end();
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Quit);
    EXPECT_THAT(ran_, ElementsAre(2));
    EXPECT_EQ(takeCommands(debug), PromptEnd::Quit);
    EXPECT_EQ(takeCommands(pause), PromptEnd::Continued);
    std::u16string text;
    EXPECT_EQ(prompts_.takeText(text), PromptEnd::EndOfInput);
}

TEST_F(PromptsTest, ClientThatTakesItsCapabilityBackWithdrawsThePrompt) {
    wait(2);
    capabilities_.setClient({Capability::Debugging});
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Withdrawn);
    EXPECT_THAT(ran_, ElementsAre(2)) << "what was sent before is an answer still";
    capabilities_.setClient({Capability::InteractiveCommandLine});
    EXPECT_EQ(takeCommands(debug), PromptEnd::Withdrawn);
    std::u16string text;
    wait(3, DEQUEUE_AT_PROMPT, u"line");
    EXPECT_EQ(prompts_.takeText(text), PromptEnd::Continued);
}

TEST_F(PromptsTest, InterruptBeforeTheWaitRaises) {
    wait(2);
    EXPECT_EQ(cancellation_.cancel(outer_.id(), true), Cancellation::Effect::Interrupted);
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Raised);
    EXPECT_THAT(ran_, IsEmpty());
}

TEST_F(PromptsTest, InterruptDuringTheWaitRaises) {
    beforeWait_ = [&] { cancellation_.cancel(outer_.id(), true); };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Raised);
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 3", "1 exit 3", "1 resumed"));
}

TEST_F(PromptsTest, InterruptOfTheOuterRequestDuringAnInnerOneRaisesWhenThatHasEnded) {
    wait(2);
    wait(3);
    during_ = [&](const Request&) {
        cancellation_.cancel(outer_.id(), true);
        // The inner request is interrupted first.
        EXPECT_TRUE(interrupted());
        EXPECT_FALSE(interrupted());
        return true;
    };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Raised);
    EXPECT_THAT(ran_, ElementsAre(2));
    EXPECT_THAT(client_.received(), ElementsAre("1 suspended", "1 enter 3", "3 requeued", "1 exit 3", "1 resumed"));
}

TEST_F(PromptsTest, InterruptOfAnInnerRequestLeavesThePromptOpen) {
    wait(2);
    wait(3);
    during_ = [&](const Request& request) {
        if (request.id().lo() == 3) {
            return prompts_.leave(PromptEnd::Continued);
        }
        cancellation_.cancel(request.id(), true);
        EXPECT_TRUE(interrupted());
        return true;
    };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Continued);
    EXPECT_THAT(ran_, ElementsAre(2, 3));
}

TEST_F(PromptsTest, OtherInterruptionsOfTheWaitGoOnWaiting) {
    int waits = 0;
    beforeWait_ = [&] {
        if (++waits < 3) {
            queue_.interruptWait();
        } else {
            wait(2);
        }
    };
    during_ = [&](const Request&) { return prompts_.leave(PromptEnd::Continued); };
    EXPECT_EQ(takeCommands(keyboard), PromptEnd::Continued);
    EXPECT_EQ(waits, 3);
}

}  // namespace
}  // namespace qvm_test
