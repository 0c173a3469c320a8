#include "apps/qvm/requests/ServedClient.hpp"

#include <fstream>
#include <iterator>

#include "cmddistributor/DebugLoopEvent.hpp"
#include "cmddistributor/IIPStateEvent.hpp"
#include "common/KrutilSession.hpp"
#include "korvel/lang/diagnostic/IssuedEnabledWarningEvent.hpp"
#include "korvel/lang/diagnostic/IssuedWarningEvent.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using apps::krutilSession;
using foundation::msg_svc::eventmgr::BaseEvent;
using foundation::msg_svc::exchange::IDType;
using foundation::msg_svc::exchange::Message;
using foundation::msg_svc::exchange::Reply;
using msg_svc::protobuf::ustring_to_utf8;
using testing_sessions::Role;
using testing_sessions::SessionConfig;

std::string textIn(const krutil::io::TextBase& text) {
    return std::to_string(static_cast<int>(text.getStreamType())) + " " + ustring_to_utf8(text.getText());
}

std::string partsOf(const korvel::lang::diagnostic::Warning& warning) {
    return warning.getIdentifier() + " | " + ustring_to_utf8(warning.getFormat()) + " | " +
           ustring_to_utf8(warning.getMessage()) + " | " + std::to_string(warning.getArguments().size()) +
           " arguments, " + std::to_string(warning.getStack().size()) + " frames";
}

std::string describe(const BaseEvent& event) {
    if (const auto* const state = dynamic_cast<const cmddistributor::IIPStateEvent*>(&event)) {
        return state->getType();
    }
    if (const auto* const loop = dynamic_cast<const cmddistributor::DebugLoopEvent*>(&event)) {
        return (loop->getLoopState() == cmddistributor::DebugLoopEvent::ENTER ? "enter " : "exit ") +
               std::to_string(static_cast<int>(loop->getWhichDebugLoop()));
    }
    if (const auto* const shown = dynamic_cast<const krutil::io::SinkTextEvent*>(&event)) {
        return "shown " + textIn(*shown);
    }
    if (const auto* const text = dynamic_cast<const krutil::io::TextBaseEvent*>(&event)) {
        return "text " + textIn(*text);
    }
    if (const auto* const enabled = dynamic_cast<const korvel::lang::diagnostic::IssuedEnabledWarningEvent*>(&event)) {
        return "enabled warning " + partsOf(enabled->getWarning());
    }
    if (const auto* const warning = dynamic_cast<const korvel::lang::diagnostic::IssuedWarningEvent*>(&event)) {
        return "warning " + partsOf(warning->getWarning());
    }
    return "shutdown";
}

SessionConfig configOf(Role role, const foundation::msg_svc::transport::layers::session::Limits& limits) {
    SessionConfig config = krutilSession(role);
    config.limits = limits;
    return config;
}

std::string contentOf(const std::string& path) {
    std::ifstream file(path);
    return {std::istreambuf_iterator<char>(file), {}};
}

}  // namespace

void ServedClient::Client::onReply(qvm::framing::StreamID stream, const boost::shared_ptr<const Reply>& reply) {
    const auto& typed = dynamic_cast<const krutil::cmddistributor::IIPReply&>(*reply);
    EXPECT_EQ(typed.getID(), IDType(0, stream));
    EXPECT_EQ(typed.getResult()->id, IDType(0, stream));
    std::string line = std::to_string(stream) + " reply";
    if (const auto& error = typed.getResult()->getException()) {
        line +=
            " " + std::to_string(error->getExecutionStatus()) + " " + ustring_to_utf8(error->GetUnicodeMessageTxt());
    }
    keep(line);
}

void ServedClient::Client::onEvent(qvm::framing::StreamID stream, const boost::shared_ptr<const BaseEvent>& event) {
    if (const auto* const ofRequest = dynamic_cast<const cmddistributor::RequestIdAdapter*>(event.get())) {
        EXPECT_EQ(ofRequest->getRequestId(), IDType(0, stream));
    }
    keep(std::to_string(stream) + " " + describe(*event));
}

void ServedClient::Engine::onMessage(qvm::framing::StreamID stream,
                                     const boost::shared_ptr<const Message>& /*message*/) {
    keep(std::to_string(stream) + " arrived");
}

ServedClient::ServedClient(const foundation::msg_svc::transport::layers::session::Limits& limits)
    : opened_(testing_sessions::openPair(configOf(Role::Client, limits), configOf(Role::Engine, {}))),
      announcer_(*opened_.engine, diary_, log_, timer_) {
    opened_.engine->start(engineSaw_);
    opened_.client->start(clientSaw_);
}

qvm::Request ServedClient::send(const RequestParts& parts) {
    qvm::Request request = makeRequest(parts);
    const std::size_t before = engineSaw_.lines().size();
    opened_.client->send(request.stream, request.message);
    engineSaw_.waitForLines(before + 1);
    return request;
}

std::vector<std::string> ServedClient::received() {
    announcer_.shutDown();
    opened_.engine->close();
    EXPECT_EQ(clientSaw_.waitForEnd().reason, testing_sessions::Reason::Finished);
    std::vector<std::string> lines = clientSaw_.lines();
    EXPECT_GE(lines.size(), 2U);
    EXPECT_EQ(lines.back(), "end: finished");
    lines.pop_back();
    EXPECT_EQ(lines.back(), "0 shutdown");
    lines.pop_back();
    return lines;
}

std::string ServedClient::diary() const {
    return contentOf(files_.file("diary"));
}

std::string ServedClient::log() const {
    return contentOf(files_.file("log"));
}

}  // namespace qvm_test
