// One Protocol Buffers message as one tagged frame, and back: the two steps that every serializer shares.
//
// Both functions are reentrant and keep no state.
#pragma once

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>

#include <boost/numeric/conversion/cast.hpp>
#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/message/MessageStream.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace krutil::protobuf_serializer {

using foundation::msg_svc::transport::layers::message::Message;
using foundation::msg_svc::transport::layers::message::MessageStream;
using foundation::vantor::carrier::framing::FrameIndex;
using foundation::vantor::carrier::framing::FrameType;
using foundation::vantor::carrier::framing::StreamID;

/// The bytes of a frame, what releases them, and their length in bytes.
using FrameBuffer = std::pair<std::unique_ptr<char[], std::function<void(char*)>>, unsigned long>;

/// The two types of tagged frames: of objects that steer the receiver (enqueue, cancel, enabled warnings), and of any
/// other object. Their numbers are settled; what a platform calls them is not.
inline constexpr auto controlFrame = static_cast<FrameType>(27);
inline constexpr auto objectFrame = static_cast<FrameType>(29);

namespace detail {

/// A buffer for a message of `byteSize` bytes, allocated exactly once. Throws std::length_error "Unsupported Protobuf
/// buffer size." when the low 32 bits of the size are negative as a signed number; other sizes are taken by those bits.
FrameBuffer newMessageBuffer(std::size_t byteSize);

/// Makes a tagged frame of `buffer` and hands it to the stream. A frame that the stream leaves is destroyed.
void appendTaggedFrame(FrameBuffer&& buffer, const std::string& tag, StreamID streamID, FrameIndex frameIndex,
                       MessageStream& stream, FrameType frameType);

/// Moves the tagged frame at `frameIndex` out of `message` and returns its bytes; a null buffer comes with length 0.
/// Throws std::bad_cast when there is no tagged frame (which leaves the message as it is) or when its type is not
/// `frameType` (the frame is gone then).
FrameBuffer takeTaggedFrame(FrameIndex frameIndex, Message& message, FrameType frameType);

}  // namespace detail

/// Writes `proto` as one tagged frame at `frameIndex` and returns the next free index, which is one more. One
/// allocation of exactly the serialized size; the bytes are not copied afterwards.
///
/// Throws std::length_error "Unsupported Protobuf buffer size." for a message of 2^31 to 2^32 - 1 bytes,
/// std::bad_alloc, and what the stream throws; nothing is appended then.
template <class ProtoMessage>
FrameIndex writeTaggedFrame(const ProtoMessage& proto, const std::string& tag, StreamID streamID, FrameIndex frameIndex,
                            const std::shared_ptr<MessageStream>& stream, FrameType frameType) {
    FrameBuffer buffer = detail::newMessageBuffer(proto.ByteSizeLong());
    {
        google::protobuf::io::ArrayOutputStream array(buffer.first.get(), static_cast<int>(buffer.second), -1);
        google::protobuf::io::CodedOutputStream coded(&array);
        proto.SerializeWithCachedSizes(&coded);
    }
    detail::appendTaggedFrame(std::move(buffer), tag, streamID, frameIndex, *stream, frameType);
    return frameIndex + 1;
}

/// Takes the tagged frame at `frameIndex` out of `message` and parses its bytes into `proto`, straight from the frame's
/// buffer. Bytes that do not parse are no error here: `proto` keeps the fields that were read before the fault, and the
/// caller's checks of required fields decide.
///
/// Throws std::bad_cast when there is no tagged frame at the index (never was, or was taken already) or its type is not
/// `frameType`, boost::numeric::positive_overflow for more than 2^31 - 1 bytes. But for the first case the frame is
/// gone.
template <class ProtoMessage>
void readTaggedFrame(FrameIndex frameIndex, const std::unique_ptr<Message>& message, ProtoMessage& proto,
                     FrameType frameType) {
    const FrameBuffer buffer = detail::takeTaggedFrame(frameIndex, *message, frameType);
    const int length = boost::numeric_cast<int>(buffer.second);
    google::protobuf::io::ArrayInputStream array(buffer.first.get(), length, -1);
    google::protobuf::io::CodedInputStream coded(&array);
    coded.SetTotalBytesLimit(0x7FFFFFFF);
    static_cast<void>(proto.ParseFromCodedStream(&coded));
}

}  // namespace krutil::protobuf_serializer
