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
    Tagged = 1,      ///< one object
    Data = 2,        ///< bulk bytes of an array
    Goodbye = 3,     ///< the client sends nothing more
    Abort = 4,       ///< the sender closes the session; the content says why
    SharedData = 5,  ///< a data frame whose content is in memory that both ends see; its content says where
    Return = 6,      ///< the sender is done with a content of that kind; its number is in the place of the frame index
    KeepAlive = 7,   ///< nothing but a sign that the sender is there
};

/// Header of one frame; a plain value. On the wire: kind (highest bit: last frame of its message), frame type, tag size
/// (16 bits), stream ID (32), frame index (64), content size (64), all little-endian.
struct FrameHeader {
    /// Bytes of a header.
    static constexpr std::size_t size = 24;

    /// A header as it is on the wire.
    using Bytes = std::array<char, size>;

    std::uint8_t kind = 0;  ///< a FrameKind, or any other number in a header that was received
    bool last = false;      ///< the last frame of its message
    framing::FrameType type = framing::FrameType::Unspecified;  ///< as the serializer or the elements have it
    std::uint16_t tagSize = 0;                                  ///< bytes of the tag
    framing::StreamID stream = 0;                               ///< of the exchange; 0 for the background
    framing::FrameIndex index = 0;                              ///< in the message, from 1
    std::uint64_t contentSize = 0;                              ///< bytes of the content

    /// Whether the frame is of this kind.
    bool is(FrameKind expected) const noexcept { return kind == static_cast<std::uint8_t>(expected); }
};

/// The bytes of a header.
FrameHeader::Bytes encode(const FrameHeader& header) noexcept;

/// What the bytes of a header say; any bytes are a header.
FrameHeader decode(const FrameHeader::Bytes& bytes) noexcept;

}  // namespace foundation::msg_svc::transport::layers::session
