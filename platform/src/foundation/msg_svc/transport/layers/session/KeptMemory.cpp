#include "foundation/msg_svc/transport/layers/session/KeptMemory.hpp"

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::msg_svc::transport::layers::session {

using vantor::carrier::framing::BufferAllocator;

void KeptMemory::watch() {
    if (watching_ || BufferAllocator::largeBytes() == 0) {
        return;
    }
    watching_ = true;
    timer_.expires_after(keep_);
    timer_.async_wait([this](const ErrorCode& error) {
        if (error) {
            return;
        }
        BufferAllocator::trim(keep_);
        watching_ = false;
        // What is in use now will be kept, and perhaps no message follows.
        watch();
    });
}

void KeptMemory::stop() {
    watching_ = true;
    timer_.cancel();
}

}  // namespace foundation::msg_svc::transport::layers::session
