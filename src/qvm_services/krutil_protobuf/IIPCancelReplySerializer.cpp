#include "IIPCancelReplySerializer.hpp"

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

using ::cmddistributor::IIPCancelReply;

namespace {

// The serializer copies any number in both directions.
static_assert(sizeof(IIPCancelReply::CancelStatus) == sizeof(protobuf::CancelStatus));

const std::string iipCancelReplyName = "krutil:IIPCancelReply";

}  // namespace

IIPCancelReplySerializer::IIPCancelReplySerializer() : TaggedSerializer(iipCancelReplyName) {}

protobuf::CancelStatus IIPCancelReplySerializer::toProtobuf(IIPCancelReply::CancelStatus status) {
    return sameNumberOrTerminate<protobuf::CancelStatus>(
        status, protobuf::CancelStatus_IsValid,
        {"Unsupported ::cmddistributor::IIPCancelReply::CancelStatus value", "IIPCancelReplySerializer", 71,
         "static krutil::protobuf::CancelStatus "
         "krutil::protobuf_serializer::IIPCancelReplySerializer::toProtobuf("
         "cmddistributor::IIPCancelReply::CancelStatus)"});
}

IIPCancelReply::CancelStatus IIPCancelReplySerializer::fromProtobuf(protobuf::CancelStatus status) {
    return sameNumberOrTerminate<IIPCancelReply::CancelStatus>(
        status, protobuf::CancelStatus_IsValid,
        {"Unsupported krutil::protobuf::CancelStatus value", "IIPCancelReplySerializer", 97,
         "static cmddistributor::IIPCancelReply::CancelStatus "
         "krutil::protobuf_serializer::IIPCancelReplySerializer::fromProtobuf(krutil::protobuf::CancelStatus)"});
}

void IIPCancelReplySerializer::fill(const IIPCancelReply& reply, protobuf::IIPCancelReply& proto) {
    proto.set_status(static_cast<protobuf::CancelStatus>(reply.getStatus()));
}

boost::shared_ptr<const foundation::msg_svc::exchange::Reply> IIPCancelReplySerializer::fromProtobuf(
    const protobuf::IIPCancelReply& proto) {
    return boost::shared_ptr<const IIPCancelReply>(
        new IIPCancelReply(static_cast<IIPCancelReply::CancelStatus>(proto.status())));
}

}  // namespace krutil::protobuf_serializer
