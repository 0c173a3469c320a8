#include "common/LimitOptions.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/HelpFormatter.hpp"

namespace apps {
namespace {

using foundation::msg_svc::transport::layers::session::Limits;
using ::testing::HasSubstr;

class LimitOptionsTest : public ::testing::Test {
  protected:
    LimitOptionsTest() {
        app.formatter(std::make_shared<HelpFormatter>());
        addLimitOptions(app, limits);
    }

    void parse(const std::string& line) { app.parse(line); }

    CLI::App app;
    Limits limits;
};

TEST_F(LimitOptionsTest, NothingGivenLeavesTheDefaults) {
    parse("");
    EXPECT_EQ(limits, Limits{});
}

TEST_F(LimitOptionsTest, EachOptionSetsItsOwnLimit) {
    parse("--limit-tag 1 --limit-tagged-frame 2 --limit-array-message 3 --limit-message 4 --limit-frames 5");
    EXPECT_EQ(limits, (Limits{1, 2, 3, 4, 5}));
}

TEST_F(LimitOptionsTest, SizesHaveBinaryUnits) {
    parse("--limit-tagged-frame 64MiB --limit-array-message 1k --limit-message 5GiB");
    EXPECT_EQ(limits.taggedFrame, 64ULL << 20);
    EXPECT_EQ(limits.arrayMessage, 1024U);
    EXPECT_EQ(limits.message, 5ULL << 30);
}

TEST_F(LimitOptionsTest, WhatIsNoSizeIsRefused) {
    for (const std::string line : {"--limit-message -1", "--limit-message 0", "--limit-message many",
                                   "--limit-message 5XB", "--limit-message 1.5GiB", "--limit-message +1",
                                   "--limit-message GiB", "--limit-tag 65536", "--limit-tag 64KiB", "--limit-frames 0",
                                   "--limit-message 99999999999999999999", "--limit-message 99999999999TiB"}) {
        EXPECT_THROW(parse(line), CLI::ParseError) << line;
    }
    EXPECT_EQ(limits, Limits{});
}

TEST_F(LimitOptionsTest, TheRefusalSaysWhatIsExpected) {
    try {
        parse("--limit-tag 64KiB");
        FAIL();
    } catch (const CLI::ParseError& error) {
        EXPECT_STREQ(error.what(),
                     "--limit-tag: expected a number from 1 to 65535, if need be with a unit such as MiB, got 64KiB");
    }
}

TEST_F(LimitOptionsTest, HelpShowsTheDefaults) {
    const std::string help = app.help();
    EXPECT_THAT(help, HasSubstr("--limit-tag SIZE"));
    EXPECT_THAT(help, HasSubstr("(default: 128)"));
    EXPECT_THAT(help, HasSubstr("(default: 4MiB)"));
    EXPECT_THAT(help, HasSubstr("(default: 64MiB)"));
    EXPECT_THAT(help, HasSubstr("4GiB)"));
    EXPECT_THAT(help, HasSubstr("(default: 65536)"));
}

TEST(ParseSizeTest, UnitsArePowersOf1024InAnyCase) {
    EXPECT_EQ(parseSize("0"), 0U);
    EXPECT_EQ(parseSize("17"), 17U);
    EXPECT_EQ(parseSize("1k"), 1024U);
    EXPECT_EQ(parseSize("2MiB"), 2U << 20);
    EXPECT_EQ(parseSize("3gib"), 3ULL << 30);
    EXPECT_EQ(parseSize("4T"), 4ULL << 40);
    EXPECT_EQ(parseSize("18446744073709551615"), ~0ULL);
}

TEST(ParseSizeTest, EverythingElseIsNone) {
    for (const auto* text : {"", "-1", "+1", " 1", "1 ", "1.5", "KiB", "1KB", "1KiBs", "18446744073709551616",
                             "18014398509481984KiB", "0x10"}) {
        EXPECT_EQ(parseSize(text), std::nullopt) << text;
    }
}

TEST(SizeTextTest, UsesTheLargestUnitThatDivides) {
    EXPECT_EQ(sizeText(0), "0");
    EXPECT_EQ(sizeText(1000), "1000");
    EXPECT_EQ(sizeText(1024), "1KiB");
    EXPECT_EQ(sizeText(1536), "1536");
    EXPECT_EQ(sizeText(64ULL << 20), "64MiB");
    EXPECT_EQ(sizeText(4ULL << 30), "4GiB");
    EXPECT_EQ(sizeText(1ULL << 50), "1024TiB");
}

}  // namespace
}  // namespace apps
