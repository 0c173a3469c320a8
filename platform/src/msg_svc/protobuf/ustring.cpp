#include "msg_svc/protobuf/ustring.hpp"

#include <unicode/ustring.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <limits>
#include <stdexcept>

namespace msg_svc::protobuf {
namespace {

constexpr UChar32 replacement = 0xFFFD;

std::int32_t checkedLength(std::size_t length, const char* where) {
    if (length > static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max())) {
        throw std::length_error(std::string(where) + ": expected at most 2147483647 code units, got " +
                                std::to_string(length));
    }
    return static_cast<std::int32_t>(length);
}

// Length of the leading run of ASCII, a multiple of the step but for the last units.
std::size_t asciiPrefix(const char16_t* text, std::size_t length) {
    std::size_t i = 0;
    for (; i + 16 <= length; i += 16) {
        char16_t any = 0;
        for (std::size_t j = 0; j < 16; ++j) {
            any = static_cast<char16_t>(any | text[i + j]);
        }
        if (any > 0x7F) {
            break;
        }
    }
    while (i < length && text[i] <= 0x7F) {
        ++i;
    }
    return i;
}

std::size_t asciiPrefix(const char* text, std::size_t length) {
    std::size_t i = 0;
    for (; i + 8 <= length; i += 8) {
        std::uint64_t word = 0;
        std::memcpy(&word, text + i, sizeof word);
        if ((word & 0x8080808080808080ULL) != 0) {
            break;
        }
    }
    while (i < length && static_cast<signed char>(text[i]) >= 0) {
        ++i;
    }
    return i;
}

}  // namespace

std::string ustring_to_utf8(const std::basic_string<char16_t>& text) {
    checkedLength(text.size(), "ustring_to_utf8");
    const std::size_t ascii = asciiPrefix(text.data(), text.size());
    std::string utf8(ascii, '\0');
    std::transform(text.begin(), text.begin() + static_cast<std::ptrdiff_t>(ascii), utf8.begin(),
                   [](char16_t unit) { return static_cast<char>(unit); });
    if (ascii == text.size()) {
        return utf8;
    }
    const char16_t* rest = text.data() + ascii;
    const auto restLength = static_cast<std::int32_t>(text.size() - ascii);
    std::int32_t needed = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strToUTF8WithSub(nullptr, 0, &needed, rest, restLength, replacement, nullptr, &status);
    if (needed < 0 || status == U_INDEX_OUTOFBOUNDS_ERROR) {
        throw std::length_error("ustring_to_utf8: the UTF-8 text is longer than 2147483647 bytes");
    }
    utf8.resize(ascii + static_cast<std::size_t>(needed));
    status = U_ZERO_ERROR;
    u_strToUTF8WithSub(utf8.data() + ascii, needed, nullptr, rest, restLength, replacement, nullptr, &status);
    return utf8;
}

std::basic_string<char16_t> utf8_to_ustring(const std::string& utf8) {
    checkedLength(utf8.size(), "utf8_to_ustring");
    const std::size_t ascii = asciiPrefix(utf8.data(), utf8.size());
    // UTF-16 never has more units than UTF-8 has bytes, so one allocation serves both steps.
    std::u16string text(utf8.size(), u'\0');
    std::transform(utf8.begin(), utf8.begin() + static_cast<std::ptrdiff_t>(ascii), text.begin(),
                   [](char byte) { return static_cast<char16_t>(byte); });
    if (ascii == utf8.size()) {
        return text;
    }
    const auto restLength = static_cast<std::int32_t>(utf8.size() - ascii);
    std::int32_t units = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strFromUTF8WithSub(text.data() + ascii, restLength, &units, utf8.data() + ascii, restLength, replacement, nullptr,
                         &status);
    text.resize(ascii + static_cast<std::size_t>(units));
    return text;
}

}  // namespace msg_svc::protobuf
