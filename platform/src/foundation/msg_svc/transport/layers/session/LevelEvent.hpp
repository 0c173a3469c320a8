// A condition that threads wait for together with descriptors.
#pragma once

#include <atomic>

#include "foundation/core/posix/EventDescriptor.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// A descriptor that is readable exactly while the condition holds, for any number of waiting threads. set() needs the
/// lock that guards the condition; the rest may be called from any thread.
class LevelEvent {
  public:
    /// The condition does not hold at first. Throws std::system_error.
    LevelEvent() : event_("A session") {}

    int descriptor() const noexcept { return event_.get(); }
    bool holds() const noexcept { return holds_.load(std::memory_order_acquire); }

    void set(bool holds) noexcept {
        if (holds == holds_.load(std::memory_order_relaxed)) {
            return;
        }
        if (holds) {
            event_.raise();
        } else {
            event_.clear();
        }
        holds_.store(holds, std::memory_order_release);
    }

  private:
    core::posix::EventDescriptor event_;
    std::atomic<bool> holds_{false};
};

}  // namespace foundation::msg_svc::transport::layers::session
