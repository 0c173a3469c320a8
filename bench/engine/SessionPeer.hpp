// The other end of a session without an interpreter: it answers each request at once, so what is left is the session.
#pragma once

namespace bench {

/// On descriptors 0 and 1, until the session ends.
void serveSession();

/// The argument that makes a program the other end.
inline constexpr const char* sessionPeerArgument = "--session-peer";

}  // namespace bench
