// A bound on how much is said per unit of time.
#pragma once

#include <chrono>
#include <cstddef>
#include <mutex>
#include <optional>

namespace apps {

/// Allows so many lines a period and counts the rest. May be used from any thread.
class RateLimit {
  public:
    using Clock = std::chrono::steady_clock;

    /// `lines` a `period`; a period begins with the first line after the previous one is over.
    RateLimit(std::size_t lines, Clock::duration period) noexcept : lines_(lines), period_(period) {}

    /// Asks for one line at `now`. Empty when the line is to be left out; otherwise how many lines were left out since
    /// the last one that was allowed.
    std::optional<std::size_t> ask(Clock::time_point now);

  private:
    std::mutex mutex_;
    std::size_t lines_;
    Clock::duration period_;
    std::optional<Clock::time_point> begin_;
    std::size_t said_ = 0;
    std::size_t leftOut_ = 0;
};

}  // namespace apps
