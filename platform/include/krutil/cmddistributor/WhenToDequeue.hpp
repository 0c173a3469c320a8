// When an engine's queue may hand out a request.
#pragma once

#include <cstdint>

namespace krutil::cmddistributor::WhenToDequeue {

/// Numbers are those of the wire.
enum WhenToDequeue : std::int32_t {
    DEQUEUE_UNKNOWN = 0,              ///< not stated
    DEQUEUE_AT_PPE = 1,               ///< at any point where the engine processes pending events
    DEQUEUE_AT_PAUSE = 2,             ///< at a pause
    DEQUEUE_AT_PROMPT = 3,            ///< at any prompt
    DEQUEUE_AT_NON_DEBUG_PROMPT = 4,  ///< at a prompt that is not a debugger's
    DEQUEUE_AT_DEBUG_PROMPT = 5,      ///< at a debugger's prompt only
    DEQUEUE_AT_IDLE = 6,              ///< when the engine runs nothing
    DEQUEUE_AT_BOOTSTRAP = 7,         ///< before the first request of any other mode
};

}  // namespace krutil::cmddistributor::WhenToDequeue
