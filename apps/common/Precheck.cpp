#include "common/Precheck.hpp"

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>

#include <limits>
#include <map>
#include <string>
#include <string_view>

#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"
#include "krutil.protobuf.FEvalResult.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.PrintableErrorEvent.pb.h"
#include "krutil.protobuf.SinkTextEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"

namespace apps {
namespace {

using foundation::msg_svc::transport::layers::session::ProtocolViolation;
using foundation::vantor::carrier::framing::TaggedFrame;
namespace proto = krutil::protobuf;

[[noreturn]] void refuse(const TaggedFrame& frame, const char* field, int value, const char* expected) {
    throw ProtocolViolation("frame \"" + std::string(frame.tag()) + "\": expected " + field + " from " + expected +
                            ", got " + std::to_string(value));
}

// The same steps as the serializers', so that both see the same fields of content that does not parse.
template <class ProtoMessage>
ProtoMessage parse(const TaggedFrame& frame) {
    ProtoMessage message;
    const auto most = static_cast<unsigned long>(std::numeric_limits<int>::max());
    if (frame.size() <= most) {
        google::protobuf::io::ArrayInputStream array(frame.data(), static_cast<int>(frame.size()), -1);
        google::protobuf::io::CodedInputStream coded(&array);
        coded.SetTotalBytesLimit(std::numeric_limits<int>::max());
        static_cast<void>(message.ParseFromCodedStream(&coded));
    }
    return message;
}

template <class ProtoMessage>
void checkText(const TaggedFrame& frame) {
    const auto stream = parse<ProtoMessage>(frame).stream();
    if (!proto::StreamType_IsValid(stream)) {
        refuse(frame, "a stream", stream, "0 to 2");
    }
}

// As deep as the parser went, which has a limit.
void checkStatus(const TaggedFrame& frame, const proto::RuntimeException& exception) {
    if (!proto::ExecutionStatus_IsValid(exception.status())) {
        refuse(frame, "a status", exception.status(), "0 to 5");
    }
    for (const auto& cause : exception.causes()) {
        checkStatus(frame, cause);
    }
}

void checkResult(const TaggedFrame& frame) {
    checkStatus(frame, parse<proto::IIPResult>(frame).exception());
}

void checkCallResult(const TaggedFrame& frame) {
    checkStatus(frame, parse<proto::FEvalResult>(frame).iipresult().exception());
}

void checkPrintableError(const TaggedFrame& frame) {
    checkStatus(frame, parse<proto::PrintableErrorEvent>(frame).except());
}

const std::map<std::string_view, void (*)(const TaggedFrame&)>& checks() {
    static const std::map<std::string_view, void (*)(const TaggedFrame&)> byTag{
        {"krutil:TextBaseEvent", checkText<proto::TextBaseEvent>},
        {"krutil:SinkTextEvent", checkText<proto::SinkTextEvent>},
        {"krutil:IIPResult", checkResult},
        {"krutil:FEvalResult", checkCallResult},
        {"krutil:PrintableErrorEvent", checkPrintableError},
    };
    return byTag;
}

}  // namespace

void precheck(const TaggedFrame& frame) {
    if (const auto found = checks().find(frame.tag()); found != checks().end()) {
        found->second(frame);
    }
}

}  // namespace apps
