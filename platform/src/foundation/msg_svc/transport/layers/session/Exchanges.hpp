// Who may say what, and when: the order of a session.
//
// An end asks one object before it sends and for all that it receives, so that what a sender may do and what its peer
// must refuse are one rule. Not synchronised: no threads, no descriptors, no bytes.
#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <typeindex>
#include <unordered_set>

#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// How far a session has come. Each end says one last thing: a client its goodbye, an engine its shutdown event.
enum class Phase { Talking, ClientDone, EngineDone, BothDone };

/// What an end can say.
enum class Saying {
    Message,      ///< begins an exchange
    Reply,        ///< ends an exchange
    Event,        ///< belongs to an exchange or to none; said by engines
    SharedEvent,  ///< an event that clients say as well
    Shutdown,     ///< the event that is an engine's last message
    Goodbye,      ///< a client's last word
};

/// What an event of this type is in a session with this protocol.
Saying sayingOfEvent(std::type_index event, const SessionConfig& config);

/// Why something may not be said.
enum class Refusal {
    WrongSpeaker,        ///< an end of this role never says it
    AfterGoodbye,        ///< the client has said its last word
    AfterShutdown,       ///< the engine has said its last word
    StreamNotNew,        ///< expected a stream ID that is not 0 and that no open exchange has
    StreamNotOpen,       ///< expected the stream ID of an open exchange
    StreamNotZero,       ///< expected the stream ID 0
    StreamNotZeroOrOpen  ///< expected the stream ID 0 or that of an open exchange
};

/// The phase of a session, and its open exchanges as one end knows them.
class Exchanges {
  public:
    explicit Exchanges(Role own) noexcept : own_(own) {}

    /// Whether this end may say something now; if so, it counts as said. The stream ID of a goodbye is not looked at.
    std::optional<Refusal> send(Saying saying, framing::StreamID stream) { return say(own_, saying, stream); }

    /// Whether the peer may have said something; if so, it counts as said.
    std::optional<Refusal> receive(Saying saying, framing::StreamID stream) { return say(peer(), saying, stream); }

    /// Whether the end of this role may say something now, as this end sees it; if so, it counts as said.
    std::optional<Refusal> say(Role speaker, Saying saying, framing::StreamID stream);

    /// AfterGoodbye or AfterShutdown when the end of this role has said its last word.
    std::optional<Refusal> sayAnything(Role speaker) const noexcept;

    /// The same for the peer.
    std::optional<Refusal> receiveAnything() const noexcept { return sayAnything(peer()); }

    Phase phase() const noexcept { return phase_; }

    /// Whether the end of this role has said its last word.
    bool isDone(Role role) const noexcept;

    /// A stream ID that is not 0 and that no open exchange has; each call returns another one.
    framing::StreamID newStreamID() noexcept;

  private:
    Role peer() const noexcept { return own_ == Role::Client ? Role::Engine : Role::Client; }

    Role own_;
    Phase phase_ = Phase::Talking;
    std::unordered_set<framing::StreamID> open_;
    framing::StreamID lastStream_ = 0;
};

/// Exchanges that several threads use. Whoever sends holds the mutex until its message has its place on the way out:
/// the order in which things were said is then the order on the wire.
struct SharedExchanges {
    explicit SharedExchanges(Role own) noexcept : exchanges(own) {}

    mutable std::mutex mutex;
    Exchanges exchanges;
};

}  // namespace foundation::msg_svc::transport::layers::session
