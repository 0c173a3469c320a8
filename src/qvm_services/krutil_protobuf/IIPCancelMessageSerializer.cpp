#include "IIPCancelMessageSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string iipCancelMessageName = "krutil:IIPCancelMessage";

}  // namespace

IIPCancelMessageSerializer::IIPCancelMessageSerializer() : TaggedSerializer(iipCancelMessageName) {}

void IIPCancelMessageSerializer::fill(const ::cmddistributor::IIPCancelMessage& message,
                                      protobuf::IIPCancelMessage& proto) {
    *proto.mutable_iipid() = IDTypeSerializer::toProtobuf(message.getID());
    proto.set_evenifrunning(message.getEvenIfRunning());
}

boost::shared_ptr<const foundation::msg_svc::exchange::Message> IIPCancelMessageSerializer::fromProtobuf(
    const protobuf::IIPCancelMessage& proto) {
    // The misspelling and the capital I are settled: peers and logs match the text.
    require(proto.has_iipid(), "Requied field is missing: protobuf::IIPCancelMessage.iipId");
    return boost::make_shared<const ::cmddistributor::IIPCancelMessage>(IDTypeSerializer::fromProtobuf(proto.iipid()),
                                                                        proto.evenifrunning());
}

}  // namespace krutil::protobuf_serializer
