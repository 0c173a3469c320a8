// A frame whose tag names the serializer that wrote it.
#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <string_view>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::vantor::carrier::framing {

/// Carries one serialized object. The tag is the registered name of the object's serializer, by which a receiver finds
/// the serializer that reads it.
class TaggedFrame final : public Frame {
  public:
    /// Takes over `buffer`; `tag` is copied, without an allocation when it has at most 48 characters.
    TaggedFrame(FrameType type, unsigned int streamID, const std::string& tag, FrameBuffer&& buffer,
                unsigned long frameIndex);
    ~TaggedFrame() override;

    /// Valid as long as the frame.
    std::string_view tag() const noexcept {
        return longTag_.empty() ? std::string_view(shortTag_.data(), shortLength_) : longTag_;
    }

  private:
    std::array<char, 48> shortTag_;
    std::uint8_t shortLength_ = 0;
    std::string longTag_;
};

}  // namespace foundation::vantor::carrier::framing
