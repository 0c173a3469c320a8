#include "krutil/display/WarningText.hpp"

#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {

std::string warningText(const korvel::lang::diagnostic::Warning& warning, bool stack) {
    using msg_svc::protobuf::ustring_to_utf8;
    std::string text = "Warning: " + ustring_to_utf8(warning.getMessage());
    if (!warning.getIdentifier().empty()) {
        text += " (" + warning.getIdentifier() + ")";
    }
    text += '\n';
    if (stack) {
        for (const auto& frame : warning.getStack()) {
            text += "  In \"" + ustring_to_utf8(frame.file) + "\", line " + std::to_string(frame.line);
            text += frame.name.empty() ? "\n" : ", in " + ustring_to_utf8(frame.name) + "\n";
        }
    }
    return text;
}

}  // namespace krutil_client
