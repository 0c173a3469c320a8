// What a refusal of the order of a session says: to the program that wanted to send, and about a peer that has sent;
// and what a stream says that refuses.
#pragma once

#include <string>
#include <string_view>
#include <typeinfo>

#include "foundation/msg_svc/transport/layers/session/Exchanges.hpp"

namespace foundation::msg_svc::transport::layers::session {

/// For the end that is `own` and wanted to say something on a stream. `type` is that of an event.
std::string refusalToSend(Refusal refusal, Saying saying, Role own, framing::StreamID stream,
                          const std::type_info& type);

/// For the end that is `own` and got a message with this root, or a goodbye (of which tag and stream do not count).
std::string refusalToReceive(Refusal refusal, Saying saying, Role own, framing::StreamID stream, std::string_view tag);

/// Of a stream that cannot be written to, with this errno.
std::string cannotWrite(int error);

}  // namespace foundation::msg_svc::transport::layers::session
