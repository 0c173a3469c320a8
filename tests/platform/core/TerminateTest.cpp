#include "foundation/core/diag/terminate.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <limits>

#include "foundation/core/diag/AssertionSwitch.hpp"
#include "foundation/core/diag/assertions.hpp"

namespace foundation::core::diag {
namespace {

class TerminateTest : public testing::Test {
  protected:
    // The line goes to the stderr of load time, so the dying process must be loaded afresh.
    void SetUp() override { ::testing::FLAGS_gtest_death_test_style = "threadsafe"; }
};

const auto aborted = testing::KilledBySignal(SIGABRT);

TEST_F(TerminateTest, WritesMessageFileLineAndFunctionThenAborts) {
    EXPECT_EXIT(terminate("it broke", "some/File.cpp", 63, "doIt"), aborted,
                "^fatal: it broke \\(some/File\\.cpp:63, doIt\\)\n$");
}

TEST_F(TerminateTest, NullTextsAreNamed) {
    EXPECT_EXIT(terminate(nullptr, nullptr, 0, nullptr), aborted,
                "^fatal: \\(null\\) \\(\\(null\\):0, \\(null\\)\\)\n$");
}

TEST_F(TerminateTest, LineNumbersOfAnySizePrint) {
    EXPECT_EXIT(terminate("m", "f", std::numeric_limits<int>::max(), "g"), aborted, "\\(f:2147483647, g\\)");
    EXPECT_EXIT(terminate("m", "f", std::numeric_limits<int>::min(), "g"), aborted, "\\(f:-2147483648, g\\)");
}

TEST_F(TerminateTest, ClosedStderrHidesNothing) {
    EXPECT_EXIT(
        {
            ::close(STDERR_FILENO);
            terminate("still seen", "f", 1, "g");
        },
        aborted, "fatal: still seen");
}

TEST_F(TerminateTest, RedirectedStderrHidesNothing) {
    EXPECT_EXIT(
        {
            const int null = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
            ::dup2(null, STDERR_FILENO);
            terminate("still seen", "f", 1, "g");
        },
        aborted, "fatal: still seen");
}

TEST(AssertionsTest, AreOffUntilTheHostSwitchesThemOn) {
    EXPECT_FALSE(assertionsEnabled());
    EXPECT_FALSE(enableAssertions(true));
    EXPECT_TRUE(assertionsEnabled());
    EXPECT_TRUE(enableAssertions(false));
    EXPECT_FALSE(assertionsEnabled());
}

}  // namespace
}  // namespace foundation::core::diag
