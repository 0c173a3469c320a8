// The line about a large transfer, with a clock of the test.

#include "krutil/display/Progress.hpp"

#include <gtest/gtest.h>

namespace krutil_client {
namespace {

using namespace std::chrono_literals;
using Traffic = Progress::Traffic;

constexpr std::uint64_t mebi = 1U << 20;
constexpr Progress::Clock::time_point start{};
const std::string erase = "\x1b[K";

TEST(ProgressTest, WhatTakesNoLongerThanAMomentIsNotShown) {
    Progress progress({100, 0, 0}, 64 * mebi, start);
    EXPECT_EQ(progress.update({100, 0, 0}, start, 100), "");
    EXPECT_EQ(progress.update({100 + 32 * mebi, 0, 0}, start + 499ms, 100), "");
    EXPECT_EQ(progress.update({100 + 64 * mebi, 0, 0}, start + 600ms, 100), "");
    EXPECT_EQ(progress.clear(), "");
}

TEST(ProgressTest, SendingIsShownAfterAMomentAndTakenAwayWhenDone) {
    Progress progress({100, 0, 0}, 64 * mebi, start);
    const std::string first = "sending   [###############               ]  50%  32.0 of 64.0 MiB";
    EXPECT_EQ(progress.update({100 + 32 * mebi, 0, 0}, start + 500ms, 100), "\r" + first + erase);
    EXPECT_EQ(progress.update({100 + 48 * mebi, 0, 0}, start + 600ms, 100),
              "\rsending   [######################        ]  75%  48.0 of 64.0 MiB" + erase);
    EXPECT_EQ(progress.update({100 + 64 * mebi, 0, 0}, start + 700ms, 100), "\r" + erase);
}

TEST(ProgressTest, NothingIsWrittenWhenNothingChanged) {
    Progress progress({}, 64 * mebi, start);
    EXPECT_NE(progress.update({mebi, 0, 0}, start + 500ms, 100), "");
    EXPECT_EQ(progress.update({mebi, 0, 0}, start + 600ms, 100), "");
}

TEST(ProgressTest, ReceivingCountsItsMomentFromItsOwnBeginning) {
    Progress progress({}, 64 * mebi, start);
    EXPECT_EQ(progress.update({64 * mebi, 0, 0}, start + 100ms, 100), "");
    EXPECT_EQ(progress.update({64 * mebi, 2048 * mebi, mebi}, start + 10s, 100), "");
    EXPECT_EQ(progress.update({64 * mebi, 2048 * mebi, 512 * mebi}, start + 10s + 500ms, 100),
              "\rreceiving [#######                       ]  25%  0.5 of 2.0 GiB" + erase);
}

TEST(ProgressTest, SmallFramesAreNotShown) {
    Progress progress({}, 0, start);
    for (auto time = start; time < start + 5s; time += 100ms) {
        EXPECT_EQ(progress.update({0, mebi - 1, 1000}, time, 100), "");
    }
}

TEST(ProgressTest, AShorterLineLeavesNothingOfTheOneBeforeIt) {
    Progress progress({}, 0, start);
    EXPECT_EQ(progress.update({0, 64 * mebi, 32 * mebi}, start, 40), "");
    EXPECT_EQ(progress.update({0, 64 * mebi, 32 * mebi}, start + 1s, 40), "\rreceiving  50%  32.0 of 64.0 MiB" + erase);
    EXPECT_EQ(progress.update({0, 64 * mebi, mebi}, start + 2s, 40), "\rreceiving   1%  1.0 of 64.0 MiB" + erase);
}

TEST(ProgressTest, ALineIsShorterThanTheTerminalIsWide) {
    Progress progress({}, 0, start);
    progress.update({0, 64 * mebi, 32 * mebi}, start, 20);
    EXPECT_EQ(progress.update({0, 64 * mebi, 32 * mebi}, start + 1s, 20), "\rreceiving  50%  32." + erase);
}

TEST(ProgressTest, TheLineComesBackAfterItWasTakenAway) {
    Progress progress({}, 0, start);
    progress.update({0, 64 * mebi, 32 * mebi}, start, 40);
    const std::string line = progress.update({0, 64 * mebi, 32 * mebi}, start + 1s, 40);
    EXPECT_EQ(progress.clear(), "\r" + erase);
    EXPECT_EQ(progress.clear(), "");
    EXPECT_EQ(progress.update({0, 64 * mebi, 32 * mebi}, start + 1s, 40), line);
}

}  // namespace
}  // namespace krutil_client
