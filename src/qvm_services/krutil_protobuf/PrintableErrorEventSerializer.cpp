#include "PrintableErrorEventSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"
#include "RuntimeExceptionConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string printableErrorEventName = "krutil:PrintableErrorEvent";

}  // namespace

PrintableErrorEventSerializer::PrintableErrorEventSerializer() : TaggedSerializer(printableErrorEventName) {}

void PrintableErrorEventSerializer::fill(const io::PrintableErrorEvent& event, protobuf::PrintableErrorEvent& proto) {
    *proto.mutable_id() = IDTypeSerializer::toProtobuf(event.getRequestId());
    proto.set_text(ustring_to_utf8(event.getText()));
    protobuf_serializer::fill(event.getException(), *proto.mutable_except());
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> PrintableErrorEventSerializer::fromProtobuf(
    const protobuf::PrintableErrorEvent& proto) {
    const auto id = IDTypeSerializer::fromProtobuf(proto.id());
    std::u16string text = utf8_to_ustring(proto.text());
    return boost::make_shared<const io::PrintableErrorEvent>(id, protobuf_serializer::fromProtobuf(proto.except()),
                                                             std::move(text));
}

}  // namespace krutil::protobuf_serializer
