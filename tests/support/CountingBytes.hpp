// Bytes that a test can tell one from another.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstring>

namespace test_support {

/// Fills `bytes` with 0, 1, ... `period` - 1, again and again. It copies blocks: byte by byte, the thread sanitizer
/// needs half a minute for 100 MiB.
inline void countUp(char* bytes, std::uint64_t size, std::uint64_t period) {
    const std::uint64_t first = std::min(size, period);
    for (std::uint64_t i = 0; i < first; ++i) {
        bytes[i] = static_cast<char>(i);
    }
    for (std::uint64_t filled = first; filled < size; filled *= 2) {
        std::memcpy(bytes + filled, bytes, std::min(filled, size - filled));
    }
}

}  // namespace test_support
