// Pictures as sixels: the program that makes them, and those in its place that do something else.
#include "krutil/terminal/SixelPicture.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cstdlib>
#include <fstream>

#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

using namespace std::chrono_literals;

// One red pixel.
const std::string png(
    "\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0\1\0\0\0\1\b\2\0\0\0\x90wS\xde\0\0\0\fIDATx\x9c"
    "c\xf8\xcf\xc0\0\0\3\1\1\0\xc9\xfe\x92\xef\0\0\0\0IEND\xae"
    "B`\x82",
    69);

// A program of the test takes the place of img2sixel.
class SixelProgramTest : public testing::Test {
  protected:
    ~SixelProgramTest() override { ::setenv("PATH", before_.c_str(), 1); }

    void put(const std::string& script) {
        const std::string file = directory_.file("img2sixel");
        std::ofstream(file) << "#!/bin/sh\n" << script << "\n";
        ASSERT_EQ(::chmod(file.c_str(), 0700), 0);
        ::setenv("PATH", (directory_.file("") + ":" + before_).c_str(), 1);
    }

    static std::optional<std::string> made(std::chrono::milliseconds patience = 5s) {
        return sixelOf("picture", std::nullopt, patience);
    }

    const test_support::TemporaryDirectory directory_;
    const std::string before_ = std::getenv("PATH");
};

TEST(SixelTest, OneSequenceAndNothingElseIsDrawn) {
    EXPECT_TRUE(isSixel("\x1bPq#0;2;0;0;0~\x1b\\"));
    EXPECT_TRUE(isSixel("\x1bP0;1;0q\"1;1;2;2?$-~\x1b\\"));
    EXPECT_TRUE(isSixel("\x1bPq\x1b\\"));
    for (const std::string text :
         {"", "\x1bP", "\x1bP\x1b\\", "\x1bP1;2\x1b\\", "q~\x1b\\", "\x1bPq~", "x\x1bPq~\x1b\\", "\x1bPq~\x1b\\x",
          "\x1bP+q544e\x1b\\", "\x1bP$qm\x1b\\", "\x1bPq~\x1b[2J\x1b\\", "\x1bPq~\x1b\\\x1bPq~\x1b\\",
          "\x1bPq~\n\x1b\\", "\x1bPq~\a\x1b\\", "\x1bPq~\x18\x1b\\", "\x1bPq~\xc2\x9b\x1b\\", "\x1bPq~\x7f\x1b\\"}) {
        EXPECT_FALSE(isSixel(text)) << testing::PrintToString(text);
    }
}

TEST(SixelTest, TheRealProgramMakesThem) {
    const auto made = sixelOf(png, std::nullopt);
    ASSERT_TRUE(made);
    EXPECT_TRUE(made->starts_with("\x1bPq\"1;1;1;1#")) << testing::PrintToString(*made);
    const auto wide = sixelOf(png, 12);
    ASSERT_TRUE(wide);
    EXPECT_TRUE(wide->starts_with("\x1bPq\"1;1;12;12#")) << testing::PrintToString(*wide);
    EXPECT_FALSE(sixelOf(png.substr(0, 40), std::nullopt));
}

TEST_F(SixelProgramTest, GetsThePictureTheWidthAndNothingElse) {
    put("cat > '" + directory_.file("in") + "'; echo \"$@\" > '" + directory_.file("arguments") + "'");
    EXPECT_FALSE(sixelOf("picture", 80));
    // It cannot write files.
    put("printf '\\033Pq%s %s %s %s %s\\033\\\\' \"$*\" \"$(cat)\" \"$(ls /proc/$$/fd | tr -d '\\n')\" "
        "\"$(ulimit -t)\" \"$(ulimit -c)\"");
    // Descriptors 3 and 10 are the shell's own, for the command in the middle and for its script.
    EXPECT_EQ(sixelOf("picture", 80), "\x1bPq-w 80 picture 011023 5 0\x1b\\");
}

TEST_F(SixelProgramTest, OneThatFailsMakesNone) {
    put("printf '\\033Pq~\\033\\\\'; exit 1");
    EXPECT_EQ(made(), std::nullopt);
    put("printf '\\033Pq~\\033\\\\'");
    EXPECT_EQ(made(), "\x1bPq~\x1b\\");
}

TEST_F(SixelProgramTest, OneThatIsNotThereMakesNone) {
    ::setenv("PATH", directory_.file("").c_str(), 1);
    EXPECT_EQ(made(), std::nullopt);
}

TEST_F(SixelProgramTest, OneThatHangsIsEnded) {
    // With its output open, and without.
    put("sleep 600 & echo $! > /dev/null; sleep 600");
    EXPECT_EQ(made(200ms), std::nullopt);
    put("printf '\\033Pq~\\033\\\\'; exec >&-; sleep 600");
    EXPECT_EQ(made(200ms), std::nullopt);
}

TEST_F(SixelProgramTest, OneThatPrintsSomethingElseMakesNone) {
    put("printf '\\033Pq~\\033\\\\\\033[2J'");
    EXPECT_EQ(made(), std::nullopt);
}

TEST_F(SixelProgramTest, OneThatPrintsWithoutEndIsEnded) {
    put("exec cat /dev/zero");
    EXPECT_EQ(made(60s), std::nullopt);
}

}  // namespace
}  // namespace krutil_client
