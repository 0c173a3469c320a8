// The eight kinds of state events: one message, one serializer template, a name and a number for each kind.
#pragma once

#include <boost/make_shared.hpp>
#include <string>
#include <type_traits>

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

template <protobuf::IIPStateEventType Number>
using StateEventNumber = std::integral_constant<protobuf::IIPStateEventType, Number>;

/// The number of each event class. Any other class has none, so a serializer of it does not compile.
template <class EventT>
struct StateEventType;
template <>
struct StateEventType<StartedEvent> : StateEventNumber<protobuf::IIPStartedEvent> {};
template <>
struct StateEventType<SuspendedEvent> : StateEventNumber<protobuf::IIPSuspendedEvent> {};
template <>
struct StateEventType<ResumedEvent> : StateEventNumber<protobuf::IIPResumedEvent> {};
template <>
struct StateEventType<DiscardedEvent> : StateEventNumber<protobuf::IIPDiscardedEvent> {};
template <>
struct StateEventType<RequeuedEvent> : StateEventNumber<protobuf::IIPRequeuedEvent> {};
template <>
struct StateEventType<ReactivatedEvent> : StateEventNumber<protobuf::IIPReactivatedEvent> {};
template <>
struct StateEventType<CompletedEvent> : StateEventNumber<protobuf::IIPCompletedEvent> {};
template <>
struct StateEventType<LastEvent> : StateEventNumber<protobuf::LastIIPEvent> {};

/// Handles events of exactly the class `EventT`. The number on the wire is the serializer's own on the way out and is
/// ignored on the way in: the frame's tag has settled the kind.
template <class EventT>
class IIPStateEventSerializer final
    : public TaggedSerializer<IIPStateEventSerializer<EventT>, EventFamily, EventT, protobuf::IIPStateEvent> {
  public:
    IIPStateEventSerializer()
        : TaggedSerializer<IIPStateEventSerializer, EventFamily, EventT, protobuf::IIPStateEvent>(
              stateEventName(static_cast<std::size_t>(StateEventType<EventT>::value))) {}

    static void fill(const EventT& event, protobuf::IIPStateEvent& proto) {
        *proto.mutable_id() = IDTypeSerializer::toProtobuf(event.getRequestId());
        proto.set_type(StateEventType<EventT>::value);
    }

    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::IIPStateEvent& proto) {
        return boost::make_shared<EventT>(IDTypeSerializer::fromProtobuf(proto.id()));
    }
};

}  // namespace krutil::protobuf_serializer
