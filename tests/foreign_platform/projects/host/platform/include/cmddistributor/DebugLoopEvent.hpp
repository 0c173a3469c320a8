// An input loop begins or ends. Immutable.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::prompt {

/// As many as there are, one after the other.
enum class InputRequester : int { none = -1, outermost = 0, innermost = 11 };

}  // namespace krutil::prompt

namespace cmddistributor {

class DebugLoopEvent : public foundation::msg_svc::eventmgr::BaseEvent, public RequestIdAdapter {
  public:
    enum class State : int { over = 1, begun };

    DebugLoopEvent(foundation::msg_svc::exchange::IDType of, State state, krutil::prompt::InputRequester loop)
        : RequestIdAdapter(of), loop_(loop), state_(state) {}

    krutil::prompt::InputRequester getWhichDebugLoop() const { return loop_; }
    State getLoopState() const { return state_; }

  private:
    krutil::prompt::InputRequester loop_;
    State state_;
};

}  // namespace cmddistributor
