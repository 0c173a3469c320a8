// The least that two processes can do about bytes that go there and back: frames of a size, over a socket pair.
#pragma once

#include <cstddef>
#include <string>

#include "engine/Contest.hpp"
#include "krutil/session/EngineProcess.hpp"

namespace bench {

/// A process that answers frames with frames. Both ends use one buffer all the time. Single thread.
class RawPeer {
  public:
    RawPeer();

    /// Sends `there` bytes and waits until `back` bytes are back. The first 16 bytes of each are the frame's own, so 16
    /// are the least. What comes back is what was sent, as far as that goes.
    void roundTrip(const char* data, std::size_t there, std::size_t back) {
        send(data, there, back);
        receive(back);
    }

    /// The halves of a round trip, for those that have several under way.
    void send(const char* data, std::size_t there, std::size_t back);
    void receive(std::size_t back);

    /// What came back last.
    const std::string& received() const noexcept { return received_; }

  private:
    krutil_client::EngineProcess process_;
    std::string received_;
};

/// Framed round trips of that many bytes with a peer of their own.
Contender rawRoundTrips(std::size_t there, std::size_t back, const std::string& name = "raw");

/// The other end, on descriptors 0 and 1, until the stream ends.
void serveRaw();

/// The argument that makes a program the other end.
inline constexpr const char* rawPeerArgument = "--raw-peer";

}  // namespace bench
