// The eight kinds of state events: one message, one serializer template, a name and a number for each kind.
#pragma once

#include <boost/make_shared.hpp>
#include <string>

#include "FieldConversions.hpp"
#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil.protobuf.IIPStateEvent.pb.h"

namespace krutil::protobuf_serializer {

/// The eight kinds; a platform need not have names for them. The last event is a completed event besides.
using ::cmddistributor::DefaultIIPStateEvent;
using ::cmddistributor::IIPStateEvent;
using ::cmddistributor::IIPStateEventTypes;
using StartedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getStartedEventType, IIPStateEvent>;
using SuspendedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getSuspendedEventType, IIPStateEvent>;
using ResumedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getResumedEventType, IIPStateEvent>;
using DiscardedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getDiscardedEventType, IIPStateEvent>;
using RequeuedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getRequeuedEventType, IIPStateEvent>;
using ReactivatedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getReactivatedEventType, IIPStateEvent>;
using CompletedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getCompletedEventType, IIPStateEvent>;
using LastEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getLastEventType, CompletedEvent>;

/// The registered name of the kind with this number. Throws std::out_of_range for a number above 7.
std::string stateEventName(std::size_t type);

/// The number of each event class.
template <class EventT>
inline constexpr protobuf::IIPStateEventType stateEventType = protobuf::IIPStateEventType(-1);
template <>
inline constexpr auto stateEventType<StartedEvent> = protobuf::IIPStartedEvent;
template <>
inline constexpr auto stateEventType<SuspendedEvent> = protobuf::IIPSuspendedEvent;
template <>
inline constexpr auto stateEventType<ResumedEvent> = protobuf::IIPResumedEvent;
template <>
inline constexpr auto stateEventType<DiscardedEvent> = protobuf::IIPDiscardedEvent;
template <>
inline constexpr auto stateEventType<RequeuedEvent> = protobuf::IIPRequeuedEvent;
template <>
inline constexpr auto stateEventType<ReactivatedEvent> = protobuf::IIPReactivatedEvent;
template <>
inline constexpr auto stateEventType<CompletedEvent> = protobuf::IIPCompletedEvent;
template <>
inline constexpr auto stateEventType<LastEvent> = protobuf::LastIIPEvent;

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
