// How two ends of a session get to know each other.
#pragma once

#include <memory>
#include <string>
#include <unordered_map>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/msg_svc/transport/layers/serialization/Registry.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// What both ends agreed upon.
struct Settlement {
    Peer peer;
    std::unordered_map<std::string, std::string> features;
    std::shared_ptr<const serialization::Registry> registry;
    std::string arrayTag;       ///< tag to which Limits::arrayMessage applies; empty for a protocol without arrays
    bool sharedMemory = false;  ///< array contents may stay in memory that both ends see
    bool keepAlive = false;     ///< the client sends signs of life, and the engine answers them
};

/// Exchanges hellos and verdicts over two non-blocking descriptors, which stay the caller's; reads not one byte more.
/// Returns when both ends accepted; throws as Session::open does.
Settlement shakeHands(int in, int out, const SessionConfig& config);

/// Sends a peer, over a new socket, a hello and a verdict that refuses the session with this
/// sentence. Neither reads nor waits.
void refuseUnheard(core::posix::OwnedDescriptor socket, const SessionConfig& config, const std::string& refusal);

}  // namespace foundation::msg_svc::transport::layers::session
