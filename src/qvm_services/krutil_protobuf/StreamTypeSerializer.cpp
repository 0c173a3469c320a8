#include "StreamTypeSerializer.hpp"

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

protobuf::StreamType StreamTypeSerializer::toProtobuf(io::StreamTypeEnum streamType) {
    return sameNumberOrTerminate<protobuf::StreamType>(
        streamType, protobuf::StreamType_IsValid,
        {"Unsupported krutil::io::StreamTypeEnum value", "StreamTypeSerializer", 28,
         "static krutil::protobuf::StreamType "
         "krutil::protobuf_serializer::StreamTypeSerializer::toProtobuf(krutil::io::StreamTypeEnum)"});
}

io::StreamTypeEnum StreamTypeSerializer::fromProtobuf(protobuf::StreamType streamType) {
    return sameNumberOrTerminate<io::StreamTypeEnum>(
        streamType, protobuf::StreamType_IsValid,
        {"Unsupported krutil::protobuf::StreamType value", "StreamTypeSerializer", 44,
         "static krutil::io::StreamTypeEnum "
         "krutil::protobuf_serializer::StreamTypeSerializer::fromProtobuf(krutil::protobuf::StreamType)"});
}

}  // namespace krutil::protobuf_serializer
