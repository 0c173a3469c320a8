// Identifiers on the wire. Generated code is for those who look into the message.
#pragma once

#include "foundation/msg_svc/exchange/IDType.hpp"

namespace msg_svc::protobuf {
class IDType;
}  // namespace msg_svc::protobuf

namespace msg_svc::protobuf_serializer {

struct IDTypeSerializer {
    static protobuf::IDType toProtobuf(foundation::msg_svc::exchange::IDType id);
    static foundation::msg_svc::exchange::IDType fromProtobuf(const protobuf::IDType& message);
};

}  // namespace msg_svc::protobuf_serializer
