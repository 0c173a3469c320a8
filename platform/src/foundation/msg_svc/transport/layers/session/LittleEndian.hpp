// Unsigned integers as bytes, the least significant byte first.
#pragma once

#include <cstddef>

namespace foundation::msg_svc::transport::layers::session {

/// Writes sizeof(Number) bytes at `bytes`.
template <class Number>
void storeLittleEndian(char* bytes, Number number) noexcept {
    for (std::size_t i = 0; i < sizeof(Number); ++i) {
        bytes[i] = static_cast<char>(static_cast<unsigned char>(number >> (8 * i)));
    }
}

/// Reads sizeof(Number) bytes at `bytes`.
template <class Number>
Number loadLittleEndian(const char* bytes) noexcept {
    Number number = 0;
    for (std::size_t i = 0; i < sizeof(Number); ++i) {
        number =
            static_cast<Number>(number | static_cast<Number>(Number{static_cast<unsigned char>(bytes[i])} << (8 * i)));
    }
    return number;
}

}  // namespace foundation::msg_svc::transport::layers::session
