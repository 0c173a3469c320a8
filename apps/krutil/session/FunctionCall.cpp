#include "krutil/session/FunctionCall.hpp"

#include <boost/make_shared.hpp>
#include <memory>
#include <utility>

#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "cmddistributor/IIPCancelMessage.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace krutil_client {
namespace {

using cmddistributor::FEvalIIP;
using foundation::korveldata::Array;
using krutil::cmddistributor::IIPReply;
using krutil::cmddistributor::inExecutionStatus;

// The engine that receives a call is the one that it is for; it has no other name here.
constexpr krutil::contextmgr::QvmID anyEngine = 1;

krutil::contextmgr::QvmID randomClientID() {
    krutil::contextmgr::QvmID id = 0;
    while (id == 0) {
        id = foundation::msg_svc::exchange::IDType::random().lo();
    }
    return id;
}

QuietAnswer answerOf(const IIPReply& reply, std::size_t outputs) {
    const auto& result = reply.getResult();
    if (!result) {
        return {};
    }
    if (const auto& error = result->getException()) {
        const inExecutionStatus status = error->getExecutionStatus();
        const bool raised =
            status == krutil::cmddistributor::inRUNTIME_ERROR || status == krutil::cmddistributor::inCOMPILE_ERROR;
        return {raised ? QuietAnswer::End::Failed : QuietAnswer::End::Late};
    }
    QuietAnswer answer{QuietAnswer::End::Returned, outputsOf(reply)};
    if (answer.outputs.size() != outputs) {
        answer.end = QuietAnswer::End::Failed;
    }
    return answer;
}

}  // namespace

boost::shared_ptr<const cmddistributor::IIP> requestOf(const Client& client, FunctionCall call,
                                                       const SinkOptions& options) {
    FEvalIIP::Arguments arguments = krutil::cmddistributor::EDIDataWrapper(std::move(call.arguments));
    return boost::make_shared<const FEvalIIP>("python", std::move(call.function), call.outputs,
                                              FEvalIIP::Data::makeClientSideData(std::move(arguments)),
                                              cmddistributor::IqmStreamID::ekIqmCmdWinStream, client.outTraits(options),
                                              client.errTraits(options), randomClientID(), anyEngine, true);
}

std::vector<Array> outputsOf(const IIPReply& reply) {
    const auto* const result = dynamic_cast<const cmddistributor::FEvalResult*>(reply.getResult().get());
    const auto* const arrays = result != nullptr ? boost::get<std::vector<Array>>(&result->getResults()) : nullptr;
    return arrays != nullptr ? *arrays : std::vector<Array>();
}

QuietAnswer callQuietly(Client& client, FunctionCall call, std::chrono::milliseconds patience) {
    const std::size_t outputs = call.outputs;
    const auto id = foundation::msg_svc::exchange::IDType::random();
    const auto message = Client::messageOf({.iip = requestOf(client, std::move(call), {}),
                                            .name = {},
                                            .when = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_PPE},
                                           id);
    Conversation& conversation = client.conversation();
    // Shared with the action, which may be called when nobody waits any more.
    const auto answer = std::make_shared<Conversation::Reply>();
    try {
        conversation.sendQuietly(message, [answer](const Conversation::Reply& reply) { *answer = reply; });
    } catch (const foundation::msg_svc::transport::layers::session::LimitExceeded&) {
        return {};
    }
    const auto cancel = [&conversation, &id] {
        conversation.send(boost::make_shared<const cmddistributor::IIPCancelMessage>(id, true),
                          [](const Conversation::Reply&) {});
    };
    try {
        if (!conversation.runUntil(Conversation::Clock::now() + patience, [&answer] { return *answer != nullptr; })) {
            cancel();
            return {};
        }
    } catch (const SessionOver&) {
        throw;
    } catch (...) {
        // What comes next must not wait for it.
        cancel();
        throw;
    }
    const auto reply = boost::dynamic_pointer_cast<const IIPReply>(*answer);
    if (!reply) {
        client.violated("the engine answered a request with something that is no answer to it");
    }
    return answerOf(*reply, outputs);
}

}  // namespace krutil_client
