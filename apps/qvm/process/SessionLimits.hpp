// How much of the machine the process of a session may use.
#pragma once

#include <cstdint>

namespace qvm {

/// Zero where nothing is bounded besides what the engine was started with.
struct SessionLimits {
    std::uint64_t memory = 0;       ///< bytes of private memory that can be written to (RLIMIT_DATA)
    std::uint64_t descriptors = 0;  ///< descriptors at a time (RLIMIT_NOFILE)
};

/// What ordinary work does not come near: as much memory as the machine has, swap included, and 65,536 descriptors.
/// Memory is not bounded in a build with sanitizers, which reserve more.
SessionLimits usualSessionLimits();

/// Memory that a session may be bounded to at least; one that has nothing to do has some 40 MB.
inline constexpr std::uint64_t smallestMemoryLimit = std::uint64_t{64} << 20;

/// Bounds this process and those that it starts. What is bounded already to less stays so. Throws std::system_error
/// when the system refuses.
void apply(const SessionLimits& limits);

}  // namespace qvm
