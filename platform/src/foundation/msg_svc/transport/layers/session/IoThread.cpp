#include "foundation/msg_svc/transport/layers/session/IoThread.hpp"

#include <pthread.h>

#include "foundation/core/posix/SignalsBlocked.hpp"

namespace foundation::msg_svc::transport::layers::session {

void IoThread::start() {
    std::call_once(started_, [this] {
        const core::posix::SignalsBlocked blocked;
        thread_ = std::thread([this] {
            ::pthread_setname_np(::pthread_self(), "session-io");
            io_.run();
        });
    });
}

void IoThread::join() {
    const std::lock_guard lock(joinMutex_);
    if (thread_.joinable()) {
        thread_.join();
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
