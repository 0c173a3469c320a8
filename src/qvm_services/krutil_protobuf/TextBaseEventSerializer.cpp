#include "TextBaseEventSerializer.hpp"

namespace krutil::protobuf_serializer {

TextBaseEventSerializer::TextBaseEventSerializer() : TextEventSerializer("krutil:TextBaseEvent") {}

}  // namespace krutil::protobuf_serializer
