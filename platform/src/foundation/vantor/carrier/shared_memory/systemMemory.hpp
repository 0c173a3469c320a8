// What the kernel promises about memory that a descriptor stands for.
#pragma once

#include <fcntl.h>

#include <cstddef>

namespace foundation::vantor::carrier::shared_memory {

/// The unit of memory.
inline constexpr std::size_t pageSize = 4096;

/// Its size never changes, no mapping that could write to it can be added, and none of this can be taken back. Sealed
/// against future writes, it cannot have holes punched into it either.
inline constexpr int requiredSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_FUTURE_WRITE | F_SEAL_SEAL;

}  // namespace foundation::vantor::carrier::shared_memory
