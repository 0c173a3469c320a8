#include "IssuedEnabledWarningEventSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

using korvel::lang::diagnostic::IssuedEnabledWarningEvent;

IssuedEnabledWarningEventSerializer::IssuedEnabledWarningEventSerializer()
    : TaggedSerializer("korvel:lang:diagnostic:IssuedEnabledWarningEvent") {}

protobuf::IssuedEnabledWarningEvent IssuedEnabledWarningEventSerializer::toProtobuf(
    const IssuedEnabledWarningEvent& event) {
    protobuf::IssuedEnabledWarningEvent proto;
    *proto.mutable_warningevent() = WarningConversions::eventToProtobuf(event);
    return proto;
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> IssuedEnabledWarningEventSerializer::fromProtobuf(
    const protobuf::IssuedEnabledWarningEvent& proto) {
    const protobuf::IssuedWarningEvent& nested = proto.warningevent();
    return boost::make_shared<IssuedEnabledWarningEvent>(IDTypeSerializer::fromProtobuf(nested.id()),
                                                         WarningConversions::fromProtobuf(nested.warning()));
}

}  // namespace krutil::protobuf_serializer
