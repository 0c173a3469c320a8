#include "common/RateLimit.hpp"

#include <gtest/gtest.h>

namespace apps {
namespace {

using namespace std::chrono_literals;

class RateLimitTest : public ::testing::Test {
  protected:
    RateLimit limit{2, 60s};
    const RateLimit::Clock::time_point begin = RateLimit::Clock::now();
};

TEST_F(RateLimitTest, AllowsSoManyAPeriod) {
    EXPECT_EQ(limit.ask(begin), 0U);
    EXPECT_EQ(limit.ask(begin + 59s), 0U);
    EXPECT_EQ(limit.ask(begin + 59s), std::nullopt);
}

TEST_F(RateLimitTest, TellsOnceHowManyWereLeftOut) {
    limit.ask(begin);
    limit.ask(begin);
    for (int i = 0; i < 7; ++i) {
        EXPECT_EQ(limit.ask(begin + 1s), std::nullopt);
    }
    EXPECT_EQ(limit.ask(begin + 60s), 7U);
    EXPECT_EQ(limit.ask(begin + 60s), 0U);
    EXPECT_EQ(limit.ask(begin + 60s), std::nullopt);
}

TEST_F(RateLimitTest, APeriodBeginsWithItsFirstLine) {
    limit.ask(begin);
    limit.ask(begin + 100s);
    EXPECT_EQ(limit.ask(begin + 159s), 0U);
    EXPECT_EQ(limit.ask(begin + 159s), std::nullopt);
    EXPECT_EQ(limit.ask(begin + 160s), 1U);
}

}  // namespace
}  // namespace apps
