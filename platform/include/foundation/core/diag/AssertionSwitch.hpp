// The host's switch for diagnostic assertions. Libraries only ask, through assertions.hpp.
#pragma once

namespace foundation::core::diag {

/// Switches diagnostic assertions on or off for the whole process, from any thread; returns what was set before.
bool enableAssertions(bool enabled) noexcept;

}  // namespace foundation::core::diag
