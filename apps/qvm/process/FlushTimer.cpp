#include "qvm/process/FlushTimer.hpp"

#include <poll.h>
#include <pthread.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <system_error>
#include <utility>

#include "foundation/core/posix/SignalsBlocked.hpp"

namespace qvm {
namespace {

namespace posix = foundation::core::posix;

// How long flushAll() waits. The thread needs far less, but a process that fails may have stopped it.
constexpr int flushAllMilliseconds = 200;

}  // namespace

FlushTimer::FlushTimer(Flush flush)
    : flush_(std::move(flush)), timer_(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC)), allFlushed_("Flushing output") {
    if (!timer_) {
        throw std::system_error(errno, std::generic_category(), "Flushing output needs a descriptor (timerfd)");
    }
    const posix::SignalsBlocked blocked;
    thread_ = std::thread([this] {
        ::pthread_setname_np(::pthread_self(), "flush");
        run();
    });
}

void FlushTimer::stop() noexcept {
    ending_ = true;
    set(Time());
    if (thread_.joinable()) {
        thread_.join();
    }
}

void FlushTimer::expect(Time due) noexcept {
    if (due >= expected_.load(std::memory_order_acquire)) {
        return;
    }
    const std::lock_guard lock(mutex_);
    if (due < expected_.load(std::memory_order_relaxed)) {
        expected_.store(due, std::memory_order_release);
        set(due);
    }
}

void FlushTimer::flushAll() noexcept {
    all_ = true;
    set(Time());
    pollfd done{allFlushed_.get(), POLLIN, 0};
    ::poll(&done, 1, flushAllMilliseconds);
}

// A time that has passed makes the timer run out at once.
void FlushTimer::set(Time due) noexcept {
    const auto span = std::max<std::chrono::nanoseconds>(due.time_since_epoch(), std::chrono::nanoseconds(1));
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(span);
    itimerspec times{};
    times.it_value.tv_sec = seconds.count();
    times.it_value.tv_nsec = (span - seconds).count();
    ::timerfd_settime(timer_.get(), TFD_TIMER_ABSTIME, &times, nullptr);
}

void FlushTimer::run() {
    for (;;) {
        std::uint64_t ignored = 0;
        if (::read(timer_.get(), &ignored, sizeof ignored) < 0) {
            // Nothing is due then. What is to be flushed may not even be there yet.
            if (errno == EINTR || errno == EAGAIN) {
                continue;
            }
            return;
        }
        if (ending_) {
            return;
        }
        {
            // What is held from now on is expected anew.
            const std::lock_guard lock(mutex_);
            expected_.store(never, std::memory_order_release);
        }
        const bool all = all_;
        const Time next = flush_(all ? never : Clock::now());
        if (all) {
            allFlushed_.raise();
        } else if (next != never) {
            expect(next);
        }
    }
}

}  // namespace qvm
