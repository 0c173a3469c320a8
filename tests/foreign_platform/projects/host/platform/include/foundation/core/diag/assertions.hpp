// Diagnostic assertions, which this platform always checks.
#pragma once

namespace foundation::core::diag {

constexpr bool assertionsEnabled() {
    return true;
}

}  // namespace foundation::core::diag
