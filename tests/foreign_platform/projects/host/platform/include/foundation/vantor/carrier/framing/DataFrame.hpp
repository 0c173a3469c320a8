// Frames of bulk bytes.
#pragma once

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

class DataFrame : public Frame {
  public:
    /// The flag says that the bytes do not change any more.
    DataFrame(FrameType type, StreamID stream, std::pair<Bytes, unsigned long>&& buffer, bool settled,
              FrameIndex position)
        : Frame(type, stream, std::move(buffer), position), settled_(settled) {}

    bool settled() const { return settled_; }

  private:
    bool settled_;
};

}  // namespace foundation::vantor::carrier::framing
