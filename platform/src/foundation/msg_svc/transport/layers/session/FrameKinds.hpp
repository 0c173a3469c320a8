// Which kind of frame a frame is.
#pragma once

#include <typeinfo>

#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// The frame as a tagged one; null for another kind. The class has no derived ones, so this takes one comparison, and
/// not the search of a dynamic cast: each frame is asked several times on its way.
inline const framing::TaggedFrame* asTagged(const framing::Frame& frame) noexcept {
    return typeid(frame) == typeid(framing::TaggedFrame) ? static_cast<const framing::TaggedFrame*>(&frame) : nullptr;
}

}  // namespace foundation::msg_svc::transport::layers::session
