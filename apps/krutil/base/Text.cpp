#include "krutil/base/Text.hpp"

#include <unicode/uchar.h>

#include <algorithm>
#include <array>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cwchar>

#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

std::string escapeOf(char32_t character, Escapes escapes) {
    std::array<char, 12> text{};
    const bool isShort = escapes == Escapes::Short && character <= 0xFF;
    std::snprintf(text.data(), text.size(), isShort ? "\\x%02x" : "\\u%04x", static_cast<unsigned>(character));
    return text.data();
}

}  // namespace

std::optional<std::size_t> firstInvalidUtf8(const std::string& text) {
    // Whatever is ill-formed comes back as a replacement character, which differs from it in its first byte or, where
    // the text is cut, in its length.
    const std::string back = msg_svc::protobuf::ustring_to_utf8(msg_svc::protobuf::utf8_to_ustring(text));
    if (back == text) {
        return std::nullopt;
    }
    return static_cast<std::size_t>(std::mismatch(text.begin(), text.end(), back.begin(), back.end()).first -
                                    text.begin());
}

std::string nameOfCode(const std::string& code) {
    constexpr std::size_t longest = 60;
    std::string name = code.substr(0, code.find('\n'));
    if (name.size() > longest) {
        name.resize(longest);
        while (firstInvalidUtf8(name)) {
            name.pop_back();
        }
        name += "...";
    }
    return name;
}

bool steersTerminal(char32_t character) {
    const auto code = static_cast<UChar32>(character);
    switch (u_charType(code)) {
        case U_CONTROL_CHAR:
        case U_LINE_SEPARATOR:
        case U_PARAGRAPH_SEPARATOR:
            return true;
        default:
            return u_hasBinaryProperty(code, UCHAR_BIDI_CONTROL) != 0;
    }
}

std::string safeText(const std::string& text, Escapes escapes) {
    // Most text is printable ASCII, which is left where it is.
    const auto plain = [](char c) { return (c >= ' ' && c <= '~') || c == '\n' || c == '\t'; };
    if (std::all_of(text.begin(), text.end(), plain)) {
        return text;
    }
    std::u16string safe;
    // All these characters are one unit.
    for (const char16_t unit : msg_svc::protobuf::utf8_to_ustring(text)) {
        if (steersTerminal(unit) && unit != u'\n' && unit != u'\t') {
            const std::string escape = escapeOf(unit, escapes);
            safe.append(escape.begin(), escape.end());
        } else {
            safe += unit;
        }
    }
    return msg_svc::protobuf::ustring_to_utf8(safe);
}

std::string quotedText(std::string_view text, std::size_t longest) {
    // A character has at most four bytes of UTF-8 for one or two units.
    const std::u16string units =
        msg_svc::protobuf::utf8_to_ustring(std::string(text.substr(0, 4 * std::min(longest, text.size()) + 4)));
    std::u16string shown;
    std::size_t taken = 0;
    for (; taken < std::min(longest, units.size()); ++taken) {
        const char16_t unit = units[taken];
        if (unit == u'\n') {
            shown += u"\\n";
        } else if (unit == u'"' || unit == u'\\') {
            shown += {u'\\', unit};
        } else if (steersTerminal(unit)) {
            const std::string escape = escapeOf(unit, Escapes::Short);
            shown.append(escape.begin(), escape.end());
        } else {
            shown += unit;
        }
    }
    // Half of a pair would become something else.
    if (taken < units.size() && taken > 0 && (units[taken - 1] & 0xFC00U) == 0xD800U) {
        shown.pop_back();
    }
    return "\"" + msg_svc::protobuf::ustring_to_utf8(shown) + (taken < units.size() ? "\"..." : "\"");
}

std::string toUtf8(std::wstring_view text) {
    std::mbstate_t state{};
    std::string result;
    std::array<char, MB_LEN_MAX> bytes{};
    for (const wchar_t c : text) {
        const auto length = std::wcrtomb(bytes.data(), c, &state);
        if (length == static_cast<std::size_t>(-1)) {
            result += "\uFFFD";
            state = {};
        } else {
            result.append(bytes.data(), length);
        }
    }
    return result;
}

std::wstring toWide(std::string_view text) {
    std::wstring result;
    while (!text.empty()) {
        std::mbstate_t state{};
        wchar_t c = L'\0';
        const auto length = std::mbrtowc(&c, text.data(), text.size(), &state);
        const bool valid = length <= text.size();
        result += valid ? c : L'\uFFFD';
        // A NUL has the length 0.
        text.remove_prefix(valid ? std::max<std::size_t>(length, 1) : 1);
    }
    return result;
}

std::string_view streamName(krutil::io::StreamTypeEnum stream) {
    switch (stream) {
        case krutil::io::StreamTypeEnum::OUTPUT_STREAM:
            return "output";
        case krutil::io::StreamTypeEnum::ERROR_STREAM:
            return "error";
        case krutil::io::StreamTypeEnum::GENERIC_STREAM:
            break;
    }
    return "generic";
}

std::string_view statusName(krutil::cmddistributor::inExecutionStatus status) {
    switch (status) {
        case krutil::cmddistributor::inEXECUTION_SUCCESS:
            return "success";
        case krutil::cmddistributor::inCOMPILE_ERROR:
            return "compile error";
        case krutil::cmddistributor::inRUNTIME_ERROR:
            return "runtime error";
        case krutil::cmddistributor::inEXECUTION_DBQUIT:
            return "debugger quit";
        case krutil::cmddistributor::inEXECUTION_CTRLC:
            return "cancelled";
        case krutil::cmddistributor::inCOMM_ERROR:
            break;
    }
    return "communication error";
}

std::string lineText(double line) {
    std::array<char, 32> text{};
    // 2^53: whole numbers up to here are exact.
    const bool whole = std::trunc(line) == line && std::abs(line) <= 9007199254740992.0;
    std::snprintf(text.data(), text.size(), whole ? "%.0f" : "%g", line);
    return text.data();
}

}  // namespace krutil_client
