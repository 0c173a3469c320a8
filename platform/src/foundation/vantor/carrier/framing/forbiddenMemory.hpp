// Memory that is kept for later and that nobody may use meanwhile, for the address sanitizer.
#pragma once

#include <cstddef>

#if defined(__SANITIZE_ADDRESS__)
#define KRUTIL_ADDRESS_SANITIZER 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define KRUTIL_ADDRESS_SANITIZER 1
#endif
#endif

#if defined(KRUTIL_ADDRESS_SANITIZER)
#include <sanitizer/asan_interface.h>
#endif

namespace foundation::vantor::carrier::framing {

/// From now on the address sanitizer reports whoever reads or writes there. Without it nothing happens.
inline void forbid([[maybe_unused]] const char* memory, [[maybe_unused]] std::size_t size) noexcept {
#if defined(KRUTIL_ADDRESS_SANITIZER)
    __asan_poison_memory_region(memory, size);
#endif
}

/// Takes that back.
inline void allow([[maybe_unused]] const char* memory, [[maybe_unused]] std::size_t size) noexcept {
#if defined(KRUTIL_ADDRESS_SANITIZER)
    __asan_unpoison_memory_region(memory, size);
#endif
}

}  // namespace foundation::vantor::carrier::framing
