// One protocol session over one byte stream, between a client and an engine.
//
// A session owns a pair of descriptors and one I/O thread, which reads, rebuilds what arrives, hands it to a handler
// and writes what could not be written at once. The thread never waits for a write: a peer that does not read holds up
// its own output, never a cancel on its way in. docs/session-wire.md describes the bytes.
#pragma once

#include <boost/shared_ptr.hpp>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// How far the bytes of a session have come.
struct Traffic {
    std::uint64_t written = 0;   ///< bytes that the stream has taken since the handshake
    std::uint64_t arriving = 0;  ///< content of the frame that is arriving, in bytes; 0 between frames
    std::uint64_t arrived = 0;   ///< how much of that is there
};

/// Why a session is over.
struct SessionEnd {
    /// What has ended it.
    enum class Reason {
        Finished,   ///< both ends were done: the engine's shutdown event was the last message
        Lost,       ///< the byte stream ended or failed early, or there was no memory for what had to be done
        Violation,  ///< this end refused what the peer sent, or the peer refused what this end sent
        Closed,     ///< close() was called here
    };
    Reason reason;     ///< what has ended it
    std::string text;  ///< a sentence for a person; empty for Finished and Closed
};

/// Receives what arrives. All calls come from the session's I/O thread, one at a time; they must not block, and must
/// not destroy the session. An exception that leaves one closes the session as a violation with its text;
/// with std::bad_alloc the session is lost.
class SessionHandler {
  public:
    virtual ~SessionHandler();

    /// The peer begins an exchange (engines only); the reply is to be sent on the same stream.
    virtual void onMessage(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message);

    /// The answer to an exchange that this end began (clients only).
    virtual void onReply(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply);

    /// An event of an open exchange, or of none when `stream` is 0.
    virtual void onEvent(framing::StreamID stream, const boost::shared_ptr<const eventmgr::BaseEvent>& event);

    /// The client has said goodbye (engines only): it will send nothing more and expects the shutdown event.
    virtual void onGoodbye();

    /// The session is over; the last call, made exactly once for a session that was started.
    virtual void onEnd(const SessionEnd& end) = 0;
};

/// See the head of this file. Members may be called from any thread unless they say otherwise.
class Session {
  public:
    /// Performs the handshake and returns a session that is settled but not yet reading. Takes ownership of both
    /// descriptors (which may be equal) in every case, sets them non-blocking and close-on-exec. Blocks up to the
    /// handshake timeout. Where SIGPIPE has its default handling it is ignored from now on, in the whole process: a
    /// peer that is gone must not end it.
    ///
    /// Throws HandshakeRefused, ProtocolViolation (the peer does not speak this layout), StreamLost (closed or timed
    /// out), std::out_of_range (unknown protocol name here), std::system_error (the process may have no more threads).
    static std::unique_ptr<Session> open(int in, int out, SessionConfig config);

    /// Tells the peer at the other end of a new socket that there is no session for it, with this sentence. The peer's
    /// open() throws HandshakeRefused with that. Takes ownership of the descriptor and closes it; neither reads nor
    /// waits. Throws std::out_of_range (unknown protocol name here).
    static void refuse(int socket, const SessionConfig& config, const std::string& refusal);

    /// Closes at once what is still open, and joins the I/O thread. Must not run on the I/O thread.
    ~Session();
    Session(const Session&) = delete;
    Session& operator=(const Session&) = delete;

    /// What the handshake told about the other end. Valid as long as the session.
    const Peer& peer() const noexcept;

    /// The settled features, name to value.
    const std::unordered_map<std::string, std::string>& features() const noexcept;

    /// The serializers of the settled version.
    const std::shared_ptr<const serialization::Registry>& registry() const noexcept;

    /// Starts the I/O thread. Call once. `handler` must outlive the session.
    void start(SessionHandler& handler);

    /// A stream ID for a new exchange: not 0 and not in use.
    framing::StreamID newStreamID();

    /// What a message is to the sender.
    enum class Urgency {
        Output,  ///< the sender applies back-pressure with waitForRoom() or waitUntilWritten()
        Held,    ///< output that may wait for what follows, so that both leave in one write
        Answer,  ///< posted by the handler, which must not wait; see SessionConfig::maxPendingAnswers
    };

    /// Bytes of held messages with which these are written.
    static constexpr std::size_t heldBytes = 16'384;

    /// Serializes an object and hands it to the stream: written at once as far as the stream takes it, the rest by the
    /// I/O thread. Never blocks. Order on the wire is the order of the calls. After the session's end these do nothing.
    ///
    /// Throws LimitExceeded (the session goes on, nothing was sent), whatever the serializer throws (nothing was sent
    /// either), and std::bad_alloc (the same; or the session is lost, if it was said already). A message of a new
    /// exchange needs a stream ID from newStreamID(); an event needs an open exchange's ID or 0; a reply closes its
    /// exchange.
    void send(framing::StreamID stream, const boost::shared_ptr<const exchange::Message>& message);
    /// The same for a reply (engines only).
    void send(framing::StreamID stream, const boost::shared_ptr<const exchange::Reply>& reply,
              Urgency urgency = Urgency::Output);
    /// The same for an event.
    void send(framing::StreamID stream, const boost::shared_ptr<const eventmgr::BaseEvent>& event,
              Urgency urgency = Urgency::Output);

    /// Writes what was sent with Urgency::Held, as far as the stream takes it. The same happens with the next message
    /// that is not held, when heldBytes are held, and before a wait for the stream. Whoever sends held messages calls
    /// this when nothing follows soon.
    void sendHeld();

    /// Waits until no more than roomBytes are unwritten, the session is over, or `interrupt` (a descriptor, -1 for
    /// none) becomes readable; returns false in the last case only. Returns at once, without a system call, when there
    /// is room. Whoever causes output waits here before it sends, and holds no lock meanwhile: then what is unwritten
    /// exceeds roomBytes by one message of each thread at most. Not from the I/O thread.
    bool waitForRoom(int interrupt = -1);

    /// The same until everything that was handed over before the call is written, whatever is sent meanwhile.
    bool waitUntilWritten(int interrupt = -1);

    /// How far the bytes have come, for a display. What is written and what arrives are not of exactly one moment.
    Traffic traffic() const;

    /// Tells the engine that nothing more will be sent (clients only). Replies and events still arrive.
    void sayGoodbye();

    /// Writes what is unwritten, waiting at most `patience` for a peer that does not read, then closes the stream.
    /// onEnd() has been called when this returns. Not from the I/O thread.
    void close(std::chrono::milliseconds patience = std::chrono::milliseconds(2'000));

    /// Closes the session with a violation, telling the peer `text`. From any thread.
    void abort(const std::string& text);

    /// For a forked child: closes this process's copies of the session's descriptors and turns the object inert. Calls
    /// only close(2), so it may run in a pthread_atfork child handler.
    void abandonInChild() noexcept;

  private:
    class Impl;
    explicit Session(std::unique_ptr<Impl> impl);
    std::unique_ptr<Impl> impl_;
};

}  // namespace foundation::msg_svc::transport::layers::session
