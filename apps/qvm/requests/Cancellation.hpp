// Interrupts of running requests.
//
// A real-time signal aimed at Python's main thread stops everything that the thread may be in: a loop, a sleep, a
// system call. Nothing else does, and another thread cannot interrupt Python in its own name. The signal's handler,
// which Python calls between two steps of its code, asks takeInterrupt() whether the request that runs now is meant. So
// an interrupt that comes late finds nothing to do and cannot reach the next request.
//
// The running requests are a stack, because a prompt of one request runs others. An interrupt of one reaches those
// above it first, from the top.
#pragma once

#include <time.h>

#include <mutex>
#include <vector>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"

namespace qvm {

/// See the head of this file. cancel() may be called from any thread and never waits; the other members are for the
/// thread that made the object, which must have a handler for signal() before the first begin().
class Cancellation {
  public:
    using IDType = foundation::msg_svc::exchange::IDType;

    /// Throws std::system_error when the system has no descriptor or timer left.
    Cancellation();
    ~Cancellation();
    Cancellation(const Cancellation&) = delete;
    Cancellation& operator=(const Cancellation&) = delete;

    /// Number of the signal.
    static int signal() noexcept;

    /// Readable while takeInterrupt() has something to give, for waits.
    int descriptor() const noexcept { return wanted_.get(); }

    /// `id` runs from now on, until end().
    void begin(const IDType& id);

    /// The request that began last has ended. Returns whether it was cancelled and its interrupt never taken.
    bool end();

    /// What a cancel does to a request.
    enum class Effect {
        NotRunning,   ///< no such request runs
        LeftRunning,  ///< it runs, and nothing was done
        Interrupted,  ///< it is told to stop
    };

    /// Interrupts `id` if it runs and `evenIfRunning` holds.
    Effect cancel(const IDType& id, bool evenIfRunning);

    /// Whether the request that began last is to be interrupted; each interrupt is given once.
    bool takeInterrupt();

    /// The interrupt that takeInterrupt() gave was lost before it reached the request's code, and is to be given again.
    /// Returns false when that request was given none.
    bool repeatInterrupt();

  private:
    struct Running {
        IDType id;
        bool interrupt = false;
        bool given = false;
    };

    void update() noexcept;

    foundation::core::posix::EventDescriptor wanted_;  // readable while the request on top is to be interrupted
    timer_t timer_{};
    std::mutex mutex_;
    std::vector<Running> running_;
    bool armed_ = false;
};

}  // namespace qvm
