// Identifiers on the wire.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"

namespace msg_svc::protobuf {
class IDType;
}  // namespace msg_svc::protobuf

namespace msg_svc::protobuf_serializer {

/// Converts identifiers to their message and back; nothing can fail but memory.
class IDTypeSerializer {
  public:
    /// Both halves, as they are; fromProtobuf() gives `id` back.
    static ::msg_svc::protobuf::IDType toProtobuf(const ::foundation::msg_svc::exchange::IDType& id);

    /// The default message gives the default identifier.
    static ::foundation::msg_svc::exchange::IDType fromProtobuf(const ::msg_svc::protobuf::IDType& message);
};

}  // namespace msg_svc::protobuf_serializer
