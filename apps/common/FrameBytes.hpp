// What the bytes of a recorded or received frame say.
#pragma once

#include <algorithm>
#include <cstdint>
#include <string_view>

#include "foundation/msg_svc/transport/layers/session/FrameHeader.hpp"

namespace apps {

using foundation::msg_svc::transport::layers::session::FrameHeader;
using foundation::msg_svc::transport::layers::session::FrameKind;

/// The number in up to 8 bytes, the least significant byte first.
inline std::uint64_t littleEndian(std::string_view bytes) noexcept {
    std::uint64_t number = 0;
    for (std::size_t i = bytes.size(); i > 0; --i) {
        number = number << 8U | static_cast<unsigned char>(bytes[i - 1]);
    }
    return number;
}

/// The header of `frame`, which has FrameHeader::size bytes or more.
inline FrameHeader headerOf(std::string_view frame) noexcept {
    FrameHeader::Bytes bytes{};
    std::copy_n(frame.begin(), bytes.size(), bytes.begin());
    return foundation::msg_svc::transport::layers::session::decode(bytes);
}

}  // namespace apps
