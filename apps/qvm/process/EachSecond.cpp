#include "qvm/process/EachSecond.hpp"

#include <time.h>

#include <cerrno>
#include <mutex>
#include <thread>
#include <utility>

#include "foundation/core/posix/SignalsBlocked.hpp"

namespace qvm {

// Outlives the object, because nothing can wake the thread.
struct EachSecond::Shared {
    std::mutex mutex;
    std::function<void()> call;

    // Returns false when nothing is to be called any more.
    bool callOnce() {
        const std::lock_guard lock(mutex);
        if (call) {
            call();
        }
        return call != nullptr;
    }
};

EachSecond::EachSecond(std::function<void()> call) : shared_(std::make_shared<Shared>()) {
    shared_->call = std::move(call);
    const foundation::core::posix::SignalsBlocked blocked;
    std::thread([shared = shared_] {
        int error = 0;
        do {
            const timespec second{1, 0};
            error = ::clock_nanosleep(CLOCK_MONOTONIC, 0, &second, nullptr);
        } while ((error == 0 || error == EINTR) && shared->callOnce());
    }).detach();
}

EachSecond::~EachSecond() {
    const std::lock_guard lock(shared_->mutex);
    shared_->call = nullptr;
}

}  // namespace qvm
