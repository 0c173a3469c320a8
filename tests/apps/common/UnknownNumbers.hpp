// The four messages that hold numbers which the protocol's conversions end a process for when they do not know them:
// streams of texts (0 to 2) and statuses of errors (0 to 5). Each function returns a message's bytes.
#pragma once

#include <string>

#include "krutil.protobuf.FEvalResult.pb.h"
#include "krutil.protobuf.IIPResult.pb.h"
#include "krutil.protobuf.PrintableErrorEvent.pb.h"
#include "krutil.protobuf.SinkTextEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"

namespace apps_test {

/// A value of a generated enumeration, which may be none of its named ones.
template <class EnumT>
EnumT number(int value) {
    return static_cast<EnumT>(value);
}

/// A text event for a stream.
template <class TextT>
std::string textEvent(int stream) {
    TextT message;
    message.mutable_id();
    message.set_stream(number<krutil::protobuf::StreamType>(stream));
    message.set_text("some text");
    return message.SerializeAsString();
}

/// An error whose innermost cause, so many levels down, has the status.
inline krutil::protobuf::RuntimeException error(int depth, int status) {
    krutil::protobuf::RuntimeException exception;
    exception.set_status(number<krutil::protobuf::ExecutionStatus>(depth == 0 ? status : 2));
    exception.set_msgtext("text");
    if (depth > 0) {
        exception.add_causes()->set_status(number<krutil::protobuf::ExecutionStatus>(1));
        *exception.add_causes() = error(depth - 1, status);
    }
    return exception;
}

/// Messages with such an error: a result, a function's result, an error to print.
inline std::string result(int depth, int status) {
    krutil::protobuf::IIPResult message;
    message.mutable_id();
    *message.mutable_exception() = error(depth, status);
    return message.SerializeAsString();
}

inline std::string callResult(int depth, int status) {
    krutil::protobuf::FEvalResult message;
    message.mutable_iipresult()->mutable_id();
    *message.mutable_iipresult()->mutable_exception() = error(depth, status);
    return message.SerializeAsString();
}

inline std::string printableError(int depth, int status) {
    krutil::protobuf::PrintableErrorEvent message;
    message.mutable_id();
    *message.mutable_except() = error(depth, status);
    message.set_text("text");
    return message.SerializeAsString();
}

/// What is said to a text event for a stream that is none.
inline std::string refusalOfStream(const std::string& tag, int stream) {
    return "frame \"" + tag + "\", byte 2, field stream: expected a stream from 0 to 2, got " + std::to_string(stream);
}

/// What is said to a message with such an error, which stands in the field `path` of it.
inline std::string refusalOfStatus(const std::string& tag, const std::string& path, const std::string& message,
                                   int depth, int status) {
    const std::string causes = depth == 0   ? ""
                               : depth == 1 ? ".causes"
                                            : ".causes (" + std::to_string(depth) + " times)";
    return "frame \"" + tag + "\", byte " + std::to_string(message.rfind(error(0, status).SerializeAsString())) +
           ", field " + path + causes + ".status: expected a status from 0 to 5, got " + std::to_string(status);
}

}  // namespace apps_test
