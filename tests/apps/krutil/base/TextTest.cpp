#include "krutil/base/Text.hpp"

#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "krutil/base/JsonLine.hpp"

namespace krutil_client {
namespace {

TEST(ClientTextTest, FindsTheFirstByteThatIsNotUtf8) {
    EXPECT_EQ(firstInvalidUtf8(""), std::nullopt);
    EXPECT_EQ(firstInvalidUtf8("plain \u00e4\u20ac\U0001F600"), std::nullopt);
    EXPECT_EQ(firstInvalidUtf8(std::string("nul\0inside", 10)), std::nullopt);
    EXPECT_EQ(firstInvalidUtf8("already \uFFFD"), std::nullopt);
    EXPECT_EQ(firstInvalidUtf8("ab\xff"), 2U);
    EXPECT_EQ(firstInvalidUtf8("cut \xe2\x82"), 4U);
    EXPECT_EQ(firstInvalidUtf8("surrogate \xed\xa0\x80"), 10U);
    EXPECT_EQ(firstInvalidUtf8("overlong \xc0\xaf"), 9U);
}

TEST(ClientTextTest, QuotedTextSteersNoTerminal) {
    EXPECT_EQ(quotedText("plain \u00e4\u20ac\U0001F600", 60), "\"plain \u00e4\u20ac\U0001F600\"");
    EXPECT_EQ(quotedText("a\nb\t\x1b[2J\x7f\u009b\"\\", 60), "\"a\\nb\\x09\\x1b[2J\\x7f\\x9b\\\"\\\\\"");
    EXPECT_EQ(quotedText("\u202e\u2066\u200f\u2029", 60), "\"\\u202e\\u2066\\u200f\\u2029\"");
    EXPECT_EQ(quotedText("ab\xff", 60), "\"ab\uFFFD\"");
}

TEST(ClientTextTest, QuotedTextIsCutBetweenCharacters) {
    EXPECT_EQ(quotedText("abcd", 4), "\"abcd\"");
    EXPECT_EQ(quotedText("abcde", 4), "\"abcd\"...");
    EXPECT_EQ(quotedText("abc\U0001F600", 4), "\"abc\"...");
    EXPECT_EQ(quotedText("\u20ac\u20ac\u20ac", 2), "\"\u20ac\u20ac\"...");
    EXPECT_EQ(quotedText(std::string(100'000, 'x'), 2), "\"xx\"...");
    EXPECT_EQ(quotedText("", 2), "\"\"");
    EXPECT_EQ(quotedText("a", 0), "\"\"...");
}

TEST(ClientTextTest, LineNumbersHaveAFractionOnlyIfTheyNeedOne) {
    EXPECT_EQ(lineText(0), "0");
    EXPECT_EQ(lineText(17), "17");
    EXPECT_EQ(lineText(4294967296.0), "4294967296");
    EXPECT_EQ(lineText(1.5), "1.5");
    EXPECT_EQ(lineText(std::numeric_limits<double>::infinity()), "inf");
    EXPECT_EQ(lineText(-1), "-1");
}

// All that steers a terminal: each class of characters at its ends, and what stands beside it.
TEST(SafeTextTest, WhatSteersATerminalIsAnEscape) {
    EXPECT_EQ(safeText(std::string("\0\x01\b\r\x1b[2J\x1f ~\x7f", 12)), "\\x00\\x01\\x08\\x0d\\x1b[2J\\x1f ~\\x7f");
    EXPECT_EQ(safeText("\u0080\u009b\u009f\u00a0"), "\\x80\\x9b\\x9f\u00a0");
    EXPECT_EQ(safeText("\u061b\u061c\u061d"), "\u061b\\u061c\u061d");
    EXPECT_EQ(safeText("\u200d\u200e\u200f\u2010"), "\u200d\\u200e\\u200f\u2010");
    EXPECT_EQ(safeText("\u2027\u2028\u2029\u202a\u202b\u202c\u202d\u202e\u202f"),
              "\u2027\\u2028\\u2029\\u202a\\u202b\\u202c\\u202d\\u202e\u202f");
    EXPECT_EQ(safeText("\u2065\u2066\u2067\u2068\u2069\u206a"), "\u2065\\u2066\\u2067\\u2068\\u2069\u206a");
}

TEST(SafeTextTest, EverythingElseStays) {
    EXPECT_EQ(safeText(""), "");
    EXPECT_EQ(safeText("a line\n\ttwo \\x1b \"\n"), "a line\n\ttwo \\x1b \"\n");
    EXPECT_EQ(safeText("\u00e4\u05d0\u0627\u20ac\U0001F600\n\t"), "\u00e4\u05d0\u0627\u20ac\U0001F600\n\t");
    EXPECT_EQ(safeText("cut \xe2\x80"), "cut \uFFFD");
}

TEST(SafeTextTest, QuotedTextHasTheSameEscapes) {
    EXPECT_EQ(quotedText("a\x1b\u009b\u061c\u202e\u2028\"", 100), "\"a\\x1b\\x9b\\u061c\\u202e\\u2028\\\"\"");
}

TEST(JsonLineTest, WhatSteersATerminalIsAnEscapeThatAReaderTakesBack) {
    const nlohmann::ordered_json object{{"k\u202e", "a\x1b\x7f\u009b\u061c\u2066\n\u05d0\xff"}};
    EXPECT_EQ(jsonLine(object), "{\"k\\u202e\":\"a\\u001b\\u007f\\u009b\\u061c\\u2066\\n\u05d0\uFFFD\"}\n");
    EXPECT_EQ(nlohmann::ordered_json::parse(jsonLine(object)),
              (nlohmann::ordered_json{{"k\u202e", "a\x1b\x7f\u009b\u061c\u2066\n\u05d0\uFFFD"}}));
}

}  // namespace
}  // namespace krutil_client
