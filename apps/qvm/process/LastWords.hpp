// What a process has printed arrives, though a signal ends the process.
#pragma once

#include "qvm/process/FlushTimer.hpp"

namespace qvm {

/// While an object lives, what is held for a moment is sent before a signal ends the process: a fault, an abort, a
/// termination from outside. SIGKILL alone cannot be seen. The process ends by the same signal all the same. One object
/// at a time in a process; forked children end as they would without it.
class LastWords {
  public:
    /// `timer` sends what is held, and must outlive the object. Calls keep(), and gives the calling thread a second
    /// stack for the case that its own one overflows.
    explicit LastWords(FlushTimer& timer);
    ~LastWords();
    LastWords(const LastWords&) = delete;
    LastWords& operator=(const LastWords&) = delete;

    /// Takes over the signals that would end the process without a word. Those that are handled or ignored are left
    /// alone. To be called again when one of them is given its default action. Any thread.
    static void keep() noexcept;
};

}  // namespace qvm
