#include "IssuedWarningEventSerializer.hpp"

namespace krutil::protobuf_serializer {

using korvel::lang::diagnostic::IssuedWarningEvent;

namespace {

const std::string issuedWarningEventName = "korvel:lang:diagnostic:IssuedWarningEvent";

}  // namespace

IssuedWarningEventSerializer::IssuedWarningEventSerializer() : TaggedSerializer(issuedWarningEventName) {}

void IssuedWarningEventSerializer::fill(const IssuedWarningEvent& event, protobuf::IssuedWarningEvent& proto) {
    WarningConversions::fill(event, proto);
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> IssuedWarningEventSerializer::fromProtobuf(
    const protobuf::IssuedWarningEvent& proto) {
    return WarningConversions::fromProtobuf(proto);
}

}  // namespace krutil::protobuf_serializer
