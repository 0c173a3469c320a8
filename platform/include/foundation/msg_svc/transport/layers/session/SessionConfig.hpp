// What an end of a session is told before it begins, and what it learns about the other end.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <typeindex>
#include <vector>

#include "capabilities/CapabilityList.hpp"
#include "foundation/msg_svc/transport/layers/session/Limits.hpp"
#include "foundation/msg_svc/transport/layers/session/ProtocolRegistry.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"
#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// Which end of the session this is. A client begins exchanges; an engine answers them and raises events.
enum class Role { Client, Engine };

/// One frame on its way, as a trace sees it. Valid during the call only.
struct FrameTrace {
    bool outgoing;                ///< sent by this end; else received
    bool last;                    ///< the last frame of its message
    const framing::Frame& frame;  ///< a TaggedFrame or a DataFrame, content included
};

/// A value of one of the protocol's features that this process cannot work with, though the protocol lists it.
struct UnusableFeature {
    std::string name;   ///< name of the feature
    std::string value;  ///< the value of it

    /// Whether the value is offered to the peer all the same. A session that settles on it is refused.
    bool offered = false;

    /// Why, for the refusal. With `offered` it completes "... is all that both ends accept, but the client (has it
    /// switched off)", without it begins "(IT_IS_OFF is set) for the client, so it does not accept ...".
    std::string reason;

    bool operator==(const UnusableFeature&) const = default;  ///< the same in every part
};

/// Somebody else than the two ends who has a say in whether there is a session: whoever counts those of several
/// processes, for example.
struct Admission {
    /// Why there is to be no session, as a sentence for the peer; empty when there may be one. Called before this end
    /// accepts a peer that fits, and may wait then. Called once before that, too, when `word` becomes readable.
    std::function<std::string()> refusal;

    /// Watched while Session::open() waits for the peer; -1 for nothing to watch. Stays the caller's.
    int word = -1;
};

/// How this end presents itself, what it accepts, and what a session needs to know about its protocol. Both ends of a
/// session are given the same `shutdownEvent` and `clientEvents`.
struct SessionConfig {
    Role role = Role::Client;       ///< which end this is
    std::string protocol;           ///< looked up in the ProtocolRegistry
    ProtocolVersion version{0, 0};  ///< the version that this end speaks
    std::string build;              ///< free text that names this program and its version to the peer

    /// The event that is the last message of an engine. Without one a client takes every end of its stream for a loss.
    std::optional<std::type_index> shutdownEvent;

    /// The events that a client may send as well. All others come from engines only.
    std::vector<std::type_index> clientEvents;

    /// What this process cannot do of what the protocol lists, decided before any session.
    std::vector<UnusableFeature> unusableFeatures;

    /// What this end accepts; the peer is told.
    Limits limits;
    /// What this end can do; the peer is told.
    ::capabilities::CapabilityList capabilities;
    /// How long Session::open() waits for the peer at most.
    std::chrono::milliseconds handshakeTimeout{10'000};
    /// Who is asked besides; without a function nobody is.
    Admission admission;

    /// Lets contents of data frames of 1 MiB and more stay in memory that both ends see, where the peer wants that too,
    /// the stream is a Unix socket and descriptors reach the peer. Code may write to such a content as to any other.
    bool sharedMemory = false;

    /// How often a client sends a sign of life, where the engine knows such frames and nothing else waits to be
    /// written; the engine answers each. So no proxy in between takes the stream for idle. 0 for never.
    std::chrono::milliseconds keepAlive{0};

    /// Bytes of unwritten output above which waitForRoom() waits.
    std::size_t roomBytes = 1U << 20;

    /// Messages posted with Urgency::Answer that may be waiting to be written, 1 or more. When so many wait, the peer
    /// asks without reading, and nothing more is read from it until it has read some.
    std::size_t maxPendingAnswers = 1024;

    /// How long memory of large arrays is kept for others while this process does not use it; see BufferAllocator. It
    /// is given back within twice that time after its last use.
    std::chrono::milliseconds keepMemory{10'000};

    /// Called with every frame, on the thread that sends or receives it. Empty for no trace.
    std::function<void(const FrameTrace&)> trace;

    /// Is given the bytes of the session, from the handshake to the end. Must outlive the session; null for none.
    SessionRecorder* recorder = nullptr;

    /// Looks at the content of each received tagged frame before its serializer does; what it refuses closes the
    /// session. It counts the parts of what is sent, too, where the peer has a limit of them. Null for neither.
    std::shared_ptr<const WireWalk> check;
};

/// What the handshake told about the other end.
struct Peer {
    std::string build;                            ///< what the peer says about its program and version
    Limits limits;                                ///< what the peer accepts
    ::capabilities::CapabilityList capabilities;  ///< what the peer can do
};

}  // namespace foundation::msg_svc::transport::layers::session
