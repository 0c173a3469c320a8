// The legal order of a request's events and its reply, as docs/protocol.md tells it under "The life of a request".
//
//     EXPECT_EQ(session_test::RequestLife::check({"IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent", "reply"}),
//     "");
#pragma once

#include <algorithm>
#include <array>
#include <string>
#include <string_view>
#include <vector>

namespace session_test {

/// Takes what happens on a request's stream, one by one: event classes by their names without namespace, and "reply".
class RequestLife {
  public:
    /// What is wrong with a whole life, from the enqueueing to the reply; empty for nothing.
    static std::string check(const std::vector<std::string>& happenings) {
        RequestLife life;
        for (const std::string& each : happenings) {
            if (std::string wrong = life.next(each); !wrong.empty()) {
                return wrong;
            }
        }
        return life.isDone() ? std::string() : "The life of a request ends without a reply, when " + life.describe();
    }

    /// What is wrong with `happening` at this point; empty for nothing.
    std::string next(std::string_view happening) {
        const auto row = std::find_if(kTable.begin(), kTable.end(), [&](const Row& each) {
            return each.state == state_ && each.happening == happening;
        });
        history_ += history_.empty() ? "" : ", ";
        history_ += happening;
        if (row == kTable.end()) {
            return "\"" + std::string(happening) + "\" must not come when " + describe();
        }
        state_ = row->next;
        return {};
    }

    bool isDone() const noexcept { return state_ == State::Done; }

  private:
    enum class State { Queued, Running, Suspended, Ended, Closed, Done };

    struct Row {
        State state;
        std::string_view happening;
        State next;
    };

    static constexpr std::array<Row, 15> kTable{{
        {State::Queued, "IIPStartedEvent", State::Running},
        {State::Queued, "IIPDiscardedEvent", State::Ended},
        {State::Queued, "IIPReactivatedEvent", State::Queued},
        {State::Queued, "IIPRequeuedEvent", State::Queued},
        {State::Running, "TextBaseEvent", State::Running},
        {State::Running, "SinkTextEvent", State::Running},
        {State::Running, "IssuedWarningEvent", State::Running},
        {State::Running, "IssuedEnabledWarningEvent", State::Running},
        {State::Running, "PrintableErrorEvent", State::Running},
        {State::Running, "IIPSuspendedEvent", State::Suspended},
        {State::Suspended, "DebugLoopEvent", State::Suspended},
        {State::Suspended, "IIPResumedEvent", State::Running},
        {State::Running, "IIPCompletedEvent", State::Ended},
        {State::Ended, "LastIIPEvent", State::Closed},
        {State::Closed, "reply", State::Done},
    }};

    std::string describe() const {
        static constexpr std::array<const char*, 6> names{"queued", "running", "suspended", "ended", "closed", "done"};
        return std::string("the request is ") + names[static_cast<std::size_t>(state_)] + " (so far: " + history_ + ")";
    }

    State state_ = State::Queued;
    std::string history_;
};

}  // namespace session_test
