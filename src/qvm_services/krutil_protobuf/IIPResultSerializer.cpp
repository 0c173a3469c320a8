#include "IIPResultSerializer.hpp"

#include "FieldConversions.hpp"
#include "RuntimeExceptionConversions.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string iipResultName = "krutil:IIPResult";

}  // namespace

IIPResultSerializer::IIPResultSerializer() : TaggedSerializer(iipResultName) {}

void IIPResultSerializer::fill(const ::cmddistributor::IIPResult& result, protobuf::IIPResult& proto) {
    if (result.getException()) {
        protobuf_serializer::fill(*result.getException(), *proto.mutable_exception());
    } else {
        proto.clear_exception();
    }
    *proto.mutable_id() = IDTypeSerializer::toProtobuf(result.id);
}

std::unique_ptr<::cmddistributor::IIPResult> IIPResultSerializer::fromProtobuf(const protobuf::IIPResult& proto) {
    boost::optional<::cmddistributor::RuntimeException> exception;
    if (proto.has_exception()) {
        exception = protobuf_serializer::fromProtobuf(proto.exception());
    }
    require(proto.has_id(), "Required field is missing: protobuf::IIPResult.id");
    return std::make_unique<::cmddistributor::IIPResult>(IDTypeSerializer::fromProtobuf(proto.id()),
                                                         std::move(exception));
}

}  // namespace krutil::protobuf_serializer
