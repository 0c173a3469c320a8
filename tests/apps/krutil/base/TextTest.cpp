#include "krutil/base/Text.hpp"

#include <gtest/gtest.h>

#include <limits>

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

TEST(ClientTextTest, LineNumbersHaveAFractionOnlyIfTheyNeedOne) {
    EXPECT_EQ(lineText(0), "0");
    EXPECT_EQ(lineText(17), "17");
    EXPECT_EQ(lineText(4294967296.0), "4294967296");
    EXPECT_EQ(lineText(1.5), "1.5");
    EXPECT_EQ(lineText(std::numeric_limits<double>::infinity()), "inf");
    EXPECT_EQ(lineText(-1), "-1");
}

}  // namespace
}  // namespace krutil_client
