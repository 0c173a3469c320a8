// Which frame of a received message was asked for last.
#pragma once

namespace foundation::msg_svc::transport::layers::message {

/// A note that Message takes whenever somebody asks it for a frame. With it, a failure to read can be explained by the
/// frame that it was about, though what serializers throw does not tell. Each thread has its own note, because a
/// message is read by one thread.
struct LastAsked {
    unsigned long index = 0;     ///< what frame() or release() was given last
    bool found = false;          ///< a frame was there
    unsigned long released = 0;  ///< the frame that was taken out last; 0 for none
};

/// The calling thread's note. Whoever wants to read it later clears it before.
LastAsked& lastAsked() noexcept;

}  // namespace foundation::msg_svc::transport::layers::message
