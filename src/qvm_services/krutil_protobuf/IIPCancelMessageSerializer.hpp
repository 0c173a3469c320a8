// Requests to cancel a request.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "krutil.protobuf.IIPCancelMessage.pb.h"

namespace krutil::protobuf_serializer {

class IIPCancelMessageSerializer final
    : public TaggedSerializer<IIPCancelMessageSerializer, MessageFamily, ::cmddistributor::IIPCancelMessage,
                              protobuf::IIPCancelMessage, controlFrame> {
  public:
    IIPCancelMessageSerializer();

    static void fill(const ::cmddistributor::IIPCancelMessage& message, protobuf::IIPCancelMessage& proto);

    /// Throws std::logic_error for an absent identifier; one that is present and empty is accepted.
    static boost::shared_ptr<const foundation::msg_svc::exchange::Message> fromProtobuf(
        const protobuf::IIPCancelMessage& proto);
};

}  // namespace krutil::protobuf_serializer
