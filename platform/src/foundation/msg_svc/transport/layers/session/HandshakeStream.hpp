// The byte stream of a handshake.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// The time limit of a handshake has passed.
class TimedOut : public StreamLost {
  public:
    using StreamLost::StreamLost;
};

/// Reads and writes both directions at once, within one time limit: each end sends its first message without waiting
/// for the other's, so neither may insist on writing before it reads. One thread; the descriptors are non-blocking and
/// stay the caller's.
class HandshakeStream {
  public:
    /// `recorder` is null for none.
    HandshakeStream(int in, int out, std::chrono::milliseconds timeout, SessionRecorder* recorder = nullptr);

    /// Has recorded what was received of a unit that did not come to its end.
    ~HandshakeStream() { endUnit(); }
    HandshakeStream(const HandshakeStream&) = delete;
    HandshakeStream& operator=(const HandshakeStream&) = delete;

    /// Hands the bytes of one unit over; they are written while receive() and flush() wait.
    void send(const std::string& bytes);

    /// The same with a descriptor that goes with the first of the bytes, over a Unix socket; -1 for none. It stays the
    /// caller's, and is needed until they are written. Throws StreamLost, as flush() does, which comes first.
    void sendWith(const std::string& bytes, int descriptor);

    /// Has `onReadable` called once when `descriptor`, which stays the caller's, becomes readable while something waits
    /// here; it may throw. Nothing is watched for -1.
    void watch(int descriptor, std::function<void()> onReadable);

    /// Writes these bytes, and what is unwritten before them, as far as the stream takes them at once.
    void sendNow(const std::string& bytes);

    /// Shortens what is left of the time limit to `patience`.
    void limitTo(std::chrono::milliseconds patience);

    /// Reads exactly `size` bytes to `target`. `check` gets the number that are there, each time some have come, and
    /// may throw; empty for none. `what` names the bytes in errors. Descriptors that come along are appended to
    /// `descriptors`, or dropped without it. Throws StreamLost for an end of the stream and an error, TimedOut for the
    /// time limit.
    void receive(char* target, std::size_t size, const std::string& what,
                 const std::function<void(std::size_t)>& check = nullptr,
                 std::vector<core::posix::OwnedDescriptor>* descriptors = nullptr);

    /// What was received since the last call is one unit of the stream, for the recorder.
    void endUnit();

    /// Takes what else is there already, for a message that shows it.
    std::string takeAvailable(std::size_t most);

    /// Returns when everything is written. Throws as receive() does.
    void flush();

  private:
    using Clock = std::chrono::steady_clock;

    void wait(bool reading, const std::string& progress);
    void keep(const char* bytes, std::size_t size);
    void writeSome();
    void throwIfUnwritable() const;

    int in_;
    int out_;
    std::chrono::milliseconds timeout_;
    Clock::time_point deadline_;
    std::string unsent_;
    int unsentDescriptor_ = -1;
    int watched_ = -1;
    std::function<void()> onReadable_;
    int writeError_ = 0;
    SessionRecorder* const recorder_;
    std::string received_;  ///< of the unit that is arriving, for the recorder
    bool heard_ = false;    ///< whether the peer has sent anything
};

}  // namespace foundation::msg_svc::transport::layers::session
