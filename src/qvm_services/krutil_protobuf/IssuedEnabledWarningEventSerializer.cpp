#include "IssuedEnabledWarningEventSerializer.hpp"

namespace krutil::protobuf_serializer {

using korvel::lang::diagnostic::IssuedEnabledWarningEvent;

namespace {

const std::string issuedEnabledWarningEventName = "korvel:lang:diagnostic:IssuedEnabledWarningEvent";

}  // namespace

IssuedEnabledWarningEventSerializer::IssuedEnabledWarningEventSerializer()
    : TaggedSerializer(issuedEnabledWarningEventName) {}

protobuf::IssuedEnabledWarningEvent IssuedEnabledWarningEventSerializer::toProtobuf(
    const IssuedEnabledWarningEvent& event) {
    return WarningConversions::toProtobuf(event);
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> IssuedEnabledWarningEventSerializer::fromProtobuf(
    const protobuf::IssuedEnabledWarningEvent& proto) {
    return WarningConversions::fromProtobuf(proto);
}

}  // namespace krutil::protobuf_serializer
