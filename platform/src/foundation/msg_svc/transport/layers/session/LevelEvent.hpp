// A condition that threads wait for together with descriptors.
#pragma once

#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <system_error>

namespace foundation::msg_svc::transport::layers::session {

/// A descriptor that is readable exactly while the condition holds, for any number of waiting threads. set() needs the
/// lock that guards the condition; the rest may be called from any thread.
class LevelEvent {
  public:
    /// The condition does not hold at first. Throws std::system_error.
    LevelEvent() : descriptor_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        if (descriptor_ < 0) {
            throw std::system_error(errno, std::generic_category(), "eventfd");
        }
    }
    ~LevelEvent() { ::close(descriptor_); }
    LevelEvent(const LevelEvent&) = delete;
    LevelEvent& operator=(const LevelEvent&) = delete;

    int descriptor() const noexcept { return descriptor_; }
    bool holds() const noexcept { return holds_.load(std::memory_order_acquire); }

    void set(bool holds) noexcept {
        if (holds == holds_.load(std::memory_order_relaxed)) {
            return;
        }
        std::uint64_t count = 1;
        // Neither can fail: the counter is 0 or 1 and changes only here.
        [[maybe_unused]] const ssize_t done =
            holds ? ::write(descriptor_, &count, sizeof count) : ::read(descriptor_, &count, sizeof count);
        holds_.store(holds, std::memory_order_release);
    }

  private:
    int descriptor_;
    std::atomic<bool> holds_{false};
};

}  // namespace foundation::msg_svc::transport::layers::session
