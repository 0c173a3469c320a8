#include "cmddistributor/DebugLoopEvent.hpp"

namespace cmddistributor {

DebugLoopEvent::DebugLoopEvent(foundation::msg_svc::exchange::IDType id, State state,
                               krutil::prompt::InputRequester whichLoop)
    : RequestIdAdapter(id), state_(state), whichLoop_(whichLoop) {}

DebugLoopEvent::~DebugLoopEvent() = default;

}  // namespace cmddistributor
