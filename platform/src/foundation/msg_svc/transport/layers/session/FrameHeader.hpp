// The 24 bytes in front of each frame of a session.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>

#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// What a frame is to a session. Numbers are those of the first byte on the wire, without its highest bit.
enum class FrameKind : std::uint8_t {
    Tagged = 1,
    Data = 2,
    Goodbye = 3,     ///< the client sends nothing more
    Abort = 4,       ///< the sender closes the session; the content says why
    SharedData = 5,  ///< a data frame whose content is in memory that both ends see; see lending/SharedContent.hpp
    Return = 6,      ///< the sender is done with a content of that kind; its number is in the place of the frame index
};

/// Header of one frame; a plain value. On the wire: kind (highest bit: last frame of its message), frame type, tag size
/// (16 bits), stream ID (32), frame index (64), content size (64), all little-endian.
struct FrameHeader {
    static constexpr std::size_t size = 24;
    using Bytes = std::array<char, size>;

    std::uint8_t kind = 0;  ///< a FrameKind, or any other number in a header that was received
    bool last = false;
    framing::FrameType type = framing::FrameType::Unspecified;
    std::uint16_t tagSize = 0;
    framing::StreamID stream = 0;
    framing::FrameIndex index = 0;
    std::uint64_t contentSize = 0;

    bool is(FrameKind expected) const noexcept { return kind == static_cast<std::uint8_t>(expected); }
};

FrameHeader::Bytes encode(const FrameHeader& header) noexcept;
FrameHeader decode(const FrameHeader::Bytes& bytes) noexcept;

}  // namespace foundation::msg_svc::transport::layers::session
