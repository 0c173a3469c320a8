#include "qvm/python/ReleaseQueue.hpp"

#include <atomic>
#include <utility>

#include "foundation/core/posix/EventDescriptor.hpp"

namespace qvm {

// One borrowed object. Made when the object is lent, so that giving it back needs no memory.
struct ReleaseQueue::Held {
    std::shared_ptr<Core> core;
    PyObject* object;
    Held* next = nullptr;
};

// What the queue and those who hold objects share.
class ReleaseQueue::Core {
  public:
    Core() : wake_("The release queue") {}

    ~Core() {
        // The objects stay: nobody knows whether Python still runs.
        for (Held* held = returned_.load(); held != nullptr;) {
            delete std::exchange(held, held->next);
        }
    }

    Core(const Core&) = delete;
    Core& operator=(const Core&) = delete;

    void giveBack(Held* held) noexcept {
        held->next = returned_.load(std::memory_order_relaxed);
        while (
            !returned_.compare_exchange_weak(held->next, held, std::memory_order_release, std::memory_order_relaxed)) {
        }
        wake_.raise();
        raised_.store(true, std::memory_order_release);
    }

    // All that has come back, the latest first.
    Held* takeAll() noexcept {
        // Emptied before the look at the list, so that nothing is missed. Nothing is there most of the time.
        if (raised_.exchange(false, std::memory_order_acquire)) {
            wake_.clear();
        }
        return returned_.exchange(nullptr, std::memory_order_acquire);
    }

    int descriptor() const noexcept { return wake_.get(); }

  private:
    const foundation::core::posix::EventDescriptor wake_;
    std::atomic<bool> raised_{false};  // a moment after wake_
    std::atomic<Held*> returned_{nullptr};
};

ReleaseQueue::ReleaseQueue() : core_(std::make_shared<Core>()) {}

ReleaseQueue::~ReleaseQueue() = default;

std::shared_ptr<const void> ReleaseQueue::hold(PyObject* object) {
    auto held = std::make_unique<Held>(Held{core_, object});
    Py_INCREF(object);
    return std::shared_ptr<const void>(held.release(), [](const void* share) {
        auto* const returned = static_cast<Held*>(const_cast<void*>(share));
        // The list must not keep its own owner alive.
        const std::shared_ptr<Core> core = std::move(returned->core);
        core->giveBack(returned);
    });
}

void ReleaseQueue::drain() noexcept {
    for (Held* held = core_->takeAll(); held != nullptr;) {
        const std::unique_ptr<Held> done(std::exchange(held, held->next));
        Py_DECREF(done->object);
    }
}

int ReleaseQueue::descriptor() const noexcept {
    return core_->descriptor();
}

}  // namespace qvm
