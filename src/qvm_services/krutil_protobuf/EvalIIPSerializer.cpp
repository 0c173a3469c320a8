#include "EvalIIPSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"
#include "IIPSerializer.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string evalIIPName = "krutil:EvalIIP";

}  // namespace

EvalIIPSerializer::EvalIIPSerializer() : TaggedSerializer(evalIIPName) {}

protobuf::CodeType EvalIIPSerializer::toProtobuf(::cmddistributor::CodeType codeType) {
    return sameNumberOrTerminate<protobuf::CodeType>(
        codeType, protobuf::CodeType_IsValid,
        {"Unsupported cmddistributor::CodeType value", "EvalIIPSerializer", 105,
         "static krutil::protobuf::CodeType "
         "krutil::protobuf_serializer::EvalIIPSerializer::toProtobuf(cmddistributor::CodeType)"});
}

::cmddistributor::CodeType EvalIIPSerializer::fromProtobuf(protobuf::CodeType codeType) {
    return sameNumberOrThrow<::cmddistributor::CodeType>(codeType, protobuf::CodeType_IsValid,
                                                         "Invalid enum krutil::protobuf::CodeType field value = ");
}

void EvalIIPSerializer::fill(const ::cmddistributor::EvalIIP& request, protobuf::EvalIIP& proto) {
    IIPSerializer::fill(request, *proto.mutable_iip());
    proto.set_cmd(ustring_to_utf8(request.getCommand()));
    proto.set_codetype(toProtobuf(request.getCodeType()));
}

boost::shared_ptr<const ::cmddistributor::IIP> EvalIIPSerializer::fromProtobuf(const protobuf::EvalIIP& proto) {
    require(proto.has_iip(), "Required field missing: protobuf::EvalIIP.iip");
    const auto core = IIPSerializer::fromProtobuf(proto.iip());
    const std::u16string cmd = utf8_to_ustring(proto.cmd());
    const ::cmddistributor::CodeType codeType = fromProtobuf(proto.codetype());
    return boost::make_shared<::cmddistributor::EvalIIP>(core->getPluginType(), core->getStreamID(), nullptr,
                                                         core->getOutTraits(), core->getErrTraits(), cmd, codeType);
}

}  // namespace krutil::protobuf_serializer
