#include "apps/qvm/bytes/ByteClient.hpp"

#include <utility>

#include "krutil.protobuf.IIPCancelMessage.pb.h"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "platform/session/support/WireBytes.hpp"

namespace qvm_test {
namespace {

bool isReply(const std::string& tag) {
    return tag == "krutil:IIPReply" || tag == "krutil:IIPCancelReply";
}

}  // namespace

std::string Received::tag() const {
    return frames.empty() ? std::string() : frames.back().kind == 4 ? "abort" : frames.back().tag;
}

ByteClient::ByteClient() : end_(connection_, connection_) {
    end_.shakeHands();
}

Received ByteClient::read() {
    Received message;
    for (;;) {
        const std::string header = end_.read(24);
        if (header.size() < 24) {
            return {};
        }
        ReceivedFrame frame;
        const auto kind = static_cast<unsigned>(wire::number(header, 0, 1));
        frame.kind = kind & 0x7FU;
        frame.tag = end_.read(wire::number(header, 2, 2));
        frame.content = end_.read(wire::number(header, 16, 8));
        message.stream = static_cast<std::uint32_t>(wire::number(header, 4, 4));
        message.frames.push_back(std::move(frame));
        if ((kind & 0x80U) != 0 || message.frames.back().kind == 4) {
            break;
        }
    }
    if (message.tag() == "krutil:TextBaseEvent") {
        text_ += message.as<krutil::protobuf::TextBaseEvent>(1).text();
    }
    return message;
}

Received ByteClient::awaitReply(std::uint32_t stream) {
    for (;;) {
        if (const auto kept = replies_.extract(stream)) {
            return kept.mapped();
        }
        Received message = read();
        if (message.frames.empty() || message.tag() == "abort") {
            return message;
        }
        if (isReply(message.tag())) {
            replies_[message.stream] = std::move(message);
        }
    }
}

Received ByteClient::awaitTag(const std::string& tag) {
    for (;;) {
        Received message = read();
        if (message.frames.empty() || message.tag() == "abort" || message.tag() == tag) {
            return message;
        }
    }
}

krutil::protobuf::IIP requestCore() {
    krutil::protobuf::IIP core;
    core.set_plugintype("any");
    core.mutable_outtraits();
    core.mutable_errtraits();
    return core;
}

krutil::protobuf::IIPEnqueueMessage enqueueing(std::uint64_t request, std::uint64_t id) {
    krutil::protobuf::IIPEnqueueMessage enqueue;
    enqueue.set_iiphandle(request);
    enqueue.mutable_iipid()->set_lo(id);
    enqueue.set_dequeuemode(krutil::protobuf::DEQUEUE_AT_IDLE);
    return enqueue;
}

std::string requestBytes(std::uint32_t stream, const std::string& before, std::uint64_t index, const std::string& tag,
                         const std::string& content, const krutil::protobuf::IIPEnqueueMessage& enqueue) {
    return before + wire::tagged(stream, index, false, tag, content) +
           wire::tagged(stream, index + 1, true, "krutil:IIPEnqueueMessage", enqueue.SerializeAsString(), 27);
}

std::string evaluation(std::uint32_t stream, const std::string& code,
                       const krutil::protobuf::IIPEnqueueMessage& enqueue) {
    krutil::protobuf::EvalIIP request;
    *request.mutable_iip() = requestCore();
    request.set_cmd(code);
    return requestBytes(stream, {}, 1, "krutil:EvalIIP", request.SerializeAsString(), enqueue);
}

std::string cancel(std::uint32_t stream, std::uint64_t id, bool evenIfRunning) {
    krutil::protobuf::IIPCancelMessage message;
    message.mutable_iipid()->set_lo(id);
    message.set_evenifrunning(evenIfRunning);
    return wire::tagged(stream, 1, true, "krutil:IIPCancelMessage", message.SerializeAsString(), 27);
}

krutil::protobuf::RuntimeException errorOf(const Received& reply) {
    const auto root = reply.as<krutil::protobuf::IIPReply>(reply.frames.size());
    return reply.as<krutil::protobuf::IIPResult>(root.resultid()).exception();
}

}  // namespace qvm_test
