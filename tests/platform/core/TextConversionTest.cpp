#include <gtest/gtest.h>

#include "msg_svc/protobuf/ustring.hpp"

namespace msg_svc::protobuf {
namespace {

using namespace std::string_literals;

std::u16string utf16Of(char32_t point) {
    if (point < 0x10000) {
        return {static_cast<char16_t>(point)};
    }
    const char32_t rest = point - 0x10000;
    return {static_cast<char16_t>(0xD800 + (rest >> 10)), static_cast<char16_t>(0xDC00 + (rest & 0x3FF))};
}

std::string utf8Of(char32_t point) {
    const auto byte = [](char32_t value) { return static_cast<char>(static_cast<unsigned char>(value)); };
    const auto tail = [&](unsigned shift) { return byte(0x80 | (point >> shift & 0x3F)); };
    const char32_t p = point;
    if (p < 0x80) {
        return {byte(p)};
    }
    if (p < 0x800) {
        return {byte(0xC0 | p >> 6), tail(0)};
    }
    if (p < 0x10000) {
        return {byte(0xE0 | p >> 12), tail(6), tail(0)};
    }
    return {byte(0xF0 | p >> 18), tail(12), tail(6), tail(0)};
}

TEST(TextConversionTest, AllCodePointsRoundTrip) {
    for (char32_t point = 0; point <= 0x10FFFF; ++point) {
        if (point >= 0xD800 && point <= 0xDFFF) {
            continue;
        }
        const std::u16string text = utf16Of(point);
        const std::string bytes = utf8Of(point);
        ASSERT_EQ(ustring_to_utf8(text), bytes) << std::hex << static_cast<unsigned>(point);
        ASSERT_EQ(utf8_to_ustring(bytes), text) << std::hex << static_cast<unsigned>(point);
    }
}

// Long text is converted piece by piece. Wherever a piece may end, a pair of surrogates begins, or half of one stands.
TEST(TextConversionTest, PairsOfSurrogatesMayStandAnywhere) {
    for (const std::u16string& prefix : {u""s, u"a"s, u"\u00E9"s}) {
        for (std::size_t filled = (1U << 16) - 4; filled <= (1U << 16) + 1; ++filled) {
            for (const char16_t* const end : {u"\U0001F600", u"\xD83D", u"\xDE00", u"\xD83D\xD83D\xDE00"}) {
                std::u16string text = prefix;
                std::string expected = ustring_to_utf8(prefix);
                for (std::size_t i = 0; i < filled; ++i) {
                    text += u'\u6F22';
                    expected += "\xE6\xBC\xA2";
                }
                text += end;
                text += text;
                expected += ustring_to_utf8(end);
                expected += expected;
                ASSERT_EQ(ustring_to_utf8(text), expected) << filled;
            }
        }
    }
}

// Short text goes another way than long text; 256 is the longest that is short.
TEST(TextConversionTest, ShortAndLongTextBecomeTheSame) {
    for (std::size_t length = 1; length <= 300; ++length) {
        for (const char32_t point : {0xE9U, 0x6F22U, 0x1F600U}) {
            std::u16string text;
            std::string bytes;
            for (std::size_t i = 0; i < length; ++i) {
                text += utf16Of(point);
                bytes += utf8Of(point);
            }
            ASSERT_EQ(ustring_to_utf8(text), bytes) << length;
            ASSERT_EQ(utf8_to_ustring(bytes), text) << length;
        }
    }
}

TEST(TextConversionTest, EmptyTextIsEmpty) {
    EXPECT_EQ(ustring_to_utf8(u""), "");
    EXPECT_EQ(utf8_to_ustring(""), u"");
}

TEST(TextConversionTest, EmbeddedNulIsKept) {
    EXPECT_EQ(ustring_to_utf8(u"a\0\u00E9\0"s), "a\0\xC3\xA9\0"s);
    EXPECT_EQ(utf8_to_ustring("a\0\xC3\xA9\0"s), u"a\0\u00E9\0"s);
    EXPECT_EQ(ustring_to_utf8(u"\0"s), "\0"s);
    EXPECT_EQ(utf8_to_ustring("\0"s), u"\0"s);
}

TEST(TextConversionTest, UnpairedSurrogatesBecomeReplacementCharacters) {
    const std::string r = "\xEF\xBF\xBD";
    const char16_t high = 0xD800;
    const char16_t low = 0xDC00;
    const auto text = [](std::initializer_list<char16_t> units) { return std::u16string(units); };
    EXPECT_EQ(ustring_to_utf8(text({high})), r);
    EXPECT_EQ(ustring_to_utf8(text({low})), r);
    EXPECT_EQ(ustring_to_utf8(text({u'a', high, u'b'})), "a" + r + "b");
    EXPECT_EQ(ustring_to_utf8(text({low, high})), r + r);
    EXPECT_EQ(ustring_to_utf8(text({high, high, low})), r + "\xF0\x90\x80\x80");
    EXPECT_EQ(ustring_to_utf8(text({high, low, low})), "\xF0\x90\x80\x80" + r);
    for (char16_t unit = 0xD800; unit < 0xE000; ++unit) {
        ASSERT_EQ(ustring_to_utf8(text({unit})), r) << static_cast<unsigned>(unit);
    }
}

struct IllFormed {
    const char* bytes;
    const char16_t* text;
};

class IllFormedTextTest : public testing::TestWithParam<IllFormed> {};

// "U+FFFD Substitution of Maximal Subparts" of the Unicode Standard, with its own examples first.
TEST_P(IllFormedTextTest, EachMaximalSubpartBecomesOneReplacementCharacter) {
    EXPECT_EQ(utf8_to_ustring(GetParam().bytes), GetParam().text);
    for (const std::size_t length : {13U, 300U}) {
        const std::string around(length, 'x');
        const std::u16string aroundText(length, u'x');
        EXPECT_EQ(utf8_to_ustring(around + GetParam().bytes + around), aroundText + GetParam().text + aroundText);
    }
}

INSTANTIATE_TEST_SUITE_P(
    Table, IllFormedTextTest,
    testing::Values(
        // Sequences that are not the shortest.
        IllFormed{"\xC0\xAF\xE0\x80\xBF\xF0\x81\x82\x41", u"\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFDA"},
        // Encoded surrogates.
        IllFormed{"\xED\xA0\x80\xED\xBF\xBF\xED\xAF\x41", u"\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD\uFFFDA"},
        // Beyond the last code point, and bytes that occur nowhere.
        IllFormed{"\xF4\x91\x92\x93\xFF\x41\x80\xBF\x42", u"\uFFFD\uFFFD\uFFFD\uFFFD\uFFFDA\uFFFD\uFFFDB"},
        // Sequences that are cut short.
        IllFormed{"\xE1\x80\xE2\xF0\x91\x92\xF1\xBF\x41", u"\uFFFD\uFFFD\uFFFD\uFFFDA"},
        IllFormed{"\x61\xF1\x80\x80\xE1\x80\xC2\x62\x80\x63\x80\xBF\x64", u"a\uFFFD\uFFFD\uFFFDb\uFFFDc\uFFFD\uFFFDd"},
        IllFormed{"\xC3", u"\uFFFD"}, IllFormed{"\xE2\x82", u"\uFFFD"}, IllFormed{"\xF0\x9F\x98", u"\uFFFD"},
        IllFormed{"\xF5\x80\x80\x80", u"\uFFFD\uFFFD\uFFFD\uFFFD"}, IllFormed{"\xC3\x28", u"\uFFFD("},
        IllFormed{"\xF8\x88\x80\x80\x80", u"\uFFFD\uFFFD\uFFFD\uFFFD\uFFFD"}));

TEST(TextConversionTest, ShortCutForAsciiEndsAtTheFirstOtherCharacter) {
    // Lengths around the strides of the two short cuts, with the other character at every position.
    for (std::size_t length = 1; length <= 40; ++length) {
        for (std::size_t position = 0; position < length; ++position) {
            std::u16string text(length, u'a');
            std::string bytes(length, 'a');
            text[position] = u'\u0080';
            bytes.replace(position, 1, "\xC2\x80");
            ASSERT_EQ(ustring_to_utf8(text), bytes) << length << " " << position;
            ASSERT_EQ(utf8_to_ustring(bytes), text) << length << " " << position;
            text[position] = u'\u007F';
            ASSERT_EQ(ustring_to_utf8(text),
                      std::string(position, 'a') + '\x7F' + std::string(length - position - 1, 'a'));
        }
    }
}

TEST(TextConversionTest, UnitsAbove7FThatLookLikeAsciiInTheirLowByteAreNotAscii) {
    EXPECT_EQ(ustring_to_utf8(std::u16string(16, u'\u0141')), [] {
        std::string bytes;
        for (int i = 0; i < 16; ++i) {
            bytes += "\xC5\x81";
        }
        return bytes;
    }());
}

}  // namespace
}  // namespace msg_svc::protobuf
