#include "SinkTextEventSerializer.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string sinkTextEventName = "krutil:SinkTextEvent";

}  // namespace

SinkTextEventSerializer::SinkTextEventSerializer() : TextEventSerializer(sinkTextEventName) {}

}  // namespace krutil::protobuf_serializer
