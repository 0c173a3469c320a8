// Says to an engine what a client has said.
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include "krutil/base/Interrupt.hpp"
#include "krutil/replay/Talk.hpp"

namespace krutil_client {

/// What an engine said when a session was replayed.
struct Played {
    std::vector<Said> engine{};
    std::string end{};  ///< a sentence about how it ended; empty when the engine has closed its stream in good order
};

/// Shakes hands on `stream` as the recorded client did, but for shared memory, and says what that said. Each thing
/// waits until the engine has said what it had said before in the recording: state events, errors, warnings and replies
/// count, text does not, because its pieces are not the same each time. An engine may take `patience` longer for that
/// than in the recording; then what is next is said all the same. `begun` is called when the handshake is done. Owns
/// `stream`.
///
/// Throws Failure when the handshake fails, and Cancelled on Ctrl-C.
Played play(int stream, const Talk& talk, std::chrono::milliseconds handshakeTimeout,
            std::chrono::milliseconds patience, Interrupt& interrupt, const std::function<void()>& begun);

}  // namespace krutil_client
