// Outcomes of cancels.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPCancelReply.hpp"
#include "krutil.protobuf.IIPCancelReply.pb.h"

namespace krutil::protobuf_serializer {

/// Copies the status number unchecked both ways, so that a status which only the peer knows gets through. The checked
/// conversions are for callers that need a status of the table; the serializer does not use them.
class IIPCancelReplySerializer final
    : public TaggedSerializer<IIPCancelReplySerializer, ReplyFamily, ::cmddistributor::IIPCancelReply,
                              protobuf::IIPCancelReply> {
  public:
    IIPCancelReplySerializer();

    using TaggedSerializer::toProtobuf;

    /// Both end the process for a number other than 0 to 3.
    static protobuf::CancelStatus toProtobuf(::cmddistributor::IIPCancelReply::CancelStatus status);
    static ::cmddistributor::IIPCancelReply::CancelStatus fromProtobuf(protobuf::CancelStatus status);

    static void fill(const ::cmddistributor::IIPCancelReply& reply, protobuf::IIPCancelReply& proto);

    /// The reply is allocated by itself and not together with its reference count.
    static boost::shared_ptr<const foundation::msg_svc::exchange::Reply> fromProtobuf(
        const protobuf::IIPCancelReply& proto);
};

}  // namespace krutil::protobuf_serializer
