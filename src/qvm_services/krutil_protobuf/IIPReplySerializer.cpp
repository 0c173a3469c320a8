#include "IIPReplySerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string iipReplyName = "krutil:IIPReply";

}  // namespace

IIPReplySerializer::IIPReplySerializer() : TaggedSerializer(iipReplyName) {}

void IIPReplySerializer::fill(const cmddistributor::IIPReply& reply, protobuf::IIPReply& proto, NestedWriter& nested) {
    *proto.mutable_id() = IDTypeSerializer::toProtobuf(reply.getID());
    proto.set_resultid(reply.getResult() ? nested.writeByDynamicType<ResultFamily>(reply.getResult()) : 0);
}

boost::shared_ptr<const foundation::msg_svc::exchange::Reply> IIPReplySerializer::fromProtobuf(
    const protobuf::IIPReply& proto, const NestedReader& nested) {
    std::unique_ptr<::cmddistributor::IIPResult> result;
    if (proto.resultid() != 0) {
        result = nested.read<ResultFamily>(proto.resultid());
    }
    require(proto.has_id(), "Required field is missing: protobuf::IIPReply.id");
    return boost::make_shared<const cmddistributor::IIPReply>(IDTypeSerializer::fromProtobuf(proto.id()),
                                                              std::move(result));
}

}  // namespace krutil::protobuf_serializer
