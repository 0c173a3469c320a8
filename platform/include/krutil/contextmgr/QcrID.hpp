// Identifier of a runtime instance.
#pragma once

#include <cstdint>

namespace krutil::contextmgr {

/// 0 where an engine has one instance only.
using QcrID = std::int32_t;

}  // namespace krutil::contextmgr
