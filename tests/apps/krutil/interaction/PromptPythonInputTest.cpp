#include <gtest/gtest.h>

#include "krutil/terminal/PythonInput.hpp"

namespace krutil_client {
namespace {

TEST(PythonInputTest, CompleteLinesNeedNoMore) {
    for (const char* code : {"", "x", "x = 1", "print(')')", "a[1:2]", "d = {1: 2}", "# (", "'(' # :", "x = '\\''",
                             "if x: y", "lambda: 0", "a @ b", "f(x) # if:", "'''a'''", "\"it's\"", "x)"}) {
        EXPECT_FALSE(needsMoreLines(code)) << code;
    }
}

TEST(PythonInputTest, OpenBracketsAndStringsNeedMore) {
    for (const char* code :
         {"(", "f(x,", "[1,\n2", "{", "f('(', [", "'''a", "\"\"\"a''' \"", "x = \\", "if (a and", "'''a\\"}) {
        EXPECT_TRUE(needsMoreLines(code)) << code;
    }
    EXPECT_FALSE(needsMoreLines("f(x,\ny)"));
    EXPECT_FALSE(needsMoreLines("'''a\n\nb'''"));
    EXPECT_FALSE(needsMoreLines("x = \\\n1"));
    EXPECT_TRUE(needsMoreLines("(\n\n")) << "an empty line closes no bracket";
}

TEST(PythonInputTest, ABlockGoesOnUntilAnEmptyLine) {
    EXPECT_TRUE(needsMoreLines("if x:"));
    EXPECT_TRUE(needsMoreLines("if x: # why"));
    EXPECT_TRUE(needsMoreLines("if x:\n  y"));
    EXPECT_TRUE(needsMoreLines("if x:\n  y\nelse:"));
    EXPECT_FALSE(needsMoreLines("if x:\n  y\n"));
    EXPECT_FALSE(needsMoreLines("if x:\n  y\n  "));
    EXPECT_TRUE(needsMoreLines("@decorated"));
    EXPECT_TRUE(needsMoreLines("@decorated\ndef f(): pass"));
    EXPECT_FALSE(needsMoreLines("@decorated\ndef f(): pass\n"));
}

TEST(PythonInputTest, AStringThatALineCannotHoldIsTheEnginesToRefuse) {
    EXPECT_FALSE(needsMoreLines("x = 'a"));
    EXPECT_FALSE(needsMoreLines("x = 'a\ny"));
}

}  // namespace
}  // namespace krutil_client
