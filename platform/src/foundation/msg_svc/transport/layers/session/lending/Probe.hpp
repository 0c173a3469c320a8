// Whether memory can be shared over a stream.
#pragma once

#include "foundation/msg_svc/transport/layers/session/HandshakeStream.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

/// Sends the peer a descriptor of memory, looks at the one that it sends, and tells the result; both ends call this at
/// the same point of the handshake. True when each end has found in the memory what the other wrote into it. That the
/// stream is a Unix socket says nothing: it may lead to a relay, which passes the bytes only.
///
/// Throws as HandshakeStream does, and ProtocolViolation for an answer that is none.
bool probeSharedMemory(HandshakeStream& stream);

}  // namespace foundation::msg_svc::transport::layers::session::lending
