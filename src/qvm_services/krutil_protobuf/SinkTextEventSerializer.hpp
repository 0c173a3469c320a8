// Text that the engine shows on a request's behalf.
#pragma once

#include "TextEventSerializer.hpp"
#include "krutil.protobuf.SinkTextEvent.pb.h"
#include "krutil/io/SinkTextEvent.hpp"

namespace krutil::protobuf_serializer {

class SinkTextEventSerializer final
    : public TextEventSerializer<SinkTextEventSerializer, io::SinkTextEvent, protobuf::SinkTextEvent> {
  public:
    SinkTextEventSerializer();
};

}  // namespace krutil::protobuf_serializer
