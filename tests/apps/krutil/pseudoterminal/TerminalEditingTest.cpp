// What a person sees of a line that is being typed, whatever happens meanwhile.

#include <fstream>
#include <string>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::Not;

// What stands below the sentence about an engine that is lost.
const std::string lost = "krutil: what the session held is lost; Enter starts a new one, Ctrl-D leaves " + at;

class TerminalEditingTest : public TerminalReplTest {
  protected:
    // Begins, and has `code` evaluated whenever it happens from now on.
    void beginWaiting(const std::string& code) {
        begin();
        waitIn(code);
    }

    // The screen is empty then but for the prompt.
    void waitIn(const std::string& code) {
        evaluate(happening.thread(code));
        terminal->type(clearScreen);
        terminal->expectBottom({">>> " + at});
    }

    Happening happening{directory / "happening"};
};

TEST_F(TerminalEditingTest, TextThatArrivesIsShownAboveTheLine) {
    beginWaiting("print('tick')");
    terminal->type(std::string("1 + 40") + left);
    terminal->expectBottom({">>> 1 + 4" + at + "0"});
    happening.happen();
    terminal->expectBottom({"tick", ">>> 1 + 4" + at + "0"});
    happening.happen();
    terminal->expectBottom({"tick", "tick", ">>> 1 + 4" + at + "0"});
    terminal->type("1\r");
    terminal->expectBottom({"tick", "tick", ">>> 1 + 410", "411", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, ALineOverSeveralRowsIsShownAgainToo) {
    beginWaiting("print('tick')");
    const std::string number(150, '7');
    terminal->type(number);
    const std::vector<std::string> line{">>> " + number.substr(0, 96), number.substr(96) + at};
    terminal->expectBottom(line);
    happening.happen();
    terminal->expectBottom({"tick", line[0], line[1]});
    EXPECT_EQ(terminal->lines().size(), 3U) << "rows of the line as it was before are left";
    terminal->type("\r");
    terminal->expect(number + "\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalEditingTest, AnUnfinishedLineOfTextStandsBeforeThePrompt) {
    beginWaiting("print('tick', end='')");
    terminal->type("12");
    terminal->expectBottom({">>> 12" + at});
    happening.happen();
    terminal->expectBottom({"tick>>> 12" + at});
    happening.happen();
    terminal->expectBottom({"ticktick>>> 12" + at});
    terminal->type("3\r");
    terminal->expectBottom({"ticktick>>> 123", "123", ">>> " + at});
    evaluate("print('a', end='')");
    terminal->type(std::string("5") + left + "4");
    terminal->expectBottom({"a>>> 4" + at + "5"});
    leave("\x05\x15\x04");
}

TEST_F(TerminalEditingTest, TextThatMovesTheCursorIsLeftAlone) {
    beginWaiting("print('50%\\r60%', end='')");
    terminal->type("12");
    terminal->expectBottom({">>> 12" + at});
    happening.happen();
    terminal->expectBottom({"60%", ">>> 12" + at});
    terminal->type("\r");
    terminal->expectBottom({"60%", ">>> 12", "12", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, TextArrivesAtTheDebuggersPromptToo) {
    beginWaiting("print('tick')");
    evaluate("breakpoint()", "", "debug> ");
    terminal->type("6 * 7");
    terminal->expectBottom({"debug> 6 * 7" + at});
    happening.happen();
    terminal->expectBottom({"tick", "debug> 6 * 7" + at});
    terminal->type("\r");
    terminal->expectBottom({"tick", "debug> 6 * 7", "42", "debug> " + at});
    evaluate(":c");
    evaluate("import qvm; qvm.keyboard()", "", "keyboard> ");
    terminal->type(std::string("for i in range(2):\rprint(i)") + left);
    terminal->expectBottom({"keyboard> for i in range(2):", "... print(i" + at + ")"});
    happening.happen();
    terminal->expectBottom({"tick", "keyboard> for i in range(2):", "... print(i" + at + ")"});
    terminal->type("\x03");
    terminal->expectBottom({"... print(i)", "krutil: cancelled", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, TheQuestionOfTheCodeIsShownAgainWithWhatWasTyped) {
    beginWaiting("print('tick')");
    terminal->type("'hi ' + input('name? ')\r");
    terminal->expect("name? ");
    terminal->expect(editing);
    terminal->type("Ad");
    terminal->expectBottom({"name? Ad" + at});
    happening.happen();
    terminal->expectBottom({"tick", "name? Ad" + at});
    terminal->type("a\r");
    terminal->expectBottom({"tick", "name? Ada", "'hi Ada'", ">>> " + at});
    // Answers are no code.
    terminal->type(up);
    terminal->expectBottom({">>> 'hi ' + input('name? ')" + at});
    leave("\x15\x04");
}

TEST_F(TerminalEditingTest, TheQuestionsOfACommandToo) {
    terminal = std::make_unique<Terminal>(
        command({"eval", happening.thread("print('tick')") + "\n'hi ' + input('name? ')"}), environment());
    terminal->expect("name? ");
    terminal->expect(editing);
    terminal->type("Adx");
    terminal->expectBottom({"name? Adx" + at});
    happening.happen();
    terminal->expectBottom({"tick", "name? Adx" + at});
    terminal->type(std::string(backspace) + "a\r");
    terminal->expect("'hi Ada'\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
    EXPECT_FALSE(std::filesystem::exists(directory / "krutil"));
}

TEST_F(TerminalEditingTest, WhatIsTypedWhileCodeRunsIsTheNextLine) {
    begin();
    enter("print('wait', flush=True); line = open('" + (directory / "happening").string() + "').readline()");
    terminal->expect("wait\r\n");
    terminal->type("6 * 7");
    terminal->expectBottom({"wait", "6 * 7" + at});
    happening.happen();
    terminal->expectBottom({"wait", ">>> 6 * 7" + at});
    terminal->type("\r");
    terminal->expectBottom({">>> 6 * 7", "42", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, CtrlDThatIsTypedWhileCodeRunsEndsTheInput) {
    begin();
    enter("print('wait', flush=True); print(len(open('" + (directory / "happening").string() + "').readline()))");
    terminal->expect("wait\r\n");
    terminal->type("\x04");
    happening.happen();
    EXPECT_EQ(terminal->exitCode(), 0);
    terminal->expectBottom({"1", ">>>", at});
}

TEST_F(TerminalEditingTest, CtrlCLeavesTheWholeLineShown) {
    begin();
    terminal->type(std::string("half typed") + left + left);
    terminal->expectBottom({">>> half typ" + at + "ed"});
    terminal->type("\x03");
    terminal->expectBottom({">>> half typed^C", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, AnEngineThatGoesIsTalkedAboutAtOnce) {
    beginWaiting("os.kill(os.getpid(), signal.SIGKILL)");
    terminal->type("half typed");
    terminal->expectBottom({">>> half typed" + at});
    happening.happen();
    terminal->expectBottom(
        {">>> half typed", "krutil: the engine was killed by signal 9 (Killed) while it was idle", lost});
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 3);
}

TEST_F(TerminalEditingTest, WhatIsHalfTypedIsOfferedToTheNextSession) {
    beginWaiting("os.kill(os.getpid(), signal.SIGKILL)");
    terminal->type("dropped");
    terminal->expectBottom({">>> dropped" + at});
    terminal->type("\x03");
    terminal->expectBottom({">>> dropped^C", ">>> " + at});
    terminal->type("for i in range(2):\r");
    terminal->expectBottom({">>> for i in range(2):", "...     " + at});
    terminal->type(std::string("print(i") + left);
    terminal->expectBottom({">>> for i in range(2):", "...     print(" + at + "i"});
    happening.happen();
    terminal->expectBottom(
        {"...     print(i", "krutil: the engine was killed by signal 9 (Killed) while it was idle", lost});
    terminal->type("\r");
    terminal->expectBottom({">>> for i in range(2):", "...     print(i" + at});
    terminal->type(" + 41)\r\r");
    terminal->expectBottom({"41", "42", ">>> " + at});
    // Once, and nothing of what was dropped.
    terminal->type("7\r");
    terminal->expectBottom({">>> 7", "7", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, AnEngineThatGoesAtAQuestionIsTalkedAboutAtOnce) {
    for (const std::string question : {"input('name? ')", "breakpoint()"}) {
        Happening last(directory / ("happening" + std::to_string(question.size())));
        begin();
        evaluate(last.thread("os.kill(os.getpid(), signal.SIGKILL)"));
        enter(question);
        if (question != "breakpoint()") {
            terminal->expect("name? ");
        }
        terminal->expect(editing);
        terminal->type("half");
        terminal->expect("half");
        last.happen();
        terminal->expectBottom({std::string(question == "breakpoint()" ? "debug> " : "name? ") + "half",
                                "krutil: the engine was killed by signal 9 (Killed) before it answered", lost});
        terminal->type("\x04");
        EXPECT_EQ(terminal->exitCode(), 3);
    }
}

TEST_F(TerminalEditingTest, TheTerminalIsItsOldSelfAfterALostEngine) {
    beginWith(shell("before=$(stty -g); \"$KRUTIL\" repl --engine '" KRUTIL_ENGINE
                    " --stdio; exit 7'; echo code $?; test \"$before\" = \"$(stty -g)\" && echo same"));
    waitIn("os.kill(os.getpid(), signal.SIGKILL)");
    terminal->type("half typed");
    terminal->expectBottom({">>> half typed" + at});
    happening.happen();
    terminal->expectBottom({">>> half typed", "krutil: the engine exited with code 7 while it was idle", lost});
    terminal->type("\x04");
    terminal->expectBottom({lost.substr(0, lost.size() - at.size() - 1), "code 3", "same", at});
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalEditingTest, AnEngineWhoseStreamSomebodyElseHoldsIsLostToo) {
    // What holds it ends when the test does.
    const Happening end(directory / "end");
    begin({"repl", "--engine",
           "cat '" + (directory / "end").string() + "' 2>/dev/null & exec '" KRUTIL_ENGINE "' --stdio"});
    waitIn("os.kill(os.getpid(), signal.SIGKILL)");
    terminal->type("half typed");
    terminal->expectBottom({">>> half typed" + at});
    happening.happen();
    terminal->expectBottom(
        {">>> half typed", "krutil: the engine was killed by signal 9 (Killed) while it was idle", lost});
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 3);
}

TEST_F(TerminalEditingTest, ASignalThatEndsTheProgramLeavesTheTerminalAsItWas) {
    beginWith(
        shell("before=$(stty -g); \"$KRUTIL\" repl; echo code $?; test \"$before\" = \"$(stty -g)\" && echo same"));
    waitIn("os.kill(os.getppid(), signal.SIGTERM)");
    terminal->type("half typed");
    terminal->expectBottom({">>> half typed" + at});
    happening.happen();
    // Between the two the engine may say that its client has gone.
    terminal->expect("code 143\r\n");
    terminal->expect("same\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
}

// A shell with job control: it shows the terminal's mode when the job was stopped, and goes on with it after Enter.
std::string jobControl(const std::string& job) {
    return "set -m; before=$(stty -g); " + job +
           "; test \"$before\" = \"$(stty -g)\" && echo same; read enter; fg; echo left";
}

TEST_F(TerminalEditingTest, CtrlZStopsTheProgramAndLeavesTheTerminalAsItWas) {
    beginWith(shell(jobControl("\"$KRUTIL\" repl")));
    terminal->type(std::string("6 * 71") + left);
    terminal->expectBottom({">>> 6 * 7" + at + "1"});
    terminal->type("\x1a");
    terminal->expect("same\r\n");
    terminal->type("\r");
    terminal->expectBottom({">>> 6 * 7" + at + "1"});
    terminal->type("0\r");
    terminal->expect("4206\r\n");
    expectPrompt();
    terminal->type("\x04");
    terminal->expect("left");
    terminal->exitCode();
}

TEST_F(TerminalEditingTest, CtrlZWhileCodeRunsStopsBothPrograms) {
    beginWith(shell(jobControl("\"$KRUTIL\" repl")));
    evaluate("import signal, time; signal.signal(signal.SIGCONT, lambda *_: print('goes ' + 'on', flush=True))");
    enter("print('run' + 'ning', flush=True); [time.sleep(0.01) for i in range(10 ** 6)]");
    terminal->expect("running\r\n");
    terminal->type("\x1a");
    terminal->expect("same\r\n");
    terminal->type("\r");
    terminal->expect("goes on\r\n");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled");
    expectPrompt();
    terminal->type("\x04");
    terminal->expect("left");
    terminal->exitCode();
}

TEST_F(TerminalEditingTest, WhereNobodyCanContinueItCtrlZChangesNothing) {
    begin();
    terminal->type("6 * 7");
    terminal->expectBottom({">>> 6 * 7" + at});
    terminal->type("\x1a");
    terminal->type("1\r");
    terminal->expect("426\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalEditingTest, AnotherSizeOfTheTerminalIsNoticedAtOnce) {
    begin();
    terminal->type(clearScreen);
    terminal->expectBottom({">>> " + at});
    const std::string number(60, '7');
    terminal->type(number + left);
    terminal->expectBottom({">>> " + number.substr(1) + at + "7"});
    const auto resize = [this](unsigned short columns, unsigned short rows, const std::vector<std::string>& lines) {
        terminal->resize(columns, rows);
        terminal->expect("\x1b[J");
        terminal->expectBottom(lines);
        EXPECT_EQ(terminal->lines().size(), lines.size());
    };
    resize(40, 24, {">>> " + number.substr(0, 36), number.substr(36, 23) + at + "7"});
    resize(30, 10, {">>> " + number.substr(0, 26), number.substr(0, 30), "777" + at + "7"});
    terminal->type("8");
    terminal->expectBottom({">>> " + number.substr(0, 26), number.substr(0, 30), "7778" + at + "7"});
    resize(120, 24, {">>> " + number.substr(1) + "8" + at + "7"});
    leave("\x05\x15\x04");
}

TEST_F(TerminalEditingTest, CharactersOfAnyWidthAreShownAndEdited) {
    begin();
    // One column each, two columns each, and one with a mark of its own.
    terminal->type("'\u00e4\u4e2d\U0001f600e\u0301x'");
    terminal->expectBottom({">>> '\u00e4\u4e2d\U0001f600e\u0301x'" + at});
    terminal->type(std::string(left) + left + left);
    terminal->expectBottom({">>> '\u00e4\u4e2d\U0001f600" + at + "e\u0301x'"});
    terminal->type("1");
    terminal->expectBottom({">>> '\u00e4\u4e2d\U0001f6001" + at + "e\u0301x'"});
    terminal->type(std::string(right) + "2");
    terminal->expectBottom({">>> '\u00e4\u4e2d\U0001f6001e\u03012" + at + "x'"});
    terminal->type(std::string(left) + left + left + backspace);
    terminal->expectBottom({">>> '\u00e4\u4e2d" + at + "1e\u03012x'"});
    terminal->type("\r");
    terminal->expectBottom({">>> '\u00e4\u4e2d1e\u03012x'", "'\u00e4\u4e2d1e\u03012x'", ">>> " + at});
    leave();
}

TEST_F(TerminalEditingTest, PastedLinesThatTheTerminalDoesNotMarkAreTyped) {
    begin();
    terminal->type("x = 1\rx + 1\rfor i in range(2):\r    print('i', i)\r\r'e' + 'nd'\r");
    terminal->expectBottom({"...", "i 0", "i 1", ">>> 'e' + 'nd'", "'end'", ">>> " + at});
    EXPECT_THAT(terminal->lines(), Contains("2"));
    leave();
}

TEST_F(TerminalEditingTest, AVeryLongLineIsALine) {
    begin();
    const std::string line = "len('" + std::string(65536, 'a') + "')";
    terminal->type(line);
    terminal->expectScreen("the end of the line", [&](const auto& lines) {
        return lines.back().size() > at.size() + 2 &&
               lines.back().substr(lines.back().size() - at.size() - 2) == "')" + at;
    });
    terminal->type(std::string(lineBegin) + "1 + ");
    terminal->expectScreen("the beginning of the line", [&](const auto& lines) {
        return lines[lines.size() - Terminal::rows] == ">>> 1 + " + at + line.substr(0, Terminal::columns - 8);
    });
    terminal->type("\r");
    terminal->expect("65537\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalEditingTest, TwoAtOnceKeepTheLinesOfBoth) {
    begin();
    Terminal other(command({"repl"}), environment());
    other.expect(">>> ");
    evaluate("'one of the first'");
    other.type("'one of the second'\r");
    other.expect("'one of the second'\r\n");
    other.expect(">>> ");
    evaluate("'another of the first'");
    other.type("\x04");
    EXPECT_EQ(other.exitCode(), 0);
    leave();
    begin();
    terminal->type(up);
    terminal->expectBottom({">>> 'another of the first'" + at});
    terminal->type(up);
    terminal->expectBottom({">>> 'one of the second'" + at});
    terminal->type(up);
    terminal->expectBottom({">>> 'one of the first'" + at});
    leave("\x15\x04");
}

TEST_F(TerminalEditingTest, ATerminalThatKnowsNoSequencesGetsNone) {
    terminal = std::make_unique<Terminal>(std::vector<std::string>{"/usr/bin/env", "TERM=dumb", KRUTIL_CLIENT, "repl"},
                                          environment());
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("\x1b")));
}

}  // namespace
}  // namespace krutil_client
