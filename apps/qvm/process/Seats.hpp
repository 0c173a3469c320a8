// The processes of a listening engine's sessions: how many there may be, and which handshake has to give way.
#pragma once

#include <poll.h>
#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <list>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace qvm {

/// Counts sessions and unfinished handshakes apart, so that clients that do not say what they speak keep nobody out.
/// Both are processes; one becomes the other when the peers have accepted each other. One thread.
///
/// A process asks for a seat before it accepts its client (Seat.hpp). One whose client does not answer after that has a
/// seat and is unfinished: it gives way to others as well.
class Seats {
  public:
    using Clock = std::chrono::steady_clock;

    /// Unfinished handshakes at a time.
    static constexpr std::size_t maxHandshakes = 64;

    /// How old an unfinished handshake is at least that has to give way. Clients that come in a burst have that long.
    static constexpr std::chrono::milliseconds grace{500};

    /// How long a client that has been accepted has to answer at least. What it owes is on its way in one round trip.
    static constexpr std::chrono::milliseconds answerGrace{2'000};

    explicit Seats(std::size_t maxSessions) noexcept : maxSessions_(maxSessions) {}

    /// A process that shakes hands, and the line to it.
    void add(pid_t process, foundation::core::posix::OwnedDescriptor line);

    /// A process that has ended.
    void remove(pid_t process);

    /// In a process that was forked: closes what is the listener's.
    void forget() noexcept;

    /// Whether a client that comes now cannot get a seat.
    bool areTaken(Clock::time_point now);

    /// Whether a process for another handshake may be started.
    bool hasRoomForHandshake() const noexcept { return unfinished_.size() < maxHandshakes; }

    /// Without that room: when the oldest handshake may be made to give way. Nothing while one is about to end.
    std::optional<Clock::time_point> nextWithdrawal() const;

    /// Has the oldest handshake give way.
    void withdrawOldest();

    /// Lines to wait for.
    void appendTo(std::vector<pollfd>& watched) const;

    /// Answers what has come on the lines. Returns why clients were refused, a sentence each.
    std::vector<std::string> answer(Clock::time_point now);

    /// All processes.
    std::set<pid_t> processes() const;

  private:
    struct Handshake {
        pid_t process;
        foundation::core::posix::OwnedDescriptor line;
        Clock::time_point begin;
        std::optional<Clock::time_point> seated;
        bool withdrawn = false;
    };

    std::size_t seated() const;
    std::list<Handshake>::iterator findStalled(Clock::time_point now);
    void giveSeat(Handshake& handshake, Clock::time_point now, std::vector<std::string>& refusals);
    static void withdraw(Handshake& handshake);

    const std::size_t maxSessions_;
    std::list<Handshake> unfinished_;  // the oldest first
    std::set<pid_t> sessions_;
};

}  // namespace qvm
