// What happens while a session lasts.
#pragma once

namespace foundation::msg_svc::eventmgr {

struct BaseEvent {
    virtual ~BaseEvent() = default;
};

}  // namespace foundation::msg_svc::eventmgr
