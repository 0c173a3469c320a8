#include "TaggedFraming.hpp"

#include <cstdint>
#include <stdexcept>
#include <typeinfo>

#include "Casts.hpp"

namespace krutil::protobuf_serializer::detail {

using foundation::vantor::carrier::framing::Frame;
using foundation::vantor::carrier::framing::TaggedFrame;

FrameBuffer newMessageBuffer(std::size_t byteSize) {
    const auto size = static_cast<std::int32_t>(static_cast<std::uint32_t>(byteSize));
    if (size < 0) {
        throw std::length_error("Unsupported Protobuf buffer size.");
    }
    const auto length = static_cast<unsigned long>(size);
    return {std::unique_ptr<char[], std::function<void(char*)>>(new char[length], std::default_delete<char[]>()),
            length};
}

void appendTaggedFrame(FrameBuffer&& buffer, const std::string& tag, StreamID streamID, FrameIndex frameIndex,
                       MessageStream& stream, FrameType frameType) {
    std::unique_ptr<Frame> frame =
        std::make_unique<TaggedFrame>(frameType, streamID, tag, std::move(buffer), frameIndex);
    stream.append(frame);
}

FrameBuffer takeTaggedFrame(FrameIndex frameIndex, Message& message, FrameType frameType) {
    if (downcast<TaggedFrame>(message.frame(frameIndex).get()) == nullptr) {
        throw std::bad_cast();
    }
    const std::unique_ptr<Frame> frame = message.release(frameIndex);
    if (frame->type() != frameType) {
        throw std::bad_cast();
    }
    FrameBuffer buffer = frame->releaseBuffer();
    if (!buffer.first) {
        buffer.second = 0;
    }
    return buffer;
}

}  // namespace krutil::protobuf_serializer::detail
