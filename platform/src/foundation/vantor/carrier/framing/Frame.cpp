#include "foundation/vantor/carrier/framing/Frame.hpp"

#include "foundation/vantor/carrier/framing/DataFrame.hpp"
#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::vantor::carrier::framing {

Frame::Frame(FrameType type, StreamID streamID, FrameBuffer&& buffer, FrameIndex index) noexcept
    : buffer_(std::move(buffer)), index_(index), streamID_(streamID), type_(type) {}

Frame::~Frame() = default;

FrameBuffer Frame::releaseBuffer() noexcept {
    return std::exchange(buffer_, FrameBuffer());
}

TaggedFrame::TaggedFrame(FrameType type, unsigned int streamID, const std::string& tag, FrameBuffer&& buffer,
                         unsigned long frameIndex)
    : Frame(type, streamID, std::move(buffer), frameIndex) {
    if (tag.size() > shortTag_.size()) {
        longTag_ = tag;
        return;
    }
    tag.copy(shortTag_.data(), tag.size());
    shortLength_ = static_cast<std::uint8_t>(tag.size());
}

TaggedFrame::~TaggedFrame() = default;

DataFrame::DataFrame(FrameType type, unsigned int streamID, FrameBuffer&& buffer, bool shareable,
                     unsigned long frameIndex)
    : Frame(type, streamID, std::move(buffer), frameIndex), shareable_(shareable) {}

DataFrame::~DataFrame() = default;

}  // namespace foundation::vantor::carrier::framing
