// Identifier of an engine.
#pragma once

#include <cstdint>

namespace krutil::contextmgr {

/// 0 means "not set".
using QvmID = std::uint64_t;

}  // namespace krutil::contextmgr
