// The engine enters or leaves an input loop.
#pragma once

#include <cstdint>

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "krutil/prompt/InputRequester.hpp"

namespace cmddistributor {

/// Immutable.
class DebugLoopEvent : public foundation::msg_svc::eventmgr::BaseEvent, public RequestIdAdapter {
  public:
    /// Numbers are those of the wire.
    enum State : std::int32_t {
        EXIT = 1,
        ENTER = 2,
    };

    /// `id` is that of the request whose prompt it is. Writing a `state` that is neither of the two ends the process.
    DebugLoopEvent(foundation::msg_svc::exchange::IDType id, State state, krutil::prompt::InputRequester whichLoop);
    ~DebugLoopEvent() override;

    /// Whether the loop is entered or left.
    State getLoopState() const noexcept { return state_; }
    /// The kind of prompt at which the loop reads.
    krutil::prompt::InputRequester getWhichDebugLoop() const noexcept { return whichLoop_; }

  private:
    State state_;
    krutil::prompt::InputRequester whichLoop_;
};

}  // namespace cmddistributor
