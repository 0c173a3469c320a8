// The legal order of a request's events and its reply, as docs/protocol.md tells it under "The life of a request".
//
//     EXPECT_EQ(programs_test::RequestLife::check(
//                   {"IIPStartedEvent", "IIPCompletedEvent", "LastIIPEvent", "IIPReply"}), "");
#pragma once

#include <algorithm>
#include <array>
#include <string>
#include <string_view>
#include <vector>

namespace programs_test {

/// Takes what happens on a request's stream, one by one: classes of events and of the reply, by their names without
/// namespace. A plain value.
class RequestLife {
  public:
    /// One way to go on: what may happen in a state, and the state that it leads to.
    struct Row {
        std::string_view state;
        std::string_view happening;
        std::string_view next;
    };

    /// All ways to go on; a life begins in the first row's state.
    static constexpr std::array<Row, 15> table{{
        {"queued", "IIPStartedEvent", "running"},
        {"queued", "IIPDiscardedEvent", "ended"},
        {"queued", "IIPReactivatedEvent", "queued"},
        {"queued", "IIPRequeuedEvent", "queued"},
        {"running", "TextBaseEvent", "running"},
        {"running", "SinkTextEvent", "running"},
        {"running", "IssuedWarningEvent", "running"},
        {"running", "IssuedEnabledWarningEvent", "running"},
        {"running", "PrintableErrorEvent", "running"},
        {"running", "IIPSuspendedEvent", "suspended"},
        {"suspended", "DebugLoopEvent", "suspended"},
        {"suspended", "IIPResumedEvent", "running"},
        {"running", "IIPCompletedEvent", "ended"},
        {"ended", "LastIIPEvent", "closed"},
        {"closed", "IIPReply", "done"},
    }};

    /// What is wrong with a whole life, from the enqueueing to the reply; empty for nothing.
    static std::string check(const std::vector<std::string>& happenings) {
        RequestLife life;
        for (const std::string& each : happenings) {
            if (std::string wrong = life.next(each); !wrong.empty()) {
                return wrong;
            }
        }
        return life.whatIsMissing();
    }

    /// What is wrong with `happening` at this point; empty for nothing.
    std::string next(std::string_view happening) {
        const auto row = std::find_if(table.begin(), table.end(), [&](const Row& each) {
            return each.state == state_ && each.happening == happening;
        });
        if (row == table.end()) {
            return "\"" + std::string(happening) + "\" must not come when " + describe();
        }
        note(happening);
        state_ = row->next;
        return {};
    }

    bool isDone() const noexcept { return state_ == "done"; }

    /// What is wrong with a life that is over now; empty for nothing.
    std::string whatIsMissing() const {
        return isDone() ? std::string() : "the life of a request must not end when " + describe();
    }

  private:
    // Runs of one happening, such as texts, are one entry.
    struct Repeated {
        std::string happening;
        std::size_t times;
    };

    void note(std::string_view happening) {
        if (history_.empty() || history_.back().happening != happening) {
            history_.push_back({std::string(happening), 0});
        }
        ++history_.back().times;
    }

    std::string describe() const {
        std::string text = "the request is " + std::string(state_) + " (so far: ";
        for (const Repeated& each : history_) {
            text += &each == history_.data() ? "" : ", ";
            text += each.happening + (each.times > 1 ? " x " + std::to_string(each.times) : std::string());
        }
        return text + (history_.empty() ? "nothing)" : ")");
    }

    std::string_view state_ = table.front().state;
    std::vector<Repeated> history_;
};

}  // namespace programs_test
