#include "cmddistributor/IIPStateEvent.hpp"

namespace cmddistributor {

RequestIdAdapter::~RequestIdAdapter() = default;
IIPStateEvent::~IIPStateEvent() = default;

const char* IIPStateEventTypes::getStartedEventType() {
    return "started";
}
const char* IIPStateEventTypes::getSuspendedEventType() {
    return "suspended";
}
const char* IIPStateEventTypes::getResumedEventType() {
    return "resumed";
}
const char* IIPStateEventTypes::getDiscardedEventType() {
    return "discarded";
}
const char* IIPStateEventTypes::getRequeuedEventType() {
    return "requeued";
}
const char* IIPStateEventTypes::getReactivatedEventType() {
    return "reactivated";
}
const char* IIPStateEventTypes::getCompletedEventType() {
    return "completed";
}
const char* IIPStateEventTypes::getLastEventType() {
    return "last";
}

}  // namespace cmddistributor
