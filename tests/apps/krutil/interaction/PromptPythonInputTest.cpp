#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "krutil/terminal/PythonInput.hpp"

namespace krutil_client {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

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

TEST(PythonInputTest, TheLastStatementDecidesWhetherCodeIsWhole) {
    for (const char* code : {"", "x = 1", ":c", ":queue:", "? def:", "!for i:", "if x:\n  y\n", "if x:\n  y\nz = 1",
                             "for i in x:\n  y\n:c"}) {
        EXPECT_TRUE(isWhole(code)) << code;
    }
    for (const char* code : {"if x:", "x = 1\nif x:", ":c\nif x:", "f(", "if x:\n  y\nelse:"}) {
        EXPECT_FALSE(isWhole(code)) << code;
    }
}

TEST(PythonInputTest, ALineIsIndentedByTheOneBefore) {
    const std::vector<std::pair<std::string, std::string>> cases{
        {"", ""},
        {"x = 1", ""},
        {"if x:", "    "},
        {"if x:  # why", "    "},
        {"  x = 1", "  "},
        {"if x:\n    y = {", "        "},
        {"    y = {1: 2,", "    "},
        {"f(a[1:", ""},
        {"def f():\n    return 1", ""},
        {"def f():\n    pass", ""},
        {"def f():\n    returned = 1", "    "},
        {"def f():\n    return (", "        "},
        {"return", ""},
        {"    x = '''a:", ""},
        {"def f():\n    \"\"\"Doc.\n\nMore.\"\"\"", "    "},
        {"    x = f(1,\n          2)", "    "},
        {"    if (x and\n            y):", "        "},
        {"    return (1,\n            2)", ""},
        {"    x = 1 + \\\n2", "    "},
        {"@decorated", ""},
    };
    for (const auto& [code, blanks] : cases) {
        EXPECT_EQ(indentationAfter(code), blanks) << code;
    }
}

TEST(PythonInputTest, PiecesAreStatementsWithAllTheirLines) {
    EXPECT_THAT(piecesOf(""), IsEmpty());
    EXPECT_THAT(piecesOf(" \n# only a comment\n"), IsEmpty());
    EXPECT_THAT(piecesOf("a = 1"), ElementsAre("a = 1"));
    EXPECT_THAT(piecesOf("a = 1\nb = 2\n"), ElementsAre("a = 1", "b = 2\n"));
    EXPECT_THAT(piecesOf("\n# why\na = 1\n\n# why not\nb = 2"), ElementsAre("a = 1\n\n# why not", "b = 2"));
    EXPECT_THAT(piecesOf("    a = 1\nb = 2"), ElementsAre("    a = 1", "b = 2"));
    EXPECT_THAT(piecesOf("f(a,\nb)\ng(\"\"\"\nx\n\"\"\")\nh = \\\n1"),
                ElementsAre("f(a,\nb)", "g(\"\"\"\nx\n\"\"\")", "h = \\\n1"));
}

TEST(PythonInputTest, BlocksStayWhole) {
    EXPECT_THAT(piecesOf("def f():\n    a = 1\n\n# a comment\n    return a\nf()"),
                ElementsAre("def f():\n    a = 1\n\n# a comment\n    return a", "f()"));
    EXPECT_THAT(piecesOf("if a:\n  b\nelif c:\n  d\nelse:\n  e\nelsewhere = 1"),
                ElementsAre("if a:\n  b\nelif c:\n  d\nelse:\n  e", "elsewhere = 1"));
    EXPECT_THAT(piecesOf("try:\n  a\nexcept E:\n  b\nfinally:\n  c\nd"),
                ElementsAre("try:\n  a\nexcept E:\n  b\nfinally:\n  c", "d"));
    EXPECT_THAT(piecesOf("@one\n@two\ndef f(): pass\nf()"), ElementsAre("@one\n@two\ndef f(): pass", "f()"));
}

TEST(PythonInputTest, CommandsArePiecesOfTheirOwn) {
    EXPECT_THAT(piecesOf(":c"), ElementsAre(":c"));
    EXPECT_THAT(piecesOf("# why\n:c\n  \na"), ElementsAre(":c", "a"));
    EXPECT_THAT(piecesOf("def f():\n  a\n:c\n:q\n  b"), ElementsAre("def f():\n  a", ":c", ":q", "  b"));
    EXPECT_THAT(piecesOf("f(\n:c\n)"), ElementsAre("f(\n:c\n)"));
}

}  // namespace
}  // namespace krutil_client
