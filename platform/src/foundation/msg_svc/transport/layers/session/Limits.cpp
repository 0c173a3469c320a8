#include "foundation/msg_svc/transport/layers/session/Limits.hpp"

#include <algorithm>

#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace foundation::msg_svc::transport::layers::session {

Limits limitsFrom(const ::msg_svc::protobuf::SessionLimits& told) {
    Limits limits;
    limits.tag = std::min<std::uint64_t>(told.tag(), Limits::longestTag);
    limits.taggedFrame = told.taggedframe();
    limits.arrayMessage = told.arraymessage();
    limits.message = told.message();
    limits.frames = told.frames();
    // An end that does not know this limit has none.
    limits.parts = told.parts() != 0 ? told.parts() : WireWalk::anyParts;
    return limits;
}

}  // namespace foundation::msg_svc::transport::layers::session
