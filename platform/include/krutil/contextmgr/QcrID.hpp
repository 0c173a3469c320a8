// Identifier of a runtime instance.
#pragma once

#include <cstdint>

namespace krutil::contextmgr {

using QcrID = std::int32_t;

}  // namespace krutil::contextmgr
