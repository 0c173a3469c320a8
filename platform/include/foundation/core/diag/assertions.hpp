// Whether diagnostic assertions are checked in this process.
#pragma once

namespace foundation::core::diag {

/// False unless the host switched assertions on. A failed assertion is terminate(expression, file, line, function).
bool assertionsEnabled() noexcept;

}  // namespace foundation::core::diag
