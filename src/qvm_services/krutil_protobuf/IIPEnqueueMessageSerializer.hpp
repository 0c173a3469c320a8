// Messages that hand a request to an engine's queue.
#pragma once

#include "TaggedSerializer.hpp"
#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"

namespace krutil::protobuf_serializer {

/// The request is written first, by the serializer of its dynamic type, and referred to by frame index.
class IIPEnqueueMessageSerializer final
    : public TaggedSerializer<IIPEnqueueMessageSerializer, MessageFamily, ::cmddistributor::IIPEnqueueMessage,
                              protobuf::IIPEnqueueMessage, controlFrame> {
  public:
    IIPEnqueueMessageSerializer();

    /// Ends the process for a number other than 0 to 7.
    static protobuf::WhenToDequeue toProtobuf(cmddistributor::WhenToDequeue::WhenToDequeue mode);

    /// Throws std::logic_error for a number other than 0 to 7.
    static cmddistributor::WhenToDequeue::WhenToDequeue fromProtobuf(protobuf::WhenToDequeue mode);

    /// Ends the process for an unsupported dequeue mode, before any frame is written. Throws std::bad_typeid for an
    /// empty request, std::out_of_range for a request without a serializer, std::bad_cast for one whose serializer is
    /// of another family, and what that serializer throws.
    static void fill(const ::cmddistributor::IIPEnqueueMessage& message, protobuf::IIPEnqueueMessage& proto,
                     NestedWriter& nested);

    /// Rebuilds the request first, so its errors come first: std::bad_cast when there is no tagged frame under the
    /// handle or its serializer is of another family, std::out_of_range for an unknown tag. Then std::logic_error for a
    /// bad dequeue mode. The message has no event manager and no impersonation object.
    static boost::shared_ptr<const foundation::msg_svc::exchange::Message> fromProtobuf(
        const protobuf::IIPEnqueueMessage& proto, const NestedReader& nested);
};

}  // namespace krutil::protobuf_serializer
