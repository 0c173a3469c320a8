#include "SinkTextEventSerializer.hpp"

namespace krutil::protobuf_serializer {
namespace {

const std::string registeredName = "krutil:SinkTextEvent";

}  // namespace

SinkTextEventSerializer::SinkTextEventSerializer() : TextEventSerializer(registeredName) {}

}  // namespace krutil::protobuf_serializer
