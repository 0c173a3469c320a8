// What is common to buffers that have pages of their own.
#pragma once

#include <cstddef>

namespace foundation::vantor::carrier::framing {

/// From this size on a buffer has pages of its own. Returning those to the kernel and faulting in fresh ones takes four
/// to fifteen times as long as writing to them once, so they are kept for the next buffer of their size class.
inline constexpr std::size_t largeSize = 1U << 20;

/// Bytes of the size class of a large buffer, a multiple of the page. Four classes to each power of two: a buffer fits
/// the next one of nearly its size.
constexpr std::size_t capacityFor(std::size_t size) {
    std::size_t step = largeSize / 4;
    while (step <= size / 8) {
        step *= 2;
    }
    return (size + step - 1) / step * step;
}

}  // namespace foundation::vantor::carrier::framing
