#include "IIPEnqueueMessageSerializer.hpp"

#include <boost/make_shared.hpp>

#include "CapabilityConversions.hpp"
#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string iipEnqueueMessageName = "krutil:IIPEnqueueMessage";

}  // namespace

IIPEnqueueMessageSerializer::IIPEnqueueMessageSerializer() : TaggedSerializer(iipEnqueueMessageName) {}

protobuf::WhenToDequeue IIPEnqueueMessageSerializer::toProtobuf(cmddistributor::WhenToDequeue::WhenToDequeue mode) {
    return sameNumberOrTerminate<protobuf::WhenToDequeue>(
        mode, protobuf::WhenToDequeue_IsValid,
        {"Unsupported cmddistributor::WhenToDequeue::WhenToDequeue value", "IIPEnqueueMessageSerializer", 120,
         "static krutil::protobuf::WhenToDequeue "
         "krutil::protobuf_serializer::IIPEnqueueMessageSerializer::toProtobuf("
         "krutil::cmddistributor::WhenToDequeue::WhenToDequeue)"});
}

cmddistributor::WhenToDequeue::WhenToDequeue IIPEnqueueMessageSerializer::fromProtobuf(protobuf::WhenToDequeue mode) {
    return sameNumberOrThrow<cmddistributor::WhenToDequeue::WhenToDequeue>(
        mode, protobuf::WhenToDequeue_IsValid,
        "Invalid enum field value krutil::protobuf::IIPEnqueueMessage.WhenToDequeue = ");
}

void IIPEnqueueMessageSerializer::fill(const ::cmddistributor::IIPEnqueueMessage& message,
                                       protobuf::IIPEnqueueMessage& proto, NestedWriter& nested) {
    *proto.mutable_iipid() = IDTypeSerializer::toProtobuf(message.getID());
    proto.set_qcrid(message.getQcrID());
    proto.clear_qvmid();
    if (message.getQvmID()) {
        proto.set_qvmid(*message.getQvmID());
    }
    proto.set_dequeuemode(toProtobuf(message.getDequeueMode()));
    proto.set_name(ustring_to_utf8(message.getDynamicName()));
    proto.clear_capability();
    protobuf_serializer::toProtobuf(message.getCapabilities(), proto.mutable_capability());
    proto.set_iiphandle(nested.writeByDynamicType<IIPFamily>(message.getIIP()));
    proto.set_oktoflushsparingly(message.getOkToFlushSparingly());
}

boost::shared_ptr<const foundation::msg_svc::exchange::Message> IIPEnqueueMessageSerializer::fromProtobuf(
    const protobuf::IIPEnqueueMessage& proto, const NestedReader& nested) {
    const auto request = nested.read<IIPFamily>(proto.iiphandle());
    const auto id = IDTypeSerializer::fromProtobuf(proto.iipid());
    boost::optional<contextmgr::QvmID> qvmID;
    if (proto.qvmid() != 0) {
        qvmID = proto.qvmid();
    }
    const auto mode = fromProtobuf(proto.dequeuemode());
    return boost::make_shared<::cmddistributor::IIPEnqueueMessage>(
        request, id, proto.qcrid(), qvmID, nullptr, mode, utf8_to_ustring(proto.name()),
        protobuf_serializer::fromProtobuf(proto.capability()), nullptr, proto.oktoflushsparingly());
}

}  // namespace krutil::protobuf_serializer
