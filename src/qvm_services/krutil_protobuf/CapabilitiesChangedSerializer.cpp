#include "CapabilitiesChangedSerializer.hpp"

#include <boost/make_shared.hpp>

#include "CapabilityConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string capabilitiesChangedName = "krutil:capabilities_api:CapabilitiesChanged";

}  // namespace

CapabilitiesChangedSerializer::CapabilitiesChangedSerializer() : TaggedSerializer(capabilitiesChangedName) {}

protobuf::CapabilitiesChanged CapabilitiesChangedSerializer::toProtobuf(
    const capabilities_api::CapabilitiesChanged& event) {
    using protobuf_serializer::toProtobuf;
    protobuf::CapabilitiesChanged proto;
    toProtobuf(event.getPreviousCapabilities(), proto.mutable_previouscapabilities());
    toProtobuf(event.getQvmCapabilities(), proto.mutable_qvmcapabilities());
    toProtobuf(event.getClientCapabilities(), proto.mutable_clientcapabilities());
    toProtobuf(event.getRequestCapabilities(), proto.mutable_requestcapabilities());
    return proto;
}

boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> CapabilitiesChangedSerializer::fromProtobuf(
    const protobuf::CapabilitiesChanged& proto) {
    using protobuf_serializer::fromProtobuf;
    return boost::make_shared<capabilities_api::CapabilitiesChanged>(
        fromProtobuf(proto.previouscapabilities()), fromProtobuf(proto.qvmcapabilities()),
        fromProtobuf(proto.clientcapabilities()), fromProtobuf(proto.requestcapabilities()));
}

}  // namespace krutil::protobuf_serializer
