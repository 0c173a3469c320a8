#include "foundation/msg_svc/transport/layers/session/IoThread.hpp"

#include <pthread.h>

#include <new>
#include <system_error>
#include <utility>

#include "foundation/core/posix/SignalsBlocked.hpp"

namespace foundation::msg_svc::transport::layers::session {

// Whether everything is done.
bool IoThread::run() {
    try {
        io_.run();
        return true;
    } catch (const std::bad_alloc&) {
        return false;
    }
}

void IoThread::start(std::function<void()> onOutOfMemory) {
    const core::posix::SignalsBlocked blocked;
    try {
        thread_ = std::thread([this, outOfMemory = std::move(onOutOfMemory)] {
            ::pthread_setname_np(::pthread_self(), "session-io");
            while (!run()) {
                outOfMemory();
            }
        });
    } catch (const std::system_error& error) {
        throw std::system_error(error.code(), "The thread of a session cannot be started");
    }
}

void IoThread::join() {
    const std::lock_guard lock(joinMutex_);
    if (thread_.joinable()) {
        thread_.join();
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
