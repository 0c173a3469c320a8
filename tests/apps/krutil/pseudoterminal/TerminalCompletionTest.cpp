// Names that the engine completes while a person types.

#include <fstream>
#include <iterator>
#include <string>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class TerminalCompletionTest : public TerminalReplTest {
  protected:
    static constexpr const char* tab = "\t";

    // Nothing but a prompt is on the screen then.
    void beginEmpty(const std::string& code, const std::vector<std::string>& arguments = {"repl"}) {
        begin(arguments);
        evaluate(code);
        terminal->type(clearScreen);
        terminal->expectBottom({">>> " + at});
    }
};

TEST_F(TerminalCompletionTest, TabCompletesWhatIsUnambiguous) {
    beginEmpty("import os; alphabet = 'abc'");
    terminal->type(std::string("len(alph") + tab);
    terminal->expectBottom({">>> len(alphabet" + at});
    terminal->type(std::string(".upp") + tab + "())\r");
    terminal->expectBottom({">>> len(alphabet.upper())", "3", ">>> " + at});
    // Before what stands behind the cursor, and behind characters of any width.
    terminal->type(std::string("'\U0001f600' + alph + 'd'") + std::string(left) + left + left + left + left + left +
                   tab);
    terminal->expectBottom({">>> '\U0001f600' + alphabet" + at + " + 'd'"});
    leave("\x05\x15\x04");
}

TEST_F(TerminalCompletionTest, ASecondTabLists) {
    beginEmpty("class Shape: width_min = 1; width_max = 2; height = 3");
    terminal->type(std::string("Shape.wi") + tab);
    terminal->expectBottom({">>> Shape.width_m" + at});
    terminal->type(tab);
    terminal->expectBottom({"width_max  width_min", ">>> Shape.width_m" + at});
    terminal->type(std::string("a") + tab + "\r");
    terminal->expectBottom({">>> Shape.width_max", "2", ">>> " + at});
    leave();
}

TEST_F(TerminalCompletionTest, WhatHasNoCompletionRings) {
    beginEmpty("x = 1");
    terminal->type(std::string("nosuchname") + tab);
    terminal->expect("\a");
    terminal->type(std::string("(1") + left + left);
    terminal->expectBottom({">>> nosuchname" + at + "(1"});
    leave("\x05\x15\x04");
}

TEST_F(TerminalCompletionTest, NamesOfTheStoppedFrameAreCompletedAtTheDebugger) {
    begin();
    terminal->type(std::string(pasteBegin) + "def stop(argument_of_it):\r    breakpoint()\r" + pasteEnd + "\r");
    expectPrompt();
    evaluate("stop(42)", "", "debug> ");
    terminal->type(std::string("argument_") + tab + "\r");
    terminal->expectBottom({"debug> argument_of_it", "42", "debug> " + at});
    evaluate(":c");
    leave();
}

TEST_F(TerminalCompletionTest, ACompletionIsSeenInTheTraceOnly) {
    const std::string trace = (directory / "trace").string();
    beginEmpty("alphabet = 'abc'", {"repl", "--timing", "--trace-to", trace});
    terminal->type(std::string("alph") + tab);
    terminal->expectBottom({">>> alphabet" + at});
    EXPECT_EQ(terminal->lines().size(), 1U);
    terminal->type("\x15");
    evaluate(":queue", "Nothing runs, and nothing waits.\r\n");
    leave();
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("complete")));
    std::ifstream file(trace);
    const std::string text((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    EXPECT_THAT(text, HasSubstr("krutil:FEvalIIP"));
}

TEST_F(TerminalCompletionTest, AnEngineThatCannotCompleteIsAskedOnce) {
    const std::string asked = (directory / "asked").string();
    beginEmpty("import qvm; qvm.complete = lambda *arguments: [open('" + asked + "', 'a').write('.'), 1 / 0]");
    terminal->type(std::string("alph") + tab + tab);
    terminal->expectBottom({">>> alph        " + at});
    terminal->type("\x15\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("ZeroDivisionError")));
    std::ifstream file(asked);
    EXPECT_EQ(std::string((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>()), ".");
}

TEST_F(TerminalCompletionTest, AnEngineThatAnswersNonsenseIsNotAskedAgain) {
    beginEmpty("import qvm; qvm.complete = lambda text, cursor: (3, 99, 'alphabet')");
    terminal->type(std::string("alph") + tab);
    terminal->expectBottom({">>> alph    " + at});
    leave("\x15\x04");
}

TEST_F(TerminalCompletionTest, ACompletionThatTakesTooLongIsGivenUp) {
    beginEmpty("import qvm, time; qvm.complete = lambda *arguments: time.sleep(1000)");
    terminal->type(std::string("alph") + tab);
    terminal->expect("\a");
    terminal->type(std::string(backspace) + backspace + backspace + backspace + "6 * 7\r");
    terminal->expectBottom({">>> 6 * 7", "42", ">>> " + at});
    leave();
}

// The file is closed before the wait: what a file that nobody holds meets when it closes, Python keeps to itself.
TEST_F(TerminalCompletionTest, CtrlCEndsTheWaitingForACompletion) {
    const Happening asked(directory / "asked");
    beginEmpty("import qvm; qvm.complete = lambda *arguments: [__import__('pathlib').Path('" +
               (directory / "asked").string() + "').write_text('asked\\n'), __import__('time').sleep(1000)]");
    terminal->type(std::string("alph") + tab);
    asked.await();
    terminal->type("\x03");
    terminal->expectBottom({">>> alph^C", ">>> " + at});
    evaluate("6 * 7", "42\r\n");
    leave();
}

}  // namespace
}  // namespace krutil_client
