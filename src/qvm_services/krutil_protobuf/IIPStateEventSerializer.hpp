// The eight kinds of state events: one message, one serializer template, a name and a number for each kind.
#pragma once

#include <boost/make_shared.hpp>
#include <string>

#include "FieldConversions.hpp"
#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil.protobuf.IIPStateEvent.pb.h"

namespace krutil::protobuf_serializer {

/// The registered name of the kind with this number. Throws std::out_of_range for a number above 7.
std::string stateEventName(std::size_t type);

/// The number of each event class.
template <class EventT>
inline constexpr protobuf::IIPStateEventType stateEventType = protobuf::IIPStateEventType(-1);
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPStartedEvent> = protobuf::IIPStartedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPSuspendedEvent> = protobuf::IIPSuspendedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPResumedEvent> = protobuf::IIPResumedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPDiscardedEvent> = protobuf::IIPDiscardedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPRequeuedEvent> = protobuf::IIPRequeuedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPReactivatedEvent> = protobuf::IIPReactivatedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::IIPCompletedEvent> = protobuf::IIPCompletedEvent;
template <>
inline constexpr auto stateEventType<::cmddistributor::detail::LastIIPEvent> = protobuf::LastIIPEvent;

/// Handles events of exactly the class `EventT`. The number on the wire is the serializer's own on the way out and is
/// ignored on the way in: the frame's tag has settled the kind.
template <class EventT>
class IIPStateEventSerializer final
    : public TaggedSerializer<IIPStateEventSerializer<EventT>, EventFamily, EventT, protobuf::IIPStateEvent> {
  public:
    IIPStateEventSerializer()
        : TaggedSerializer<IIPStateEventSerializer, EventFamily, EventT, protobuf::IIPStateEvent>(
              stateEventName(static_cast<std::size_t>(stateEventType<EventT>))) {}

    static protobuf::IIPStateEvent toProtobuf(const EventT& event) {
        protobuf::IIPStateEvent proto;
        *proto.mutable_id() = IDTypeSerializer::toProtobuf(event.getRequestId());
        proto.set_type(stateEventType<EventT>);
        return proto;
    }

    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::IIPStateEvent& proto) {
        return boost::make_shared<EventT>(IDTypeSerializer::fromProtobuf(proto.id()));
    }
};

}  // namespace krutil::protobuf_serializer
