#include "TextBaseEventSerializer.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string textBaseEventName = "krutil:TextBaseEvent";

}  // namespace

TextBaseEventSerializer::TextBaseEventSerializer() : TextEventSerializer(textBaseEventName) {}

}  // namespace krutil::protobuf_serializer
