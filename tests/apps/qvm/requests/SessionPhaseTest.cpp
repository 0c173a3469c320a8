// The end of a session, step by step.
#include "qvm/requests/SessionPhase.hpp"

#include <gtest/gtest.h>

#include <initializer_list>

namespace qvm_test {
namespace {

using qvm::next;
using qvm::SessionPhase;
using qvm::SessionStep;

SessionPhase after(std::initializer_list<SessionStep> steps) {
    SessionPhase phase = SessionPhase::Serving;
    for (const SessionStep step : steps) {
        phase = next(phase, step);
    }
    return phase;
}

TEST(SessionPhaseTest, EveryStepFromEveryPhaseHasItsPlace) {
    struct Row {
        SessionPhase from, shutDown, leave, end;
    };
    using enum SessionPhase;
    for (const Row& row : {
             Row{Serving, ShutDown, Left, Lost},
             Row{ShutDown, ShutDown, Left, Lost},
             Row{Left, Left, Left, Done},
             Row{Lost, Lost, Done, Lost},
             Row{Done, Done, Done, Done},
         }) {
        SCOPED_TRACE(static_cast<int>(row.from));
        EXPECT_EQ(next(row.from, SessionStep::ShutDown), row.shutDown);
        EXPECT_EQ(next(row.from, SessionStep::Leave), row.leave);
        EXPECT_EQ(next(row.from, SessionStep::End), row.end);
    }
}

TEST(SessionPhaseTest, BothThreadsAreDoneInEitherOrder) {
    EXPECT_EQ(after({SessionStep::ShutDown, SessionStep::Leave, SessionStep::End}), SessionPhase::Done);
    EXPECT_EQ(after({SessionStep::ShutDown, SessionStep::End, SessionStep::Leave}), SessionPhase::Done);
    EXPECT_EQ(after({SessionStep::End, SessionStep::ShutDown, SessionStep::Leave}), SessionPhase::Done);
    EXPECT_EQ(after({SessionStep::Leave, SessionStep::End}), SessionPhase::Done);
}

}  // namespace
}  // namespace qvm_test
