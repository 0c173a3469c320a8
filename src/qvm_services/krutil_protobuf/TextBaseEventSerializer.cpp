#include "TextBaseEventSerializer.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string registeredName = "krutil:TextBaseEvent";

}  // namespace

TextBaseEventSerializer::TextBaseEventSerializer() : TextEventSerializer(registeredName) {}

}  // namespace krutil::protobuf_serializer
