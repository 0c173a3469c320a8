#include "krutil/base/Text.hpp"

#include <algorithm>
#include <array>
#include <climits>
#include <cmath>
#include <cstdio>
#include <cwchar>

#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {

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

std::string quotedText(std::string_view text, std::size_t longest) {
    // A character has at most four bytes of UTF-8 for one or two units.
    const std::u16string units =
        msg_svc::protobuf::utf8_to_ustring(std::string(text.substr(0, 4 * std::min(longest, text.size()) + 4)));
    std::u16string shown;
    std::size_t taken = 0;
    for (; taken < std::min(longest, units.size()); ++taken) {
        const char16_t unit = units[taken];
        const bool mark = unit == 0x200E || unit == 0x200F || (unit >= 0x2028 && unit <= 0x202E) ||
                          (unit >= 0x2066 && unit <= 0x2069);
        if (unit == u'\n') {
            shown += u"\\n";
        } else if (unit == u'"' || unit == u'\\') {
            shown += {u'\\', unit};
        } else if (unit < 0x20 || (unit >= 0x7F && unit < 0xA0) || mark) {
            std::array<char, 8> escape{};
            std::snprintf(escape.data(), escape.size(), unit > 0xFF ? "\\u%04x" : "\\x%02x", unsigned{unit});
            const std::string_view digits = escape.data();
            shown.append(digits.begin(), digits.end());
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
