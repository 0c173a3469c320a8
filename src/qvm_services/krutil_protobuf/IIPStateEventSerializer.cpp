#include "IIPStateEventSerializer.hpp"

#include <array>

namespace krutil::protobuf_serializer {
namespace {

// Indexed by the number on the wire. The last name alone has a segment more; peers match it so.
constexpr std::array<const char*, 8> names{
    "krutil:IIPStartedEvent",  "krutil:IIPSuspendedEvent",   "krutil:IIPResumedEvent",   "krutil:IIPDiscardedEvent",
    "krutil:IIPRequeuedEvent", "krutil:IIPReactivatedEvent", "krutil:IIPCompletedEvent", "krutil:detail::LastIIPEvent"};

}  // namespace

std::string stateEventName(std::size_t type) {
    return names.at(type);
}

}  // namespace krutil::protobuf_serializer
