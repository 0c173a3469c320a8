#include "foundation/msg_svc/transport/layers/session/PrintableText.hpp"

#include <gtest/gtest.h>

namespace foundation::msg_svc::transport::layers::session {
namespace {

TEST(PrintableTextTest, QuotedBytesCannotSteerATerminal) {
    EXPECT_EQ(quoted("plain: text"), "\"plain: text\"");
    EXPECT_EQ(quoted(std::string_view("a\0b\x1B[2J\n\x89\"\\", 11)), "\"a\\x00b\\x1b[2J\\n\\x89\\\"\\\\\"");
    EXPECT_EQ(quoted(""), "\"\"");
}

TEST(PrintableTextTest, QuotedBytesAreCut) {
    EXPECT_EQ(quoted("abcdef", 3), "\"abc\"...");
    EXPECT_EQ(quoted("abc", 3), "\"abc\"");
}

TEST(PrintableTextTest, SentenceKeepsTextAndReplacesControlCharacters) {
    EXPECT_EQ(sentence("Größe:\n\t1"), "Größe:\n\t1");
    EXPECT_EQ(sentence("a\x1B[2Jb"), "a\xEF\xBF\xBD[2Jb");
    EXPECT_EQ(sentence("a\xFF"), "a\xEF\xBF\xBD");
    EXPECT_EQ(sentence("\xC2\x9B"), "\xEF\xBF\xBD");
}

TEST(PrintableTextTest, SentenceReadsInTheOrderInWhichItWasWritten) {
    for (const char* const control : {"\u061c", "\u200e", "\u200f", "\u202a", "\u202b", "\u202c", "\u202d", "\u202e",
                                      "\u2066", "\u2067", "\u2068", "\u2069"}) {
        EXPECT_EQ(sentence(std::string("a") + control + "b"), "a\uFFFDb") << control;
    }
    EXPECT_EQ(sentence("\u05d0\u200d\u0627"), "\u05d0\u200d\u0627");
}

TEST(PrintableTextTest, SentenceIsCut) {
    EXPECT_EQ(sentence("abcdef", 4), "abcd...");
    EXPECT_EQ(sentence("ab\xC3\xA9", 3), "ab\xEF\xBF\xBD...");
}

}  // namespace
}  // namespace foundation::msg_svc::transport::layers::session
