// Whether a message fits what the peer accepts.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "foundation/msg_svc/transport/layers/session/Limits.hpp"
#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session {

namespace framing = ::foundation::vantor::carrier::framing;

/// Refuses a message before anything of it is sent that the peer would close the session for. Immutable; any thread.
class PeerLimits {
  public:
    /// `peerName` is the peer's in a sentence ("the engine"); `arrayTag` the tag to which Limits::arrayMessage applies,
    /// empty for none. `walk` counts parts; null when they are not to be counted.
    PeerLimits(const Limits& limits, std::string peerName, std::string arrayTag, std::shared_ptr<const WireWalk> walk);

    /// Throws LimitExceeded, which names the limit. The last frame must be a tagged one.
    void check(const std::vector<std::unique_ptr<framing::Frame>>& frames) const;

  private:
    Limits limits_;
    std::string peerName_;
    std::string arrayTag_;
    std::shared_ptr<const WireWalk> walk_;
};

}  // namespace foundation::msg_svc::transport::layers::session
