// How a request ended.
#pragma once

namespace krutil::cmddistributor {

enum class inExecutionStatus : int { fine, unreadable, failed, abandoned, interrupted, cutOff };

}  // namespace krutil::cmddistributor
