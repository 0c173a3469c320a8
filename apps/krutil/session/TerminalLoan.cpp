#include "krutil/session/TerminalLoan.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <cstddef>
#include <utility>

namespace krutil_client {

TerminalLoan::TerminalLoan() : terminal_(::open("/dev/tty", O_RDWR | O_NOCTTY | O_CLOEXEC)) {
    // A program in the background has nothing to lend.
    if (terminal_ && ::tcgetpgrp(terminal_.get()) != ::getpgrp()) {
        terminal_.reset();
    }
    if (!terminal_) {
        return;
    }
    termios settings{};
    if (::tcgetattr(terminal_.get(), &settings) == 0) {
        settings_ = settings;
    }
    // This program must go on, to take the terminal back.
    for (std::size_t i = 0; i < stopping.size(); ++i) {
        struct sigaction ignored {};
        ignored.sa_handler = SIG_IGN;
        ::sigaction(stopping[i], &ignored, &handlingBefore_[i]);
    }
}

TerminalLoan::~TerminalLoan() {
    takeBack();
}

TerminalLoan::TerminalLoan(TerminalLoan&& other) noexcept
    : terminal_(std::move(other.terminal_)),
      settings_(other.settings_),
      handlingBefore_(other.handlingBefore_),
      borrower_(std::exchange(other.borrower_, -1)) {}

void TerminalLoan::takeInChild() const noexcept {
    if (terminal_) {
        // Whoever takes the terminal is in the background until it has it, so the signals are still ignored.
        ::tcsetpgrp(terminal_.get(), ::getpid());
        for (const int signal : stopping) {
            ::signal(signal, SIG_DFL);
        }
    }
}

void TerminalLoan::lentTo(pid_t group) noexcept {
    if (terminal_) {
        borrower_ = group;
    }
}

void TerminalLoan::takeBack() noexcept {
    const pid_t borrower = std::exchange(borrower_, -1);
    if (!terminal_) {
        return;
    }
    // A shell may have taken the terminal meanwhile, and given it to another job.
    if (borrower > 0 && ::tcgetpgrp(terminal_.get()) == borrower) {
        ::tcsetpgrp(terminal_.get(), ::getpgrp());
        // A command that is killed while it reads a password leaves the terminal without an echo.
        if (settings_) {
            ::tcsetattr(terminal_.get(), TCSADRAIN, &*settings_);
        }
        ::kill(0, SIGCONT);
    }
    for (std::size_t i = 0; i < stopping.size(); ++i) {
        ::sigaction(stopping[i], &handlingBefore_[i], nullptr);
    }
    terminal_.reset();
}

}  // namespace krutil_client
