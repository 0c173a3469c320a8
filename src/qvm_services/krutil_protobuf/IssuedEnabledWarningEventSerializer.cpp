#include "IssuedEnabledWarningEventSerializer.hpp"

namespace krutil::protobuf_serializer {

using korvel::lang::diagnostic::IssuedEnabledWarningEvent;

namespace {

const std::string issuedEnabledWarningEventName = "korvel:lang:diagnostic:IssuedEnabledWarningEvent";

}  // namespace

IssuedEnabledWarningEventSerializer::IssuedEnabledWarningEventSerializer()
    : TaggedSerializer(issuedEnabledWarningEventName) {}

void IssuedEnabledWarningEventSerializer::fill(const IssuedEnabledWarningEvent& event,
                                               protobuf::IssuedEnabledWarningEvent& proto) {
    WarningConversions::fill(event, proto);
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> IssuedEnabledWarningEventSerializer::fromProtobuf(
    const protobuf::IssuedEnabledWarningEvent& proto) {
    return WarningConversions::fromProtobuf(proto);
}

}  // namespace krutil::protobuf_serializer
