// The engine goes down.
#pragma once

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::eventmgr {

struct QVMShutdownEvent : foundation::msg_svc::eventmgr::BaseEvent {};

}  // namespace krutil::eventmgr
