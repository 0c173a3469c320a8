#include "krutil/terminal/TerminalRestorer.hpp"

#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>

#include "krutil/base/Interrupt.hpp"

namespace krutil_client {
namespace {

// All that the signal handlers know.
termios modeBefore;
const char* leavingText = "";
std::atomic<bool> modeKnown{false};
std::atomic<bool> stopped{false};

void restoreAndPassOn(int signal) {
    const int savedError = errno;
    // From the background it would stop the program, which may be about to end.
    if (modeKnown && ::tcgetpgrp(STDIN_FILENO) == ::getpgrp()) {
        ::tcsetattr(STDIN_FILENO, TCSANOW, &modeBefore);
        [[maybe_unused]] const auto written = ::write(STDOUT_FILENO, leavingText, std::strlen(leavingText));
    }
    struct sigaction usual {};
    usual.sa_handler = SIG_DFL;
    struct sigaction ours {};
    ::sigaction(signal, &usual, &ours);
    ::raise(signal);
    sigset_t only;
    sigemptyset(&only);
    sigaddset(&only, signal);
    // What was raised acts here; what ends the program does not come back.
    ::pthread_sigmask(SIG_UNBLOCK, &only, nullptr);
    ::sigaction(signal, &ours, nullptr);
    // Where nobody can continue it, the kernel does not stop a program, and there is no other sign of that.
    stopped = true;
    Interrupt::wake();
    errno = savedError;
}

void wakeUp(int signal) {
    if (signal == SIGCONT) {
        stopped = true;
    }
    Interrupt::wake();
}

}  // namespace

TerminalRestorer::TerminalRestorer(const char* leaving) {
    leavingText = leaving;
    stopped = false;
    modeKnown = ::tcgetattr(STDIN_FILENO, &modeBefore) == 0;
    auto* previous = previous_.data();
    const auto handle = [&previous](int signal, void (*handler)(int)) {
        struct sigaction handling {};
        handling.sa_handler = handler;
        handling.sa_flags = SA_RESTART;
        ::sigaction(signal, nullptr, previous);
        if (previous->sa_handler != SIG_IGN) {
            ::sigaction(signal, &handling, nullptr);
        }
        ++previous;
    };
    for (const int signal : restoring) {
        handle(signal, &restoreAndPassOn);
    }
    for (const int signal : waking) {
        handle(signal, &wakeUp);
    }
}

TerminalRestorer::~TerminalRestorer() {
    const auto* previous = previous_.data();
    for (const int signal : restoring) {
        ::sigaction(signal, previous++, nullptr);
    }
    for (const int signal : waking) {
        ::sigaction(signal, previous++, nullptr);
    }
    modeKnown = false;
}

bool TerminalRestorer::wasStopped() noexcept {
    return stopped.exchange(false);
}

}  // namespace krutil_client
