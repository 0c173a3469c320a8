#include "krutil/eventmgr/QVMShutdownEvent.hpp"

namespace krutil::eventmgr {

QVMShutdownEvent::QVMShutdownEvent() = default;
QVMShutdownEvent::~QVMShutdownEvent() = default;

}  // namespace krutil::eventmgr
