// How long tests wait for what has to come.
#pragma once

#include <chrono>

namespace test_support {

/// A test that has waited so long has failed. Nothing that goes well takes a fraction of it, but a sanitizer makes
/// programs several times slower.
#if defined(KRUTIL_SANITIZED)
inline constexpr std::chrono::seconds patience{240};
#else
inline constexpr std::chrono::seconds patience{60};
#endif

}  // namespace test_support
