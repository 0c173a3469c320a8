// The text of an uncaught error, for a person.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace qvm_test {
namespace {

using krutil::io::PrintableErrorEvent;
using testing::Contains;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::Not;

class PrintedErrorTest : public testing::Test {
  protected:
    // The text of the one event of a request, whose error must be that of the reply.
    static std::string printed(const Evaluation& result) {
        std::string text;
        for (const Happening& each : result.events) {
            if (const auto* const event = dynamic_cast<const PrintableErrorEvent*>(each.event.get())) {
                EXPECT_EQ(text, "");
                EXPECT_EQ(event->getException(), *result.error);
                text = msg_svc::protobuf::ustring_to_utf8(event->getText());
            }
        }
        return text;
    }
    std::string printed(const std::string& code) { return printed(engine_.client.eval(code)); }

    EngineSession engine_;
};

TEST_F(PrintedErrorTest, IsWhatPythonPrintsAndComesAfterAllOutput) {
    const Evaluation result =
        engine_.client.eval("import os\nprint('out', end='')\nos.write(1, b'plain')\ndef f():\n    return 1 / 0\nf()");
    EXPECT_EQ(printed(result),
              "Traceback (most recent call last):\n"
              "  File \"<eval-1>\", line 6, in <module>\n"
              "    f()\n"
              "  File \"<eval-1>\", line 5, in f\n"
              "    return 1 / 0\n"
              "           ~~^~~\n"
              "ZeroDivisionError: division by zero\n");
    EXPECT_THAT(result.kinds(), ElementsAre("IIPStartedEvent", "TextBaseEvent", "PrintableErrorEvent",
                                            "IIPCompletedEvent", "LastIIPEvent"));
    EXPECT_EQ(engine_.client.backgroundText(), "plain");
}

TEST_F(PrintedErrorTest, CodeThatDoesNotCompileHasNoEngineFrames) {
    EXPECT_EQ(printed("x = (1,\n"),
              "  File \"<eval-1>\", line 1\n"
              "    x = (1,\n"
              "        ^\n"
              "SyntaxError: '(' was never closed\n");
}

TEST_F(PrintedErrorTest, CausesAndGroupsArePrinted) {
    EXPECT_EQ(printed("try:\n    1 / 0\nexcept ZeroDivisionError as e:\n    raise ValueError('v') from e"),
              "Traceback (most recent call last):\n"
              "  File \"<eval-1>\", line 2, in <module>\n"
              "    1 / 0\n"
              "    ~~^~~\n"
              "ZeroDivisionError: division by zero\n"
              "\n"
              "The above exception was the direct cause of the following exception:\n"
              "\n"
              "Traceback (most recent call last):\n"
              "  File \"<eval-1>\", line 4, in <module>\n"
              "    raise ValueError('v') from e\n"
              "ValueError: v\n");
    EXPECT_THAT(printed("raise ExceptionGroup('g', [ValueError(1), KeyError(2)])"), HasSubstr("| KeyError: 2\n"));
}

TEST_F(PrintedErrorTest, HostileErrorsArePrintedSomehow) {
    EXPECT_EQ(printed("class M(type):\n    @property\n    def __module__(cls): raise OSError\n"
                      "class E(Exception, metaclass=M): pass\nraise E('text')"),
              "__main__.E: text\n");
    EXPECT_THAT(printed("class F(Exception):\n    def __str__(self): 1 / 0\nraise F"),
                EndsWith("F: <exception str() failed>\n"));
    EXPECT_THAT(printed("a = ValueError('a')\nb = ValueError('b')\na.__cause__ = b\nb.__cause__ = a\nraise a"),
                EndsWith("ValueError: a\n"));
    const std::string large = printed("raise ValueError('x' * 50_000_000)");
    EXPECT_LT(large.size(), 1U << 20);
    EXPECT_THAT(large, EndsWith("\n... (the rest is left out)\n"));
    EXPECT_THAT(printed("def f(): f()\nf()"), EndsWith("RecursionError: maximum recursion depth exceeded\n"));
}

TEST_F(PrintedErrorTest, EndOfTheSessionIsNoneToPrint) {
    const Evaluation result = engine_.client.eval("raise SystemExit('bye')");
    EXPECT_EQ(result.errorText(), "bye");
    EXPECT_THAT(result.kinds(), Not(Contains("PrintableErrorEvent")));
}

TEST(PrintedErrorLimitTest, ReplyComesWhateverTheClientCanTake) {
    session::Limits limits;
    limits.taggedFrame = 4096;
    EngineSession engine({}, limits);
    const Evaluation result = engine.client.eval("raise ValueError('\\u20ac' * 100000) from KeyError('k' * 100000)");
    EXPECT_EQ(result.errorId(), "ValueError");
    EXPECT_THAT(result.kinds(), Contains("PrintableErrorEvent"));
}

}  // namespace
}  // namespace qvm_test
