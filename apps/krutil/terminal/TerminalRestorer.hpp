// A terminal in a mode of its own, and signals that stop or end the program meanwhile.
#pragma once

#include <termios.h>

#include <array>
#include <csignal>

namespace krutil_client {

/// While an object lives, a signal that stops or ends the program (Ctrl-Z, Ctrl-\, a hang-up, a plea to terminate)
/// first gives standard input the mode back that it had when the object was made, if the program is in the foreground.
/// When the program goes on after a stop, and when the terminal has got another size, what waits is woken through
/// Interrupt::wake(). Signals that were ignored stay so. One object at a time; main thread only.
class TerminalRestorer {
  public:
    /// `leaving` is written to standard output when the mode is given back; a literal.
    explicit TerminalRestorer(const char* leaving);
    ~TerminalRestorer();
    TerminalRestorer(const TerminalRestorer&) = delete;
    TerminalRestorer& operator=(const TerminalRestorer&) = delete;

    /// Whether the program was stopped since the last call, so that the terminal's mode has to be set again and its
    /// last line is not this program's any more.
    bool wasStopped() noexcept;

  private:
    static constexpr std::array restoring{SIGTSTP, SIGTERM, SIGHUP, SIGQUIT};
    static constexpr std::array waking{SIGCONT, SIGWINCH};

    std::array<struct sigaction, restoring.size() + waking.size()> previous_{};
};

}  // namespace krutil_client
