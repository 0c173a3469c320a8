#include "krutil/terminal/Highlight.hpp"

#include <gtest/gtest.h>

namespace krutil_client {
namespace {

constexpr std::size_t nowhere = 1000;

// A letter for each character.
std::string shown(const std::wstring& code, std::size_t cursor = nowhere) {
    std::string letters;
    for (const Style style : stylesOf(code, cursor)) {
        letters += ".KLNCM"[static_cast<std::size_t>(style)];
    }
    return letters;
}

TEST(HighlightTest, TokensAreToldApart) {
    EXPECT_EQ(shown(L""), "");
    EXPECT_EQ(shown(L"if x1: # if"), "KK.....CCCC");
    EXPECT_EQ(shown(L"iffy = 0x1f + 1.5"), ".......NNNN...NNN");
    EXPECT_EQ(shown(L"'a\\'b' + \"#\"\nin"), "LLLLLL...LLL.KK");
}

TEST(HighlightTest, StringsEndWhereTheyDo) {
    EXPECT_EQ(shown(L"'a\nb"), "LL..");
    EXPECT_EQ(shown(L"'''a\n'b''' in"), "LLLLLLLLLL.KK");
    EXPECT_EQ(shown(L"'''a"), "LLLL");
    EXPECT_EQ(shown(L"'a\\"), "LLL");
}

TEST(HighlightTest, TheBracketAtTheCursorHasItsCounterpartMarked) {
    EXPECT_EQ(shown(L"f(a[1])", 7), ".M..N.M");
    EXPECT_EQ(shown(L"f(a[1])", 3), "...MNM.");
    EXPECT_EQ(shown(L"f(a[1])", 0), "....N..");
    EXPECT_EQ(shown(L"f(')')", 3), "..LLL.");
    EXPECT_EQ(shown(L"f(]", 2), "...");
    EXPECT_EQ(shown(L")", 1), ".");
}

}  // namespace
}  // namespace krutil_client
