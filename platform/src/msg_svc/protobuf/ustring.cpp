#include "msg_svc/protobuf/ustring.hpp"

#include <unicode/ustring.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <limits>
#include <stdexcept>

namespace msg_svc::protobuf {
namespace {

constexpr UChar32 replacement = 0xFFFD;

void checkLength(std::size_t length, const char* where) {
    if (length > static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max())) {
        throw std::length_error(std::string(where) + ": expected at most 2147483647 code units, got " +
                                std::to_string(length));
    }
}

// ASCII is most of what travels. It is looked for and converted in blocks of constant size, which compilers turn into
// vector instructions without being asked for more than -O2.
constexpr std::size_t block = 16;

// Length of a leading run of code units without the bits of `beyondAscii`, which is repeated through a word: of the
// whole text, or else of whole blocks.
template <class Unit>
std::size_t asciiPrefix(const Unit* text, std::size_t length, std::uint64_t beyondAscii) {
    std::array<std::uint64_t, block * sizeof(Unit) / sizeof(std::uint64_t)> words;
    std::size_t i = 0;
    for (; i + block <= length; i += block) {
        std::memcpy(words.data(), text + i, sizeof words);
        std::uint64_t any = 0;
        for (const std::uint64_t word : words) {
            any |= word;
        }
        if ((any & beyondAscii) != 0) {
            return i;
        }
    }
    while (i < length && static_cast<char16_t>(text[i]) <= 0x7F) {
        ++i;
    }
    return i;
}

std::size_t asciiPrefix(const std::u16string& text) {
    return asciiPrefix(text.data(), text.size(), 0xFF80FF80FF80FF80ULL);
}

std::size_t asciiPrefix(const std::string& text) {
    return asciiPrefix(text.data(), text.size(), 0x8080808080808080ULL);
}

// Text of up to this many code units or bytes is converted on the stack, so that its string is made once and with its
// exact size.
constexpr std::size_t shortText = 256;

// Code units of longer text that are converted at a time where there are others than ASCII.
constexpr std::size_t piece = 1U << 16;

// Copies `length` code units that are ASCII.
template <class From, class To>
void convertAscii(const From* from, std::size_t length, To* to) {
    std::array<From, block> in;
    std::array<To, block> out;
    std::size_t i = 0;
    for (; i + block <= length; i += block) {
        std::memcpy(in.data(), from + i, sizeof in);
        for (std::size_t j = 0; j < block; ++j) {
            out[j] = static_cast<To>(in[j]);
        }
        std::memcpy(to + i, out.data(), sizeof out);
    }
    for (; i < length; ++i) {
        to[i] = static_cast<To>(from[i]);
    }
}

// Converts into `utf8`, which has room for three bytes for each code unit; returns how many it wrote.
std::size_t convertByIcu(const char16_t* text, std::size_t length, char* utf8) {
    std::int32_t bytes = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strToUTF8WithSub(utf8, static_cast<std::int32_t>(3 * length), &bytes, text, static_cast<std::int32_t>(length),
                       replacement, nullptr, &status);
    return static_cast<std::size_t>(bytes);
}

// Converts into `text`, which has room for a code unit for each byte; returns how many it wrote.
std::size_t convertByIcu(const char* utf8, std::size_t length, char16_t* text) {
    std::int32_t units = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strFromUTF8WithSub(text, static_cast<std::int32_t>(length), &units, utf8, static_cast<std::int32_t>(length),
                         replacement, nullptr, &status);
    return static_cast<std::size_t>(units);
}

}  // namespace

std::string ustring_to_utf8(const std::basic_string<char16_t>& text) {
    checkLength(text.size(), "ustring_to_utf8");
    const std::size_t ascii = asciiPrefix(text);
    if (ascii == text.size()) {
        std::string utf8(ascii, '\0');
        convertAscii(text.data(), ascii, utf8.data());
        return utf8;
    }
    if (text.size() <= shortText) {
        std::array<char, 3 * shortText> utf8;
        return std::string(utf8.data(), convertByIcu(text.data(), text.size(), utf8.data()));
    }
    // Piece by piece, each with room for the longest result: one pass over the text, whose size in UTF-8 need not be
    // known before.
    std::string utf8;
    std::size_t used = ascii;
    for (std::size_t done = ascii; done < text.size();) {
        std::size_t length = std::min(piece, text.size() - done);
        if (done + length < text.size() && U16_IS_LEAD(text[done + length - 1])) {
            --length;  // a pair stays together
        }
        utf8.resize(used + 3 * length);
        used += convertByIcu(text.data() + done, length, utf8.data() + used);
        done += length;
    }
    utf8.resize(used);
    convertAscii(text.data(), ascii, utf8.data());
    if (utf8.size() > static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max())) {
        throw std::length_error("ustring_to_utf8: the UTF-8 text is longer than 2147483647 bytes");
    }
    return utf8;
}

std::basic_string<char16_t> utf8_to_ustring(const std::string& utf8) {
    checkLength(utf8.size(), "utf8_to_ustring");
    const std::size_t ascii = asciiPrefix(utf8);
    if (ascii < utf8.size() && utf8.size() <= shortText) {
        std::array<char16_t, shortText> text;
        return std::u16string(text.data(), convertByIcu(utf8.data(), utf8.size(), text.data()));
    }
    // UTF-16 never has more units than UTF-8 has bytes, so one allocation serves both steps.
    std::u16string text(utf8.size(), u'\0');
    convertAscii(utf8.data(), ascii, text.data());
    if (ascii < utf8.size()) {
        text.resize(ascii + convertByIcu(utf8.data() + ascii, utf8.size() - ascii, text.data() + ascii));
    }
    return text;
}

}  // namespace msg_svc::protobuf
