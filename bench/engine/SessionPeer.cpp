#include "engine/SessionPeer.hpp"

#include <unistd.h>

#include <boost/make_shared.hpp>
#include <boost/optional.hpp>
#include <cstdint>
#include <future>
#include <memory>
#include <utility>

#include "cmddistributor/IIPEnqueueMessage.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "common/KrutilSession.hpp"
#include "foundation/msg_svc/transport/layers/session/Session.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"

namespace bench {
namespace {

namespace session = foundation::msg_svc::transport::layers::session;
namespace exchange = foundation::msg_svc::exchange;
using foundation::msg_svc::eventmgr::BaseEvent;

class Answering : public session::SessionHandler {
  public:
    void onMessage(session::framing::StreamID stream,
                   const boost::shared_ptr<const exchange::Message>& message) override {
        const auto& id = dynamic_cast<const cmddistributor::IIPEnqueueMessage&>(*message).getID();
        session->send(
            stream,
            boost::shared_ptr<const exchange::Reply>(boost::make_shared<const krutil::cmddistributor::IIPReply>(
                id, std::make_unique<cmddistributor::IIPResult>(id, boost::none))),
            session::Session::Urgency::Answer);
    }
    void onGoodbye() override {
        session->send(
            0, boost::shared_ptr<const BaseEvent>(boost::make_shared<const krutil::eventmgr::QVMShutdownEvent>()),
            session::Session::Urgency::Answer);
        over.set_value();
    }
    void onEnd(const session::SessionEnd& /*end*/) override {}

    std::promise<void> over;
    std::unique_ptr<session::Session> session;
};

}  // namespace

void serveSession() {
    session::SessionConfig config = apps::krutilSession(session::Role::Engine);
    config.limits.taggedFrame = std::uint64_t{1} << 30;
    Answering answering;
    answering.session = session::Session::open(STDIN_FILENO, STDOUT_FILENO, std::move(config));
    answering.session->start(answering);
    answering.over.get_future().wait();
    answering.session->close();
}

}  // namespace bench
