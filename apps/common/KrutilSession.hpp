// The protocol "krutil" as a session needs to be told about it.
#pragma once

#include "foundation/msg_svc/transport/layers/session/SessionConfig.hpp"

namespace apps {

/// The configuration of an end of this role: protocol and version, the shutdown event, the events that clients may
/// send, and what the process cannot do of the feature "ZEROCOPY". That is decided for the process by the environment
/// variable QX_DISABLE_ZEROCOPY, which is asked by the first call and, for what arrays do, by the first session that is
/// set up: whoever changes it does so before. Everything else is the caller's to fill in. Registers the protocol.
foundation::msg_svc::transport::layers::session::SessionConfig krutilSession(
    foundation::msg_svc::transport::layers::session::Role role);

}  // namespace apps
