#include "krutil/terminal/Completion.hpp"

#include <gtest/gtest.h>

#include <clocale>

namespace krutil_client {
namespace {

TEST(CompletionTest, TheCommonBeginningIsThatOfAll) {
    EXPECT_EQ(commonBeginning({}), L"");
    EXPECT_EQ(commonBeginning({L"linspace"}), L"linspace");
    EXPECT_EQ(commonBeginning({L"linspace", L"linalg", L"lin"}), L"lin");
    EXPECT_EQ(commonBeginning({L"a", L"b"}), L"");
}

TEST(CompletionTest, TheTableReadsDownItsColumns) {
    std::setlocale(LC_CTYPE, "C.UTF-8");
    EXPECT_EQ(tableOf({L"a", L"bb", L"ccc", L"d", L"e"}, 8), L"a    d\nbb   e\nccc\n");
    EXPECT_EQ(tableOf({L"a", L"bb", L"ccc"}, 80), L"a    bb   ccc\n");
    EXPECT_EQ(tableOf({L"longer", L"than it"}, 3), L"longer\nthan it\n");
    // Two columns each.
    EXPECT_EQ(tableOf({L"\u4e2d", L"b", L"c"}, 6), L"\u4e2d  c\nb\n");
    EXPECT_EQ(tableOf({L"a\x1b[2J"}, 80), L"a?[2J\n");
}

TEST(CompletionTest, OfVeryManyCandidatesTheFirstAreShown) {
    const std::wstring table = tableOf(std::vector<std::wstring>(1200, L"x"), 1);
    EXPECT_EQ(table.substr(0, 4), L"x\nx\n");
    EXPECT_EQ(table.substr(table.size() - 16), L"x\nand 1000 more\n");
}

}  // namespace
}  // namespace krutil_client
