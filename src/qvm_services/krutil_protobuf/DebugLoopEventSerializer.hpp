// Entering and leaving input loops.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/DebugLoopEvent.hpp"
#include "krutil.protobuf.DebugLoopEvent.pb.h"

namespace krutil::protobuf_serializer {

class DebugLoopEventSerializer final
    : public TaggedSerializer<DebugLoopEventSerializer, EventFamily, ::cmddistributor::DebugLoopEvent,
                              protobuf::DebugLoopEvent> {
  public:
    DebugLoopEventSerializer();

    using TaggedSerializer::toProtobuf;

    /// End the process for a state other than 1 and 2, a prompt other than -1 to 11.
    static protobuf::DebugLoopEvent_State toProtobuf(::cmddistributor::DebugLoopEvent::State state);
    static protobuf::InputRequester toProtobuf(prompt::InputRequester prompt);

    /// Throw std::logic_error for the same numbers; the state's placeholder 0 is one of them.
    static ::cmddistributor::DebugLoopEvent::State fromProtobuf(protobuf::DebugLoopEvent_State state);
    static prompt::InputRequester fromProtobuf(protobuf::InputRequester prompt);

    static void fill(const ::cmddistributor::DebugLoopEvent& event, protobuf::DebugLoopEvent& proto);

    /// Checks the state before the prompt. An absent identifier reads as the default one.
    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::DebugLoopEvent& proto);
};

}  // namespace krutil::protobuf_serializer
