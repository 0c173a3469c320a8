// Any bytes of a peer, from the first one of its handshake to the end of its stream: an end settles or says why not,
// and a session that is settled ends with a reason. The first byte of the input chooses the role.

#include <sys/socket.h>

#include <chrono>
#include <cstdint>

#include "input/Require.hpp"
#include "input/SessionEnds.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // More may not fit into the socket, and nobody reads while it is written.
    if (size == 0 || size > 65'536) {
        return 0;
    }
    fuzz::SocketPair sockets;
    fuzz::require(::send(sockets.far.get(), data + 1, size - 1, MSG_NOSIGNAL) == static_cast<ssize_t>(size - 1),
                  "a socket takes the input");
    ::shutdown(sockets.far.get(), SHUT_WR);
    fuzz::Witness witness;
    const int near = sockets.near.release();
    try {
        const auto role = (*data & 1U) == 0 ? fuzz::session::Role::Client : fuzz::session::Role::Engine;
        const auto session = fuzz::session::Session::open(near, near, fuzz::configOf(role));
        session->start(witness);
        witness.waitForLastWord();
        session->close(std::chrono::milliseconds(0));
        witness.waitForEnd();
    } catch (const fuzz::session::SessionError&) {
    }
    return 0;
}
