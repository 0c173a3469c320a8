// Kinds of text streams.
#pragma once

#include "krutil.protobuf.StreamType.pb.h"
#include "krutil/io/StreamTypeEnum.hpp"

namespace krutil::protobuf_serializer {

/// Both conversions end the process for a number other than 0 to 2, received ones included: it is settled so.
class StreamTypeSerializer {
  public:
    static protobuf::StreamType toProtobuf(io::StreamTypeEnum streamType);
    static io::StreamTypeEnum fromProtobuf(protobuf::StreamType streamType);
};

}  // namespace krutil::protobuf_serializer
