#include "krutil/base/Interrupt.hpp"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>

#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

// All that the signal handler knows.
std::atomic<const posix::EventDescriptor*> eventOfProcess{nullptr};
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

Interrupt::Interrupt() : event_("Ctrl-C"), action_([] { throw Cancelled(); }) {
    eventOfProcess = &event_;
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
    eventOfProcess = nullptr;
}

void Interrupt::dispatch(const std::function<void()>& before) {
    if (event_.clear() && pressed.exchange(false)) {
        if (before) {
            before();
        }
        // A copy: the action may replace itself.
        const auto action = action_;
        action();
    }
}

void Interrupt::waitForInput(int input) {
    std::array<pollfd, 2> watched{pollfd{input, POLLIN, 0}, pollfd{fd(), POLLIN, 0}};
    while (watched[0].revents == 0) {
        // A signal ends the call, so fd() is looked at again.
        ::poll(watched.data(), watched.size(), -1);
        dispatch();
    }
}

void Interrupt::wake() noexcept {
    if (const posix::EventDescriptor* const event = eventOfProcess.load()) {
        event->raise();
    }
}

Interrupt::ShutsDown::ShutsDown(int socket) : socket_(::fcntl(socket, F_DUPFD_CLOEXEC, 0)) {
    socketToShutDown = socket_.get();
}

Interrupt::ShutsDown::~ShutsDown() {
    socketToShutDown = -1;
}

}  // namespace krutil_client
