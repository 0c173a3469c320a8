// How far a large transfer has come.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace krutil_client {

/// A line on a terminal that grows while arrays are on their way, for those that take longer than a moment:
///
///     sending   [############                  ]  40%  25.6 of 64.0 MiB
///     receiving [########################      ]  80%  51.2 of 64.0 MiB
///
/// Of what is received only the array that is arriving is known, so the line is about that one. The object decides what
/// to write; writing it is its user's work. It reads no clock of its own.
class Progress {
  public:
    using Clock = std::chrono::steady_clock;
    using Traffic = foundation::msg_svc::transport::layers::session::Traffic;

    /// What takes less time is not shown.
    static constexpr std::chrono::milliseconds moment{500};

    /// `toSend` bytes are sent from `now` on.
    Progress(const Traffic& traffic, std::uint64_t toSend, Clock::time_point now) noexcept;

    /// What to write to a terminal of this many columns; empty when nothing changes.
    std::string update(const Traffic& traffic, Clock::time_point now, std::size_t columns);

    /// What to write before anything else is written: it takes the line away. Empty when there is none.
    std::string clear();

  private:
    std::string show(const char* what, std::uint64_t done, std::uint64_t total, Clock::time_point now,
                     std::size_t columns);

    std::uint64_t toSend_;
    std::uint64_t writtenBefore_;
    std::optional<Clock::time_point> since_;  ///< when the transfer that goes on was first seen
    std::string shown_;
};

}  // namespace krutil_client
