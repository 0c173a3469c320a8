#include "krutil/display/ErrorText.hpp"

#include "krutil/base/Text.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

std::string headline(const cmddistributor::RuntimeException& error) {
    const std::string message = msg_svc::protobuf::ustring_to_utf8(error.GetUnicodeMessageTxt());
    if (!error.GetID().empty() && !message.empty()) {
        return error.GetID() + ": " + message;
    }
    if (!error.GetID().empty() || !message.empty()) {
        return error.GetID() + message;
    }
    return "An error without a message (" + std::string(statusName(error.getExecutionStatus())) + ")";
}

void append(std::string& text, const cmddistributor::RuntimeException& error) {
    for (const auto& cause : error.getCauses()) {
        append(text, cause);
        text += "\nThe error above caused this one:\n\n";
    }
    for (const auto& frame : error.getStackFrames()) {
        text += "In \"" + msg_svc::protobuf::ustring_to_utf8(frame.file) + "\", line " + lineText(frame.line);
        if (!frame.func.empty()) {
            text += ", in " + frame.func;
        }
        text += '\n';
    }
    if (error.getStackFrames().empty() && !error.getFunctionName().empty()) {
        text += "In " + error.getFunctionName() + '\n';
    }
    text += headline(error);
    if (text.back() != '\n') {
        text += '\n';
    }
}

}  // namespace

std::string errorText(const cmddistributor::RuntimeException& error) {
    std::string text;
    append(text, error);
    return text;
}

}  // namespace krutil_client
