#include "foundation/msg_svc/transport/layers/session/KeepAlive.hpp"

#include <mutex>
#include <vector>

namespace foundation::msg_svc::transport::layers::session {

void KeepAlive::start() {
    if (!settled_ || role_ != Role::Client) {
        return;
    }
    timer_.expires_after(interval_);
    timer_.async_wait([this](const ErrorCode& error) {
        if (error || !outgoing_.isOpen()) {
            return;
        }
        // While something waits to be written the stream is not idle, or the peer does not read.
        if (outgoing_.isDrained()) {
            send(false);
        }
        start();
    });
}

void KeepAlive::answer() {
    if (role_ == Role::Engine) {
        // Like every answer it counts against those that the peer may leave unread.
        send(true);
    }
}

void KeepAlive::send(bool answer) {
    // Dropped when the lock is released.
    std::vector<OutgoingPieces> done;
    const std::lock_guard lock(exchanges_.mutex);
    // Nothing follows an engine's last event.
    if (outgoing_.isOpen() && !(role_ == Role::Engine && exchanges_.exchanges.isDone(Role::Engine))) {
        done = outgoing_.push(OutgoingPieces(FrameKind::KeepAlive, {}, answer));
    }
}

}  // namespace foundation::msg_svc::transport::layers::session
