#include "RuntimeExceptionConversions.hpp"

#include "FieldConversions.hpp"

namespace krutil::protobuf_serializer {

protobuf::ExecutionStatus toProtobuf(cmddistributor::inExecutionStatus status) {
    return sameNumberOrTerminate<protobuf::ExecutionStatus>(
        status, protobuf::ExecutionStatus_IsValid,
        {"Unsupported cmddistributor::inExecutionStatus value", "RuntimeExceptionSerialization", 28,
         "krutil::protobuf::ExecutionStatus "
         "krutil::protobuf_serializer::toProtobuf(krutil::cmddistributor::inExecutionStatus)"});
}

cmddistributor::inExecutionStatus fromProtobuf(protobuf::ExecutionStatus status) {
    return sameNumberOrTerminate<cmddistributor::inExecutionStatus>(
        status, protobuf::ExecutionStatus_IsValid,
        {"Unsupported protobuf::ExecutionStatus value", "RuntimeExceptionSerialization", 47,
         "krutil::cmddistributor::inExecutionStatus "
         "krutil::protobuf_serializer::fromProtobuf(krutil::protobuf::ExecutionStatus)"});
}

void fill(const ::cmddistributor::StackFrame& frame, protobuf::StackFrame& proto) {
    proto.set_file(ustring_to_utf8(frame.file));
    proto.set_func(frame.func);
    proto.set_line(frame.line);
}

protobuf::StackFrame toProtobuf(const ::cmddistributor::StackFrame& frame) {
    protobuf::StackFrame proto;
    fill(frame, proto);
    return proto;
}

::cmddistributor::StackFrame fromProtobuf(const protobuf::StackFrame& proto) {
    return {utf8_to_ustring(proto.file()), proto.func(), proto.line()};
}

void fill(const ::cmddistributor::RuntimeException& exception, protobuf::RuntimeException& proto) {
    proto.set_status(toProtobuf(exception.getExecutionStatus()));
    proto.set_msgid(exception.GetID());
    proto.set_msgtext(ustring_to_utf8(exception.GetUnicodeMessageTxt()));
    proto.set_functionname(exception.getFunctionName());
    proto.clear_frames();
    for (const auto& frame : exception.getStackFrames()) {
        fill(frame, *proto.add_frames());
    }
    proto.clear_causes();
    for (const auto& cause : exception.getCauses()) {
        fill(cause, *proto.add_causes());
    }
}

protobuf::RuntimeException toProtobuf(const ::cmddistributor::RuntimeException& exception) {
    protobuf::RuntimeException proto;
    fill(exception, proto);
    return proto;
}

::cmddistributor::RuntimeException fromProtobuf(const protobuf::RuntimeException& proto) {
    // Room for what was parsed, so that what is built stays in proportion to what the peer really sent.
    std::vector<::cmddistributor::StackFrame> frames;
    frames.reserve(static_cast<std::size_t>(proto.frames_size()));
    for (const auto& frame : proto.frames()) {
        frames.push_back(fromProtobuf(frame));
    }
    std::vector<::cmddistributor::RuntimeException> causes;
    causes.reserve(static_cast<std::size_t>(proto.causes_size()));
    for (const auto& cause : proto.causes()) {
        causes.push_back(fromProtobuf(cause));
    }
    std::u16string text = utf8_to_ustring(proto.msgtext());
    const cmddistributor::inExecutionStatus status = fromProtobuf(proto.status());
    return ::cmddistributor::RuntimeException(status, std::move(text), proto.msgid(), proto.functionname(),
                                              std::move(frames), std::move(causes), false);
}

}  // namespace krutil::protobuf_serializer
