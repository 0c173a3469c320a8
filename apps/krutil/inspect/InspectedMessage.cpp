#include "krutil/inspect/InspectedMessage.hpp"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <utility>

#include "krutil.protobuf.IIPCancelMessage.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"

namespace krutil_client {
namespace {

namespace proto = krutil::protobuf;
using UnitKind = apps::RecordedUnit::Kind;

// In the content of a frame that says where its bytes are: the third number is how many.
constexpr std::size_t sharedContentSize = 24;

InspectedFrame frameOf(apps::RecordedUnit unit) {
    InspectedFrame frame;
    if (unit.kind == UnitKind::Frame && unit.bytes.size() >= FrameHeader::size) {
        frame.header = apps::headerOf(unit.bytes);
        frame.content = frame.header.contentSize;
        const std::string_view behind = std::string_view(unit.bytes).substr(FrameHeader::size);
        if (frame.header.is(FrameKind::Tagged)) {
            frame.tag = behind.substr(0, frame.header.tagSize);
        } else if (frame.header.is(FrameKind::SharedData) && behind.size() >= sharedContentSize) {
            frame.content = apps::littleEndian(behind.substr(16, 8));
        }
    }
    frame.unit = std::move(unit);
    return frame;
}

std::string hexOf(const msg_svc::protobuf::IDType& id) {
    std::array<char, 33> text{};
    std::snprintf(text.data(), text.size(), "%016llx%016llx", static_cast<unsigned long long>(id.hi()),
                  static_cast<unsigned long long>(id.lo()));
    return text.data();
}

template <class Message>
std::string requestIn(const InspectedFrame& frame) {
    Message message;
    message.ParsePartialFromArray(frame.bytes().data(), static_cast<int>(frame.bytes().size()));
    return message.has_iipid() ? hexOf(message.iipid()) : std::string();
}

std::string handshakeName(UnitKind kind) {
    switch (kind) {
        case UnitKind::FirstMessage:
            return "hello";
        case UnitKind::Verdict:
            return "verdict";
        case UnitKind::Token:
            return "token";
        case UnitKind::Answer:
            return "answer";
        case UnitKind::Frame:
            break;
    }
    return {};
}

}  // namespace

std::string_view InspectedFrame::bytes() const noexcept {
    if (unit.kind != UnitKind::Frame) {
        return unit.bytes;
    }
    const std::uint64_t shared = header.is(FrameKind::SharedData) ? sharedContentSize : 0;
    const std::uint64_t before = FrameHeader::size + header.tagSize + shared;
    return before < unit.bytes.size() ? std::string_view(unit.bytes).substr(before) : std::string_view();
}

std::string InspectedFrame::type() const {
    if (unit.kind != UnitKind::Frame) {
        return handshakeName(unit.kind);
    }
    switch (static_cast<FrameKind>(header.kind)) {
        case FrameKind::Tagged:
            return tag.substr(tag.rfind(':') + 1);
        case FrameKind::Data:
            return "data";
        case FrameKind::Goodbye:
            return "goodbye";
        case FrameKind::Abort:
            return "abort";
        case FrameKind::SharedData:
            return "shared data";
        case FrameKind::Return:
            return "return";
        case FrameKind::KeepAlive:
            return "keep-alive";
    }
    return "kind " + std::to_string(header.kind);
}

std::uint64_t InspectedMessage::size() const noexcept {
    std::uint64_t sum = 0;
    for (const InspectedFrame& frame : frames) {
        sum += frame.unit.size;
    }
    return sum;
}

void MessageAssembler::findRequest(InspectedMessage& message, Session& session) const {
    const InspectedFrame& root = message.root();
    const std::uint32_t stream = root.header.stream;
    if (message.isHandshake() || stream == 0) {
        return;
    }
    const std::string type = root.type();
    const bool enqueues = type == "IIPEnqueueMessage";
    if (enqueues || type == "IIPCancelMessage") {
        session.requests[stream] =
            enqueues ? requestIn<proto::IIPEnqueueMessage>(root) : requestIn<proto::IIPCancelMessage>(root);
    }
    const auto found = session.requests.find(stream);
    if (found == session.requests.end()) {
        return;
    }
    message.request = found->second;
    if (type == "IIPReply" || type == "IIPCancelReply") {
        session.requests.erase(found);
    }
}

std::optional<InspectedMessage> MessageAssembler::take(apps::RecordedUnit unit) {
    sessions_.resize(std::max(sessions_.size(), unit.session + 1));
    Session& session = sessions_[unit.session];
    auto& begun = session.begun[unit.sender == apps::RecordedUnit::Role::Client ? 0 : 1];
    InspectedFrame frame = frameOf(std::move(unit));
    const bool data = frame.header.is(FrameKind::Data) || frame.header.is(FrameKind::SharedData);
    if (data && !keepData_ && frame.unit.bytes.size() > FrameHeader::size) {
        frame.unit.bytes = frame.unit.bytes.substr(0, FrameHeader::size);
    }
    InspectedMessage message;
    if (frame.unit.kind == UnitKind::Frame && (data || frame.header.is(FrameKind::Tagged))) {
        const bool last = frame.header.last;
        begun.push_back(std::move(frame));
        if (!last) {
            return std::nullopt;
        }
        message.frames = std::exchange(begun, {});
    } else {
        message.frames.push_back(std::move(frame));
    }
    findRequest(message, session);
    return message;
}

std::vector<InspectedMessage> MessageAssembler::rest() {
    std::vector<InspectedMessage> messages;
    for (Session& session : sessions_) {
        for (auto& begun : session.begun) {
            if (!begun.empty()) {
                messages.push_back({std::exchange(begun, {}), {}, false});
            }
        }
    }
    return messages;
}

}  // namespace krutil_client
