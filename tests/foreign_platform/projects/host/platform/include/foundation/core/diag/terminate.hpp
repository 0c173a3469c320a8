// The end of a process that cannot go on.
#pragma once

namespace foundation::core::diag {

/// Writes all four values to the standard error and aborts.
[[noreturn]] void terminate(const char* message, const char* file, int line, const char* function);

}  // namespace foundation::core::diag
