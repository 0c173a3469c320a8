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
