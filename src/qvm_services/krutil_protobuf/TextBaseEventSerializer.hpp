// Text that a request printed.
#pragma once

#include "TextEventSerializer.hpp"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/io/TextBaseEvent.hpp"

namespace krutil::protobuf_serializer {

class TextBaseEventSerializer final
    : public TextEventSerializer<TextBaseEventSerializer, io::TextBaseEvent, protobuf::TextBaseEvent> {
  public:
    TextBaseEventSerializer();
};

}  // namespace krutil::protobuf_serializer
