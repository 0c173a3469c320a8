// What a frame says about a content that stays in shared memory.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>

#include "foundation/msg_svc/transport/layers/session/LittleEndian.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

/// The content of a frame of kind SharedData; a plain value. On the wire: three numbers of 64 bits, little-endian, in
/// this order. The descriptor of the memory comes beside the bytes of the stream.
struct SharedContent {
    static constexpr std::size_t bytes = 24;
    using Bytes = std::array<char, bytes>;

    /// Least size of a content, in bytes: each one costs the receiver a mapping, of which a process has not many.
    static constexpr std::uint64_t leastSize = 1U << 20;

    std::uint64_t number = 0;  ///< by which the receiver gives it back
    std::uint64_t offset = 0;  ///< in the memory, in bytes
    std::uint64_t size = 0;    ///< in bytes
};

inline SharedContent::Bytes encode(const SharedContent& content) noexcept {
    SharedContent::Bytes bytes;
    storeLittleEndian(bytes.data(), content.number);
    storeLittleEndian(bytes.data() + 8, content.offset);
    storeLittleEndian(bytes.data() + 16, content.size);
    return bytes;
}

/// Reads SharedContent::bytes bytes.
inline SharedContent decodeSharedContent(const char* bytes) noexcept {
    return {loadLittleEndian<std::uint64_t>(bytes), loadLittleEndian<std::uint64_t>(bytes + 8),
            loadLittleEndian<std::uint64_t>(bytes + 16)};
}

}  // namespace foundation::msg_svc::transport::layers::session::lending
