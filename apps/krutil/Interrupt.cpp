#include "Interrupt.hpp"

#include <fcntl.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <system_error>

#include "ExitCode.hpp"

namespace client {
namespace {

// All that the signal handler knows.
std::atomic<int> eventOfProcess{-1};
std::atomic<int> socketToShutDown{-1};
std::atomic<bool> pressed{false};

void onSignal(int) {
    const int savedError = errno;
    pressed = true;
    Interrupt::wake();
    if (const int socket = socketToShutDown.load(); socket >= 0) {
        ::shutdown(socket, SHUT_RDWR);
    }
    errno = savedError;
}

}  // namespace

Interrupt::Interrupt() : event_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)), action_([] { throw Cancelled(); }) {
    if (!event_) {
        throw std::system_error(errno, std::generic_category(), "eventfd");
    }
    eventOfProcess = event_.get();
    pressed = false;
    // A shell that starts the program in the background has Ctrl-C ignored; that stays so.
    struct sigaction previous {};
    ::sigaction(SIGINT, nullptr, &previous);
    if (previous.sa_handler == SIG_IGN) {
        return;
    }
    // Without SA_RESTART, so that a write to a terminal that is held up ends too.
    struct sigaction handling {};
    handling.sa_handler = &onSignal;
    ::sigaction(SIGINT, &handling, nullptr);
}

Interrupt::~Interrupt() {
    // The handler stays, and does nothing.
    eventOfProcess = -1;
}

void Interrupt::dispatch(const std::function<void()>& before) {
    std::uint64_t count = 0;
    if (::read(event_.get(), &count, sizeof count) == sizeof count && pressed.exchange(false)) {
        if (before) {
            before();
        }
        // A copy: the action may replace itself.
        const auto action = action_;
        action();
    }
}

void Interrupt::wake() noexcept {
    const int savedError = errno;
    const std::uint64_t one = 1;
    // The counter cannot be full, and a handler could do nothing about it.
    [[maybe_unused]] const auto written = ::write(eventOfProcess.load(), &one, sizeof one);
    errno = savedError;
}

Interrupt::ShutsDown::ShutsDown(int socket) : socket_(::fcntl(socket, F_DUPFD_CLOEXEC, 0)) {
    socketToShutDown = socket_.get();
}

Interrupt::ShutsDown::~ShutsDown() {
    socketToShutDown = -1;
}

}  // namespace client
