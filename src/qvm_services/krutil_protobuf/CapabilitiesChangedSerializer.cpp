#include "CapabilitiesChangedSerializer.hpp"

#include <boost/make_shared.hpp>

#include "CapabilityConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string capabilitiesChangedName = "krutil:capabilities_api:CapabilitiesChanged";

}  // namespace

CapabilitiesChangedSerializer::CapabilitiesChangedSerializer() : TaggedSerializer(capabilitiesChangedName) {}

void CapabilitiesChangedSerializer::fill(const capabilities_api::CapabilitiesChanged& event,
                                         protobuf::CapabilitiesChanged& proto) {
    using protobuf_serializer::toProtobuf;
    proto.Clear();
    toProtobuf(event.getPreviousCapabilities(), proto.mutable_previouscapabilities());
    toProtobuf(event.getQvmCapabilities(), proto.mutable_qvmcapabilities());
    toProtobuf(event.getClientCapabilities(), proto.mutable_clientcapabilities());
    toProtobuf(event.getRequestCapabilities(), proto.mutable_requestcapabilities());
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> CapabilitiesChangedSerializer::fromProtobuf(
    const protobuf::CapabilitiesChanged& proto) {
    using protobuf_serializer::fromProtobuf;
    return boost::make_shared<capabilities_api::CapabilitiesChanged>(
        fromProtobuf(proto.previouscapabilities()), fromProtobuf(proto.qvmcapabilities()),
        fromProtobuf(proto.clientcapabilities()), fromProtobuf(proto.requestcapabilities()));
}

}  // namespace krutil::protobuf_serializer
