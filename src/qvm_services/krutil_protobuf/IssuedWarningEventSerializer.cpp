#include "IssuedWarningEventSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

using korvel::lang::diagnostic::IssuedWarningEvent;

IssuedWarningEventSerializer::IssuedWarningEventSerializer()
    : TaggedSerializer("korvel:lang:diagnostic:IssuedWarningEvent") {}

protobuf::IssuedWarningEvent IssuedWarningEventSerializer::toProtobuf(const IssuedWarningEvent& event) {
    return WarningConversions::eventToProtobuf(event);
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> IssuedWarningEventSerializer::fromProtobuf(
    const protobuf::IssuedWarningEvent& proto) {
    return boost::make_shared<IssuedWarningEvent>(IDTypeSerializer::fromProtobuf(proto.id()),
                                                  WarningConversions::fromProtobuf(proto.warning()));
}

}  // namespace krutil::protobuf_serializer
