// Frames that say which serializer reads them.
#pragma once

#include <string>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

class TaggedFrame : public Frame {
  public:
    TaggedFrame(FrameType type, StreamID stream, std::string tag, std::pair<Bytes, unsigned long>&& buffer,
                FrameIndex position)
        : Frame(type, stream, std::move(buffer), position), label_(std::move(tag)) {}

    std::string tag() const { return label_; }

  private:
    std::string label_;
};

}  // namespace foundation::vantor::carrier::framing
