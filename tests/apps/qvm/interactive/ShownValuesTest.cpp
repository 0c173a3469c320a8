// Values that are shown with some of their elements.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using krutil::io::SinkTraits;

class ShownValuesTest : public testing::Test {
  protected:
    // As repr() has it, and as pprint has it.
    std::string shown(const std::string& code) { return engine_.client.eval(code).shown(); }
    std::string inLines(const std::string& code) {
        EvalOptions options;
        options.out = SinkTraits(false, false, true, false, false, false);
        return engine_.client.eval(code, options).shown();
    }

    EngineSession engine_;
};

TEST_F(ShownValuesTest, ContainersAreCutAndTheRestIsCounted) {
    shown("import qvm; qvm.shorten(2)");
    EXPECT_EQ(shown("[10, 20, 30, 40]"), "[10, 20, ... 2 more]\n");
    EXPECT_EQ(shown("(10, 20, 30)"), "(10, 20, ... 1 more)\n");
    EXPECT_EQ(shown("{'b': 1, 'a': 2, 'c': 3}"), "{'b': 1, 'a': 2, ... 1 more}\n");
    EXPECT_EQ(shown("{1, 2, 3}"), "{1, 2, ... 1 more}\n");
    EXPECT_EQ(shown("frozenset([1, 2, 3])"), "frozenset({1, 2, ... 1 more})\n");
    EXPECT_EQ(shown("[[1, 2, 3], {'x': (1, 2, 3)}]"), "[[1, 2, ... 1 more], {'x': (1, 2, ... 1 more)}]\n");
    EXPECT_EQ(shown("[1, 2]"), "[1, 2]\n");
    EXPECT_EQ(shown("'a text'"), "'a text'\n");
    EXPECT_THAT(shown("a = [1, 2, 3]; a[0] = a\na"),
                testing::MatchesRegex("\\[<Recursion on list with id=[0-9]+>, 2, ... 1 more\\]\n"));
    shown("qvm.shorten(1)");
    EXPECT_EQ(shown("(1, 2)"), "(1, ... 1 more)\n");
}

TEST_F(ShownValuesTest, ValuesInLinesAreCutAlike) {
    shown("import qvm; qvm.shorten(3)");
    EXPECT_EQ(inLines("['word' * 10, 'two' * 10, 'three' * 10, 4, 5]"),
              "['wordwordwordwordwordwordwordwordwordword',\n"
              " 'twotwotwotwotwotwotwotwotwotwo',\n"
              " 'threethreethreethreethreethreethreethreethreethree',\n"
              " ... 2 more]\n");
    EXPECT_EQ(inLines("{n: 'word' * 10 for n in range(4000)}"),
              "{0: 'wordwordwordwordwordwordwordwordwordword',\n"
              " 1: 'wordwordwordwordwordwordwordwordwordword',\n"
              " 2: 'wordwordwordwordwordwordwordwordwordword',\n"
              " ... 3,997 more}\n");
    EXPECT_EQ(inLines("[1, 2, 3, 4, 5]"), "[1, 2, 3, ... 2 more]\n");
}

TEST_F(ShownValuesTest, DisplayIsThereWhereItIsWanted) {
    EXPECT_EQ(engine_.client.eval("display(1)").errorText(), "name 'display' is not defined");
    const Evaluation done = engine_.client.eval(
        "import qvm; qvm.bind_display()\n"
        "class Red:\n    def _repr_html_(self): return '<b>red</b>'\n    def __repr__(self): return 'red'\n"
        "print('before')\ndisplay(1, Red(), None)\n'a value'");
    // The client shows no pictures.
    EXPECT_EQ(done.output(), "before\n1\nred\nNone\n");
    EXPECT_EQ(done.shown(), "'a value'\n");
    shown("qvm.shorten(2)");
    EXPECT_EQ(engine_.client.eval("display([1, 2, 3])").output(), "[1, 2, ... 1 more]\n");
}

TEST_F(ShownValuesTest, SubclassesShowThemselves) {
    shown("import qvm; qvm.shorten(1)\nclass Mine(list):\n    def __repr__(self): return f'{len(self)} of mine'");
    EXPECT_EQ(shown("Mine([1, 2, 3])"), "3 of mine\n");
    EXPECT_EQ(shown("[Mine([1, 2, 3]), 2]"), "[3 of mine, ... 1 more]\n");
}

TEST_F(ShownValuesTest, FullShowsTheLastValueWithAllElements) {
    shown("import qvm; qvm.shorten(2)");
    EXPECT_EQ(shown("qvm.full()"), "");
    EXPECT_EQ(shown("[1, 2, 3, 4]"), "[1, 2, ... 2 more]\n");
    EXPECT_EQ(shown("qvm.full()"), "[1, 2, 3, 4]\n");
    EXPECT_EQ(shown("qvm.full()"), "[1, 2, 3, 4]\n");
    EXPECT_EQ(shown("_"), "[1, 2, ... 2 more]\n");
    shown("qvm.shorten(0)");
    EXPECT_EQ(shown("_"), "[1, 2, 3, 4]\n");
}

TEST_F(ShownValuesTest, PrintedTextIsNotCutAndANegativeLimitIsRefused) {
    shown("import qvm; qvm.shorten(2)");
    EXPECT_EQ(engine_.client.eval("print([1, 2, 3])").output(), "[1, 2, 3]\n");
    EXPECT_EQ(engine_.client.eval("qvm.shorten(-1)").errorText(), "limit must be 0 or more, not -1");
}

TEST_F(ShownValuesTest, WhatIsCutIsNotPutIntoWordsFirst) {
    shown(
        "import qvm; qvm.shorten(2)\n"
        "count = 0\n"
        "class Counted:\n"
        "    def __repr__(self):\n        global count; count += 1; return 'x'\n"
        "many = [Counted() for n in range(1000)]");
    EXPECT_EQ(shown("many"), "[x, x, ... 998 more]\n");
    EXPECT_EQ(shown("count"), "2\n");
    EXPECT_EQ(inLines("many"), "[x, x, ... 998 more]\n");
    EXPECT_EQ(shown("count"), "4\n");
}

}  // namespace
}  // namespace qvm_test
