#include "foundation/msg_svc/transport/layers/session/IoThread.hpp"

#include <pthread.h>

#include <system_error>

#include "foundation/core/posix/SignalsBlocked.hpp"

namespace foundation::msg_svc::transport::layers::session {

void IoThread::start() {
    const core::posix::SignalsBlocked blocked;
    try {
        thread_ = std::thread([this] {
            ::pthread_setname_np(::pthread_self(), "session-io");
            io_.run();
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
