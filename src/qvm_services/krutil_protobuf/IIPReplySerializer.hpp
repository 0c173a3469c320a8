// Answers to enqueued requests.
#pragma once

#include "TaggedSerializer.hpp"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil/cmddistributor/IIPReply.hpp"

namespace krutil::protobuf_serializer {

/// The result is written first, by the serializer of its dynamic type, and referred to by frame index. Index 0 stands
/// for no result, so a result that happens to be written there is lost on reading: sessions number frames from 1.
class IIPReplySerializer final
    : public TaggedSerializer<IIPReplySerializer, ReplyFamily, cmddistributor::IIPReply, protobuf::IIPReply> {
  public:
    IIPReplySerializer();

    /// Throws std::out_of_range for a result without a serializer, std::bad_cast for one whose serializer is of another
    /// family, and what that serializer throws.
    static void fill(const cmddistributor::IIPReply& reply, protobuf::IIPReply& proto, NestedWriter& nested);

    /// Reads the result first: std::bad_cast when there is no tagged frame under its index or the serializer is of
    /// another family, std::out_of_range for an unknown tag. Then std::logic_error for an absent identifier.
    static boost::shared_ptr<const foundation::msg_svc::exchange::Reply> fromProtobuf(const protobuf::IIPReply& proto,
                                                                                      const NestedReader& nested);
};

}  // namespace krutil::protobuf_serializer
