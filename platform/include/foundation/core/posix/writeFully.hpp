// Writing all of a text.
#pragma once

#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <string_view>

namespace foundation::core::posix {

/// Writes all of `text` to a blocking descriptor. Gives up at the first error other than an interruption: returns false
/// then, with errno set.
inline bool writeFully(int descriptor, std::string_view text) noexcept {
    while (!text.empty()) {
        const ssize_t written = ::write(descriptor, text.data(), text.size());
        if (written >= 0) {
            text.remove_prefix(static_cast<std::size_t>(written));
        } else if (errno != EINTR) {
            return false;
        }
    }
    return true;
}

}  // namespace foundation::core::posix
