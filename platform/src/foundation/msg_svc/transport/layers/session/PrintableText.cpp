#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"

#include <unicode/uchar.h>

#include "msg_svc/protobuf/ustring.hpp"

namespace foundation::msg_svc::transport::layers::session {

std::string quoted(std::string_view bytes, std::size_t longest) {
    static constexpr std::string_view hex = "0123456789abcdef";
    std::string text = "\"";
    for (const char byte : bytes.substr(0, longest)) {
        const auto value = static_cast<unsigned char>(byte);
        if (byte == '\n') {
            text += "\\n";
        } else if (byte == '"' || byte == '\\') {
            text += {'\\', byte};
        } else if (value < 0x20 || value > 0x7E) {
            text += {'\\', 'x', hex[value >> 4U], hex[value & 0xFU]};
        } else {
            text += byte;
        }
    }
    text += '"';
    return bytes.size() > longest ? text + "..." : text;
}

std::string sentence(const std::string& text, std::size_t longest) {
    const bool cut = text.size() > longest;
    std::u16string units = ::msg_svc::protobuf::utf8_to_ustring(cut ? text.substr(0, longest) : text);
    for (char16_t& unit : units) {
        const bool control = u_charType(unit) == U_CONTROL_CHAR && unit != u'\t' && unit != u'\n';
        unit = control || u_hasBinaryProperty(unit, UCHAR_BIDI_CONTROL) != 0 ? u'\uFFFD' : unit;
    }
    return ::msg_svc::protobuf::ustring_to_utf8(units) + (cut ? "..." : "");
}

std::string frameName(std::uint64_t index) {
    return "frame " + std::to_string(index);
}

}  // namespace foundation::msg_svc::transport::layers::session
