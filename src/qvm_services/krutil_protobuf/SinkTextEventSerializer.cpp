#include "SinkTextEventSerializer.hpp"

namespace krutil::protobuf_serializer {

SinkTextEventSerializer::SinkTextEventSerializer() : TextEventSerializer("krutil:SinkTextEvent") {}

}  // namespace krutil::protobuf_serializer
