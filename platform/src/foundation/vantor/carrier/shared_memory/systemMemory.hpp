// What the kernel promises about memory that a descriptor stands for, and how it is mapped.
#pragma once

#include <fcntl.h>

#include <cstddef>
#include <cstdint>

namespace foundation::vantor::carrier::shared_memory {

/// The unit of memory.
inline constexpr std::size_t pageSize = 4096;

/// Where the kernel has put that much into one piece, mapping it takes one fault instead of many.
inline constexpr std::size_t largePageSize = 2U << 20;

/// Its size never changes, no mapping that could write to it can be added, and none of this can be taken back. Sealed
/// against future writes, it cannot have holes punched into it either.
inline constexpr int requiredSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_FUTURE_WRITE | F_SEAL_SEAL;

/// mmap() for reading and writing, at an address where large pages can be used as such; `flags` as there. Returns null
/// and sets errno on failure.
char* map(int descriptor, std::uint64_t offset, std::size_t size, int flags) noexcept;

}  // namespace foundation::vantor::carrier::shared_memory
