#include "krutil/display/ErrorText.hpp"

#include <gtest/gtest.h>

namespace krutil_client {
namespace {

using cmddistributor::RuntimeException;
using cmddistributor::StackFrame;
using krutil::cmddistributor::inCOMPILE_ERROR;
using krutil::cmddistributor::inRUNTIME_ERROR;

RuntimeException error(const std::string& id, const std::u16string& message, std::vector<StackFrame> frames = {},
                       std::vector<RuntimeException> causes = {}, const std::string& function = {}) {
    return {inRUNTIME_ERROR, message, id, function, std::move(frames), std::move(causes), false};
}

TEST(ErrorTextTest, FramesThenIdentifierAndMessage) {
    EXPECT_EQ(errorText(error("ValueError", u"no good", {{u"a.py", "<module>", 7}, {u"b\u00fc.py", "work", 12}})),
              "In \"a.py\", line 7, in <module>\n"
              "In \"b\u00fc.py\", line 12, in work\n"
              "ValueError: no good\n");
}

TEST(ErrorTextTest, CausesComeFirstTheInnermostAtTheTop) {
    const auto root = error("KeyError", u"'k'", {{u"c.py", "look", 3}});
    const auto middle = error("ValueError", u"bad", {}, {root});
    EXPECT_EQ(errorText(error("RuntimeError", u"failed", {{u"d.py", "", 1}}, {middle})),
              "In \"c.py\", line 3, in look\n"
              "KeyError: 'k'\n"
              "\n"
              "The error above caused this one:\n"
              "\n"
              "ValueError: bad\n"
              "\n"
              "The error above caused this one:\n"
              "\n"
              "In \"d.py\", line 1\n"
              "RuntimeError: failed\n");
}

TEST(ErrorTextTest, SeveralCausesAreEachSaid) {
    EXPECT_EQ(errorText(error("Group", u"2", {}, {error("A", u"a"), error("B", u"b")})),
              "A: a\n"
              "\n"
              "The error above caused this one:\n"
              "\n"
              "B: b\n"
              "\n"
              "The error above caused this one:\n"
              "\n"
              "Group: 2\n");
}

TEST(ErrorTextTest, AnErrorWithoutAStackNamesItsFunction) {
    EXPECT_EQ(errorText(error("E", u"m", {}, {}, "numpy.linalg.svd")), "In numpy.linalg.svd\nE: m\n");
}

TEST(ErrorTextTest, WhatIsMissingLeavesNoGap) {
    EXPECT_EQ(errorText(error("Stop", u"")), "Stop\n");
    EXPECT_EQ(errorText(error("", u"only text")), "only text\n");
    EXPECT_EQ(errorText({inCOMPILE_ERROR, u"", "", "", {}, {}, false}), "An error without a message (compile error)\n");
}

TEST(ErrorTextTest, AMessageOfSeveralLinesEndsInOneNewline) {
    EXPECT_EQ(errorText(error("E", u"one\ntwo\n")), "E: one\ntwo\n");
}

TEST(ErrorTextTest, LinesAreNumbersOfAnyKind) {
    EXPECT_EQ(errorText(error("E", u"", {{u"f", "", 2.5}})), "In \"f\", line 2.5\nE\n");
    EXPECT_EQ(errorText(error("E", u"", {{u"f", "", 1e300}})), "In \"f\", line 1e+300\nE\n");
}

TEST(ErrorTextTest, AHundredLevelsOfCausesAreShown) {
    RuntimeException chain = error("E", u"0");
    for (int i = 1; i < 100; ++i) {
        chain = error("E", u"x", {}, {std::move(chain)});
    }
    const std::string text = errorText(chain);
    EXPECT_EQ(text.substr(0, 5), "E: 0\n");
    EXPECT_EQ(text.substr(text.size() - 5), "E: x\n");
}

}  // namespace
}  // namespace krutil_client
