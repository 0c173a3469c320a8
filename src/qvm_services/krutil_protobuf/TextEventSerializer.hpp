// The two kinds of text events, alike in everything but their types and names.
#pragma once

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"
#include "StreamTypeSerializer.hpp"
#include "TaggedSerializer.hpp"

namespace krutil::protobuf_serializer {

/// Handles events of class `EventT` as messages of class `ProtoMessage`. Absent fields read as the default identifier,
/// the output stream and empty text; a stream type outside its table ends the process in both directions.
template <class Derived, class EventT, class ProtoMessage>
class TextEventSerializer : public TaggedSerializer<Derived, EventFamily, EventT, ProtoMessage> {
  public:
    static void fill(const EventT& event, ProtoMessage& proto) {
        *proto.mutable_id() = IDTypeSerializer::toProtobuf(event.getRequestId());
        proto.set_stream(StreamTypeSerializer::toProtobuf(event.getStreamType()));
        proto.set_text(ustring_to_utf8(event.getText()));
    }

    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(const ProtoMessage& proto) {
        const auto id = IDTypeSerializer::fromProtobuf(proto.id());
        const auto stream = StreamTypeSerializer::fromProtobuf(proto.stream());
        return boost::make_shared<const EventT>(id, stream, utf8_to_ustring(proto.text()));
    }

  protected:
    using TaggedSerializer<Derived, EventFamily, EventT, ProtoMessage>::TaggedSerializer;
};

}  // namespace krutil::protobuf_serializer
