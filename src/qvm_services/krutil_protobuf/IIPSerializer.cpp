#include "IIPSerializer.hpp"

#include <boost/make_shared.hpp>

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

void fill(const io::SinkTraits& traits, protobuf::SinkTraits& proto) {
    proto.set_supportshotlinks(traits.getSupportsHotlinks());
    proto.set_needsformattingfordisplay(traits.getNeedsFormattingForDisplay());
    proto.set_usediary(traits.getUseDiary());
    proto.set_useecho(traits.getUseEcho());
    proto.set_uselogging(traits.getUseLogging());
}

protobuf::SinkTraits toProtobuf(const io::SinkTraits& traits) {
    protobuf::SinkTraits proto;
    fill(traits, proto);
    return proto;
}

io::SinkTraits fromProtobuf(const protobuf::SinkTraits& proto) {
    return io::SinkTraits(false, proto.supportshotlinks(), proto.needsformattingfordisplay(), proto.usediary(),
                          proto.useecho(), proto.uselogging());
}

protobuf::IqmStreamID IIPSerializer::toProtobuf(::cmddistributor::IqmStreamID streamID) {
    return sameNumberOrTerminate<protobuf::IqmStreamID>(
        streamID, protobuf::IqmStreamID_IsValid,
        {"Unsupported cmddistributor::IqmStreamID value", "IIPSerializer", 38,
         "static krutil::protobuf::IqmStreamID "
         "krutil::protobuf_serializer::IIPSerializer::toProtobuf(cmddistributor::IqmStreamID)"});
}

::cmddistributor::IqmStreamID IIPSerializer::fromProtobuf(protobuf::IqmStreamID streamID) {
    return sameNumberOrTerminate<::cmddistributor::IqmStreamID>(
        streamID, protobuf::IqmStreamID_IsValid,
        {"Unsupported cmddistributor::IqmStreamID value", "IIPSerializer", 71,
         "static cmddistributor::IqmStreamID "
         "krutil::protobuf_serializer::IIPSerializer::fromProtobuf(krutil::protobuf::IqmStreamID)"});
}

void IIPSerializer::fill(const ::cmddistributor::IIP& iip, protobuf::IIP& proto) {
    proto.set_streamid(toProtobuf(iip.getStreamID()));
    proto.set_plugintype(iip.getPluginType());
    protobuf_serializer::fill(iip.getOutTraits(), *proto.mutable_outtraits());
    protobuf_serializer::fill(iip.getErrTraits(), *proto.mutable_errtraits());
}

protobuf::IIP IIPSerializer::toProtobuf(const ::cmddistributor::IIP& iip) {
    protobuf::IIP proto;
    fill(iip, proto);
    return proto;
}

boost::shared_ptr<const ::cmddistributor::IIP> IIPSerializer::fromProtobuf(const protobuf::IIP& proto) {
    // Unchecked on purpose: a stream number that only the peer knows does not stop the request.
    static_assert(sizeof(::cmddistributor::IqmStreamID) == sizeof(protobuf::IqmStreamID));
    const auto streamID = static_cast<::cmddistributor::IqmStreamID>(proto.streamid());
    require(!proto.plugintype().empty(), "Required string field protobuf::IIP.pluginType is empty.");
    require(proto.has_outtraits(), "Required field protobuf::IIP.outTraits is missing.");
    require(proto.has_errtraits(), "Required field protobuf::IIP.errTraits is missing.");
    return boost::make_shared<const ::cmddistributor::IIP>(proto.plugintype(), streamID,
                                                           protobuf_serializer::fromProtobuf(proto.outtraits()),
                                                           protobuf_serializer::fromProtobuf(proto.errtraits()));
}

}  // namespace krutil::protobuf_serializer
