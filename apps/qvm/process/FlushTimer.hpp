// When output that is held back has waited long enough.
//
// Output is held for a moment, because what follows may go with it. Nothing may follow for long, and the code may be in
// a loop or in a system call then, so a thread of its own looks after what is held.
#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <mutex>
#include <thread>

#include "foundation/core/posix/EventDescriptor.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace qvm {

/// See the head of this file. Running code shares the descriptors and may close them: then nothing is flushed in time.
class FlushTimer {
  public:
    using Clock = std::chrono::steady_clock;
    using Time = Clock::time_point;

    /// Nothing is held.
    static constexpr Time never = Time::max();

    /// Sends what is due at `now`, and returns when the rest is. Called on the timer's thread.
    using Flush = std::function<Time(Time now)>;

    /// Starts the thread. Throws std::system_error.
    explicit FlushTimer(Flush flush);
    ~FlushTimer() { stop(); }
    FlushTimer(const FlushTimer&) = delete;
    FlushTimer& operator=(const FlushTimer&) = delete;

    /// Has `flush` called at `due`, or before. From any thread, with the lock held that guards what is held and that
    /// `flush` takes. Never waits. Mostly without a system call: the timer is not taken back when output leaves early,
    /// so it often runs already.
    void expect(Time due) noexcept;

    /// Has `flush` called for everything, on the timer's thread, and waits until that is done, or a short while. Safe
    /// in a signal handler, unless the timer's own thread runs it.
    void flushAll() noexcept;

    /// Ends the thread. What is held from now on stays where it is.
    void stop() noexcept;

  private:
    void set(Time due) noexcept;
    void run();

    const Flush flush_;
    const foundation::core::posix::OwnedDescriptor timer_;
    const foundation::core::posix::EventDescriptor allFlushed_;
    std::mutex mutex_;
    std::atomic<Time> expected_{never};
    std::atomic<bool> all_{false};
    std::atomic<bool> ending_{false};
    std::thread thread_;
};

}  // namespace qvm
