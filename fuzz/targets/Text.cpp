// Any bytes as UTF-8 and as UTF-16: both conversions agree with those of the Unicode library's own string class.

#include <unicode/unistr.h>

#include <cstdint>
#include <cstring>
#include <string>

#include "input/Require.hpp"
#include "msg_svc/protobuf/ustring.hpp"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string utf8(data, data + size);
    const std::u16string fromUtf8 = msg_svc::protobuf::utf8_to_ustring(utf8);
    const icu::UnicodeString expected = icu::UnicodeString::fromUTF8(utf8);
    fuzz::require(fromUtf8 == std::u16string_view(expected.getBuffer(), static_cast<std::size_t>(expected.length())),
                  "UTF-8 is decoded as the Unicode library does");

    std::u16string utf16(size / 2, u'\0');
    std::memcpy(utf16.data(), data, utf16.size() * 2);
    std::string converted;
    icu::UnicodeString(utf16.data(), static_cast<std::int32_t>(utf16.size())).toUTF8String(converted);
    fuzz::require(msg_svc::protobuf::ustring_to_utf8(utf16) == converted,
                  "UTF-16 is encoded as the Unicode library does");
    // What is well formed comes back.
    fuzz::require(msg_svc::protobuf::utf8_to_ustring(msg_svc::protobuf::ustring_to_utf8(fromUtf8)) == fromUtf8,
                  "text comes back");
    return 0;
}
