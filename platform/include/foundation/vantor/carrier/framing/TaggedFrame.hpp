// A frame whose tag names the serializer that wrote it.
#pragma once

#include <string>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

/// Carries one serialized object. The tag is the registered name of the object's serializer, by which a receiver finds
/// the serializer that reads it.
class TaggedFrame final : public Frame {
  public:
    /// Takes over `buffer`; `tag` is copied.
    TaggedFrame(FrameType type, unsigned int streamID, const std::string& tag, FrameBuffer&& buffer,
                unsigned long frameIndex);
    ~TaggedFrame() override;

    const std::string& tag() const noexcept { return tag_; }

  private:
    std::string tag_;
};

}  // namespace foundation::vantor::carrier::framing
