#include "krutil/base/LastLine.hpp"

#include <gtest/gtest.h>

namespace krutil_client {
namespace {

TEST(LastLineTest, WhatFollowsOnTheLastNewlineIsKept) {
    LastLine line;
    line.add("one\ntw");
    line.add("o");
    EXPECT_EQ(line.text(), "two");
    line.add("\n");
    EXPECT_EQ(line.text(), "");
    line.add("three");
    EXPECT_EQ(line.take(), "three");
    EXPECT_EQ(line.text(), "");
}

TEST(LastLineTest, ALongLineIsNotKeptWhole) {
    LastLine line;
    line.add(std::string(LastLine::longest, 'x'));
    EXPECT_TRUE(line.whole());
    line.add("");
    EXPECT_TRUE(line.whole());
    line.add("x");
    EXPECT_FALSE(line.whole());
    line.add("y");
    EXPECT_FALSE(line.whole());
    EXPECT_EQ(line.text(), std::string(LastLine::longest, 'x'));
    line.add("\nshort");
    EXPECT_TRUE(line.whole());
    line.add("\n" + std::string(LastLine::longest + 1, 'x'));
    EXPECT_FALSE(line.whole());
    line.take();
    EXPECT_TRUE(line.whole());
}

}  // namespace
}  // namespace krutil_client
