#include "msg_svc/protobuf_serializer/IDTypeSerializer.hpp"

#include "msg_svc.protobuf.IDType.pb.h"

namespace msg_svc::protobuf_serializer {

::msg_svc::protobuf::IDType IDTypeSerializer::toProtobuf(const ::foundation::msg_svc::exchange::IDType& id) {
    ::msg_svc::protobuf::IDType message;
    message.set_hi(id.hi());
    message.set_lo(id.lo());
    return message;
}

::foundation::msg_svc::exchange::IDType IDTypeSerializer::fromProtobuf(const ::msg_svc::protobuf::IDType& message) {
    return {message.hi(), message.lo()};
}

}  // namespace msg_svc::protobuf_serializer
