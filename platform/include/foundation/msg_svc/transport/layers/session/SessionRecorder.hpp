// What sees the bytes of a session.
#pragma once

#include <sys/uio.h>

#include <span>

namespace foundation::msg_svc::transport::layers::session {

/// Is given each unit of a session's stream: a first message, a verdict, the parts of the probe, and each frame.
/// docs/recording.md says what a unit is, and in which order they come.
class SessionRecorder {
  public:
    /// Seen from the end that records.
    enum class Direction { Received, Sent };
    /// What a unit is: a part of the handshake, the probe included, or a frame.
    enum class Part { Handshake, Frame };

    /// The pieces of a unit lie one behind the other on the stream. They are valid during the call. A content in shared
    /// memory follows as the last piece. What is sent is recorded when it is handed over, before it is written; what is
    /// received before it is acted on.
    ///
    /// Called from all threads that use the session, several at a time, while the session holds locks: so it must not
    /// call the session.
    virtual void record(Direction direction, Part part, std::span<const iovec> unit) noexcept = 0;

  protected:
    ~SessionRecorder() = default;
};

}  // namespace foundation::msg_svc::transport::layers::session
