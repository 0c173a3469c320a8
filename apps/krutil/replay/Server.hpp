// Says to a client what an engine has said.
#pragma once

#include <chrono>
#include <functional>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/replay/Talk.hpp"

namespace krutil_client {

/// How a session with a client went.
struct Served {
    bool differs = false;  ///< something was reported
    bool gone = false;     ///< the client has closed its stream where the recording has a message
};

/// Shakes hands with the client at the other end of `in` and `out` as the recorded engine did, but for shared memory
/// and signs of life, and says what that said. Each thing waits until the client has said what it had said before in
/// the recording. A client may take `patience` longer for that than in the recording. Streams and identifiers of
/// requests are the client's own. `report` gets a sentence for each difference as soon as it is found, and one that
/// counts them before the client is told of the end: it may end this process then. The session ends with a message that
/// is of another type than in the recording, or does not come.
///
/// Throws Failure when the handshake fails or the client sends what is no frame, and Cancelled on Ctrl-C.
Served serve(foundation::core::posix::OwnedDescriptor in, foundation::core::posix::OwnedDescriptor out,
             const Talk& talk, std::chrono::milliseconds handshakeTimeout, std::chrono::milliseconds patience,
             Interrupt& interrupt, const std::function<void(const std::string&)>& report);

}  // namespace krutil_client
