// What people use instead of a session for bytes that go there and back, set up as their users would: a server in a
// process of its own, a Unix socket, the library's ordinary calls and settings. Only limits that are too low are
// raised.
#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "engine/Contest.hpp"

namespace bench {

/// One library.
struct RoundTripPeer {
    std::string name;

    /// Serves a Unix socket at `path` until the process is killed; calls `ready` when clients may connect.
    std::function<void(const std::string& path, const std::function<void()>& ready)> serve;

    /// Round trips with the server at `path`.
    std::function<Contender(const std::string& path, std::size_t there, std::size_t back)> connect;
};

RoundTripPeer zeroMq();
RoundTripPeer capnProto();
RoundTripPeer grpc();

#ifdef KRUTIL_BENCH_PEERS

/// Round trips with each of them, as framed ones: `there` bytes, and `back` bytes in return.
std::vector<Contender> peerRoundTrips(std::size_t there, std::size_t back);

/// Serves, if that is what the arguments of this program ask for.
bool servedPeer(int argc, char** argv);

#else

inline std::vector<Contender> peerRoundTrips(std::size_t /*there*/, std::size_t /*back*/) {
    return {};
}
inline bool servedPeer(int /*argc*/, char** /*argv*/) {
    return false;
}

#endif

}  // namespace bench
