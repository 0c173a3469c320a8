#include "qvm/requests/Cancellation.hpp"

#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

namespace qvm {
namespace {

// A signal that falls between the thread's last look and its next system call does not end that call, so it is sent
// again and again until the interrupt is taken.
constexpr long repeatNanoseconds = 10'000'000;

}  // namespace

int Cancellation::signal() noexcept {
    return SIGRTMAX - 3;
}

Cancellation::Cancellation() : wanted_("Cancelling") {
    sigevent event{};
    event.sigev_notify = SIGEV_THREAD_ID;
    event.sigev_signo = signal();
    event._sigev_un._tid = ::gettid();
    if (::timer_create(CLOCK_MONOTONIC, &event, &timer_) != 0) {
        throw std::system_error(errno, std::generic_category(), "Cancelling needs a timer (timer_create)");
    }
}

Cancellation::~Cancellation() {
    ::timer_delete(timer_);
}

void Cancellation::begin(const IDType& id) {
    const std::lock_guard lock(mutex_);
    running_.push_back({id});
    update();
}

bool Cancellation::end() {
    const std::lock_guard lock(mutex_);
    const bool never = running_.back().interrupt;
    running_.pop_back();
    update();
    return never;
}

Cancellation::Effect Cancellation::cancel(const IDType& id, bool evenIfRunning) {
    const std::lock_guard lock(mutex_);
    const auto found =
        std::find_if(running_.begin(), running_.end(), [&id](const Running& each) { return each.id == id; });
    if (found == running_.end()) {
        return Effect::NotRunning;
    }
    if (!evenIfRunning) {
        return Effect::LeftRunning;
    }
    std::for_each(found, running_.end(), [](Running& each) { each.interrupt = true; });
    update();
    return Effect::Interrupted;
}

bool Cancellation::takeInterrupt() {
    const std::lock_guard lock(mutex_);
    if (running_.empty() || !running_.back().interrupt) {
        return false;
    }
    running_.back().interrupt = false;
    running_.back().given = true;
    update();
    return true;
}

bool Cancellation::repeatInterrupt() {
    const std::lock_guard lock(mutex_);
    if (running_.empty() || !running_.back().given) {
        return false;
    }
    running_.back().interrupt = true;
    running_.back().given = false;
    update();
    return true;
}

void Cancellation::update() noexcept {
    const bool wanted = !running_.empty() && running_.back().interrupt;
    if (wanted == armed_) {
        return;
    }
    armed_ = wanted;
    itimerspec times{};
    if (wanted) {
        wanted_.raise();
        times.it_value.tv_nsec = 1;
        times.it_interval.tv_nsec = repeatNanoseconds;
    } else {
        wanted_.clear();
    }
    ::timer_settime(timer_, 0, &times, nullptr);
}

}  // namespace qvm
