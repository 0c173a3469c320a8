// A frame of bulk bytes, referred to by index from the tagged frame that follows it.
#pragma once

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

/// Carries bytes that are never copied: the buffer that the sender hands in is the buffer that the transport writes
/// from, and the buffer that a receiver finds here is the one that the transport read into.
class DataFrame final : public Frame {
  public:
    /// Takes over `buffer`. `shareable` says that the bytes do not change while the frame lives, so that a transport
    /// may hand them on by reference; a sender that cannot promise this passes false and the transport must be done
    /// with the bytes when the send returns.
    DataFrame(FrameType type, unsigned int streamID, FrameBuffer&& buffer, bool shareable, unsigned long frameIndex);
    ~DataFrame() override;

    /// Whether the bytes stay as they are while the frame lives.
    bool shareable() const noexcept { return shareable_; }

  private:
    bool shareable_;
};

}  // namespace foundation::vantor::carrier::framing
