// The engine is shutting down.
#pragma once

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::eventmgr {

/// Carries no data; it is the last thing that an engine sends in a session.
class QVMShutdownEvent : public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    QVMShutdownEvent();
    ~QVMShutdownEvent() override;
};

}  // namespace krutil::eventmgr
