// What a handler does with what it is not interested in.
#include "foundation/msg_svc/transport/layers/session/Session.hpp"

namespace foundation::msg_svc::transport::layers::session {

SessionHandler::~SessionHandler() = default;
void SessionHandler::onMessage(framing::StreamID, const boost::shared_ptr<const exchange::Message>&) {}
void SessionHandler::onReply(framing::StreamID, const boost::shared_ptr<const exchange::Reply>&) {}
void SessionHandler::onEvent(framing::StreamID, const boost::shared_ptr<const eventmgr::BaseEvent>&) {}
void SessionHandler::onGoodbye() {}

}  // namespace foundation::msg_svc::transport::layers::session
