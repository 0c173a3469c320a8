#include "krutil/inspect/Summary.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>

#include <algorithm>
#include <array>
#include <limits>
#include <string_view>

#include "common/MessageNames.hpp"
#include "krutil.protobuf.DebugLoopEvent.pb.h"
#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.FEvalIIP.pb.h"
#include "krutil.protobuf.FEvalResult.pb.h"
#include "krutil.protobuf.IIPCancelReply.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.IssuedEnabledWarningEvent.pb.h"
#include "krutil.protobuf.PrintableErrorEvent.pb.h"
#include "krutil.protobuf.SinkTextEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"
#include "krutil/base/Text.hpp"
#include "msg_svc.protobuf.SessionHandshake.pb.h"

namespace krutil_client {
namespace {

namespace proto = krutil::protobuf;
namespace handshake = msg_svc::protobuf;

constexpr std::size_t shownUnits = 60;

std::string shown(std::string_view text) {
    return quotedText(text, shownUnits);
}

// Bytes in front of the message of a part of the handshake.
std::size_t headOf(apps::RecordedUnit::Kind kind) {
    return kind == apps::RecordedUnit::Kind::FirstMessage ? 16 : 4;
}

template <class Message>
Message parsed(const InspectedFrame& frame, std::size_t head = 0) {
    Message message;
    const std::string_view bytes = frame.bytes().substr(std::min(head, frame.bytes().size()));
    message.ParsePartialFromArray(
        bytes.data(), static_cast<int>(std::min<std::size_t>(bytes.size(), std::numeric_limits<int>::max())));
    return message;
}

std::string recordedError(const proto::RuntimeException& error) {
    return "error " + shown(error.msgid()) + ": " + shown(error.msgtext());
}

std::string resultText(const proto::IIPResult& result) {
    return result.has_exception() && result.exception().status() != proto::inEXECUTION_SUCCESS
               ? recordedError(result.exception())
               : "ok";
}

std::string enqueued(const InspectedMessage& message) {
    const auto root = parsed<proto::IIPEnqueueMessage>(message.root());
    const InspectedFrame* const request = message.frame(root.iiphandle());
    if (request == nullptr) {
        return {};
    }
    const std::string type = request->type();
    if (type == "EvalIIP") {
        return "eval " + shown(parsed<proto::EvalIIP>(*request).cmd());
    }
    if (type == "FEvalIIP") {
        const auto call = parsed<proto::FEvalIIP>(*request);
        return "call " + shown(call.functionname()) + ", " + std::to_string(call.dataids_size()) + " arguments, " +
               std::to_string(call.nlhs()) + " outputs";
    }
    return {};
}

std::string replied(const InspectedMessage& message) {
    const InspectedFrame* const result = message.frame(parsed<proto::IIPReply>(message.root()).resultid());
    if (result == nullptr) {
        return "no result";
    }
    if (result->type() == "FEvalResult") {
        const auto outputs = parsed<proto::FEvalResult>(*result);
        return resultText(outputs.iipresult()) + ", " + std::to_string(outputs.dataids_size()) + " outputs";
    }
    return resultText(parsed<proto::IIPResult>(*result));
}

template <class Event>
std::string textEvent(const InspectedMessage& message) {
    const auto event = parsed<Event>(message.root());
    const int stream = event.stream();
    return (stream == 0 ? "output " : stream == 1 ? "error " : "generic ") + shown(event.text());
}

std::string nameOr(const std::string& name, int number) {
    return name.empty() ? std::to_string(number) : name;
}

std::string loop(const InspectedMessage& message) {
    const auto event = parsed<proto::DebugLoopEvent>(message.root());
    return nameOr(proto::DebugLoopEvent_State_Name(event.state()), event.state()) + " " +
           nameOr(proto::InputRequester_Name(event.whichloop()), event.whichloop());
}

std::string cancelReplied(const InspectedMessage& message) {
    const int status = parsed<proto::IIPCancelReply>(message.root()).status();
    return nameOr(proto::CancelStatus_Name(static_cast<proto::CancelStatus>(status)), status);
}

std::string warned(const InspectedMessage& message) {
    return shown(parsed<proto::IssuedWarningEvent>(message.root()).warning().message());
}

std::string warnedVisibly(const InspectedMessage& message) {
    return shown(parsed<proto::IssuedEnabledWarningEvent>(message.root()).warningevent().warning().message());
}

std::string failed(const InspectedMessage& message) {
    return shown(parsed<proto::PrintableErrorEvent>(message.root()).text());
}

std::string handshakeText(const InspectedMessage& message) {
    switch (message.first().kind) {
        case apps::RecordedUnit::Kind::FirstMessage:
            return shown(parsed<handshake::SessionHello>(message.root(), 16).build());
        case apps::RecordedUnit::Kind::Verdict: {
            const auto verdict = parsed<handshake::SessionVerdict>(message.root(), 4);
            return verdict.accepted() ? "accepted" : "refused " + shown(verdict.refusal());
        }
        case apps::RecordedUnit::Kind::Answer:
            return message.root().bytes() == "\x01" ? "descriptors arrive" : "no descriptors";
        default:
            return {};
    }
}

struct Row {
    std::string_view type;
    std::string (*text)(const InspectedMessage&);
};

constexpr std::array rows{
    Row{"IIPEnqueueMessage", enqueued},
    Row{"IIPReply", replied},
    Row{"IIPCancelReply", cancelReplied},
    Row{"TextBaseEvent", textEvent<proto::TextBaseEvent>},
    Row{"SinkTextEvent", textEvent<proto::SinkTextEvent>},
    Row{"PrintableErrorEvent", failed},
    Row{"IssuedWarningEvent", warned},
    Row{"IssuedEnabledWarningEvent", warnedVisibly},
    Row{"DebugLoopEvent", loop},
};

}  // namespace

std::string summaryOf(const InspectedMessage& message) {
    if (message.isHandshake()) {
        return handshakeText(message);
    }
    if (message.root().header.is(FrameKind::Abort)) {
        return shown(message.root().bytes());
    }
    const std::string type = message.type();
    const auto* const row = std::find_if(rows.begin(), rows.end(), [&](const Row& each) { return each.type == type; });
    return row == rows.end() || !message.complete ? std::string() : row->text(message);
}

std::string printableName(std::string_view name) {
    std::string text(name);
    std::replace_if(
        text.begin(), text.end(), [](char c) { return c < ' ' || c > '~'; }, '?');
    return text;
}

std::unique_ptr<google::protobuf::Message> messageIn(const InspectedFrame& frame) {
    using Kind = apps::RecordedUnit::Kind;
    const Kind kind = frame.unit.kind;
    const std::string name = kind == Kind::FirstMessage ? "msg_svc.protobuf.SessionHello"
                             : kind == Kind::Verdict    ? "msg_svc.protobuf.SessionVerdict"
                                                        : apps::messageNameOfTag(frame.tag);
    const auto* const descriptor = google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(name);
    if (descriptor == nullptr) {
        return nullptr;
    }
    std::unique_ptr<google::protobuf::Message> message(
        google::protobuf::MessageFactory::generated_factory()->GetPrototype(descriptor)->New());
    std::string_view bytes = frame.bytes();
    if (kind != Kind::Frame) {
        bytes.remove_prefix(std::min(headOf(kind), bytes.size()));
    }
    message->ParsePartialFromArray(
        bytes.data(), static_cast<int>(std::min<std::size_t>(bytes.size(), std::numeric_limits<int>::max())));
    return message;
}

}  // namespace krutil_client
