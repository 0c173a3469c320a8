// Signals held back for a scope.
#pragma once

#include <pthread.h>
#include <signal.h>

#include <initializer_list>

namespace foundation::core::posix {

/// While an object lives, its thread takes no signals but those that report a fault of the running thread itself.
/// Threads that start meanwhile inherit that: the signals of the process belong to other threads. A signal that comes
/// between a last look and a wait is not missed, when the wait lets it through with before().
class SignalsBlocked {
  public:
    SignalsBlocked() noexcept {
        sigset_t blocked;
        ::sigfillset(&blocked);
        for (const int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS, SIGPROF}) {
            ::sigdelset(&blocked, fault);
        }
        ::pthread_sigmask(SIG_BLOCK, &blocked, &before_);
    }
    ~SignalsBlocked() { ::pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
    SignalsBlocked(const SignalsBlocked&) = delete;
    SignalsBlocked& operator=(const SignalsBlocked&) = delete;

    /// The mask that was in force before.
    const sigset_t* before() const noexcept { return &before_; }

  private:
    sigset_t before_{};
};

}  // namespace foundation::core::posix
