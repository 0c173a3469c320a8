// Base of everything that is published.
#pragma once

namespace foundation::msg_svc::eventmgr {

/// Something that happened. Published through an EventMgr, or sent to a peer; never answered. Immutable once shared.
class BaseEvent {
  public:
    virtual ~BaseEvent();
};

}  // namespace foundation::msg_svc::eventmgr
