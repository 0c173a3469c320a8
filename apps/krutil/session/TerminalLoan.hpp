// The terminal in the hands of the command that starts an engine.
#pragma once

#include <signal.h>
#include <sys/types.h>
#include <termios.h>

#include <array>
#include <optional>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

/// Lends the terminal that controls this program to the process group of a child, which may then read from it and gets
/// its Ctrl-C. A program such as ssh asks for a password there. While the terminal is lent, a Ctrl-C does not reach
/// this program. Main thread only.
class TerminalLoan {
  public:
    /// Lends nothing yet. From here on the terminal stops this program no more, which has to take it back.
    TerminalLoan();

    /// Takes the terminal back.
    ~TerminalLoan();
    TerminalLoan(TerminalLoan&& other) noexcept;
    TerminalLoan& operator=(TerminalLoan&&) = delete;

    /// For the forked child, which must lead its process group by now: takes the terminal, if this program has one and
    /// was in its foreground. Async-signal-safe.
    void takeInChild() const noexcept;

    /// For this program after that: notes who has the terminal.
    void lentTo(pid_t group) noexcept;

    /// Whether a child has the terminal.
    bool isLent() const noexcept { return borrower_ > 0; }

    /// Takes the terminal back, with the settings that it had before. Does nothing when it is not lent. Programs of
    /// this one's own group that the terminal has stopped meanwhile, such as a pager behind a pipe, go on.
    void takeBack() noexcept;

  private:
    // What a terminal stops a whole group with when one of its programs uses it from the background.
    static constexpr std::array stopping{SIGTTIN, SIGTTOU};

    foundation::core::posix::OwnedDescriptor terminal_;  ///< closed without a terminal that could be lent
    std::optional<termios> settings_;
    std::array<struct sigaction, stopping.size()> handlingBefore_{};
    pid_t borrower_ = -1;
};

}  // namespace krutil_client
