// The client and an engine as a person at a terminal meets them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

TEST_F(TerminalTest, EvalShowsWhatTheCodePrintsAndItsValue) {
    Terminal terminal(command({"eval", "print('hel' + 'lo')\n6 * 7"}), environment());
    terminal.expect("hello\r\n");
    terminal.expect("42\r\n");
    EXPECT_EQ(terminal.exitCode(), 0);
}

TEST_F(TerminalTest, AnErrorIsShownOnce) {
    Terminal terminal(command({"eval", "1 / 0"}), environment());
    terminal.expect("ZeroDivisionError: division by zero\r\n");
    EXPECT_EQ(terminal.exitCode(), 1);
    const auto first = terminal.sent().find("ZeroDivisionError");
    EXPECT_EQ(terminal.sent().find("ZeroDivisionError", first + 1), std::string::npos) << terminal.sent();
}

TEST_F(TerminalTest, CtrlCCancelsWhatRuns) {
    Terminal terminal(command({"eval", "print('ready')\nwhile True: pass"}), environment());
    terminal.expect("ready");
    terminal.type("\x03");
    terminal.expect("krutil: cancelled\r\n");
    EXPECT_EQ(terminal.exitCode(), 6);
}

TEST_F(TerminalTest, TheSecondCtrlCKillsTheEngine) {
    Terminal terminal(command({"eval",
                               "while True:\n"
                               "  try:\n"
                               "    print('ready')\n"
                               "    while True: pass\n"
                               "  except KeyboardInterrupt: print('caught')\n"}),
                      environment());
    terminal.expect("ready");
    terminal.type("\x03");
    terminal.expect("caught");
    terminal.type("\x03");
    terminal.expect("krutil: cancelled; the engine was killed\r\n");
    EXPECT_EQ(terminal.exitCode(), 6);
}

TEST_F(TerminalTest, InputReadsALine) {
    Terminal terminal(command({"eval", "print('hi ' + input('name? '))"}), environment());
    terminal.expect("name? ");
    terminal.type("Ada\r");
    terminal.expect("hi Ada\r\n");
    EXPECT_EQ(terminal.exitCode(), 0);
}

TEST_F(TerminalTest, CtrlDEndsTheInput) {
    Terminal terminal(command({"eval", "input('name? ')"}), environment());
    terminal.expect("name? ");
    terminal.type("\x04");
    terminal.expect("EOFError");
    EXPECT_EQ(terminal.exitCode(), 1);
}

TEST_F(TerminalTest, CtrlCCancelsCodeThatWaitsForInput) {
    Terminal terminal(command({"eval", "input('name? ')"}), environment());
    terminal.expect("name? ");
    terminal.type("\x03");
    terminal.expect("krutil: cancelled\r\n");
    EXPECT_EQ(terminal.exitCode(), 6);
}

TEST_F(TerminalTest, BreakpointOpensADebugPromptInTheStoppedFrame) {
    Terminal terminal(command({"eval", "def f(x):\n  breakpoint()\n  print('x is', x)\nf(41)"}), environment());
    terminal.expect("Stopped in f (");
    terminal.expect("debug> ");
    terminal.type("x = x + 1\r");
    terminal.expect("debug> ");
    terminal.type("x + 100\r");
    terminal.expect("142\r\n");
    terminal.expect("debug> ");
    terminal.type(":c\r");
    terminal.expect("x is 42\r\n");
    EXPECT_EQ(terminal.exitCode(), 0);
}

TEST_F(TerminalTest, TheDebuggersQuitEndsTheRequest) {
    Terminal terminal(command({"eval", "breakpoint()\nprint('never' + ' here')"}), environment());
    terminal.expect("debug> ");
    terminal.type(":q\r");
    terminal.expect("krutil: the debugger was left with quit\r\n");
    EXPECT_EQ(terminal.exitCode(), 1);
    EXPECT_THAT(terminal.sent(), Not(HasSubstr("never here")));
}

TEST_F(TerminalTest, KeyboardAndPauseAskToo) {
    Terminal terminal(command({"eval", "import qvm\ny = 1\nqvm.keyboard()\nqvm.pause()\nprint('y is', y)"}),
                      environment());
    terminal.expect("keyboard> ");
    terminal.type("y = 2\r");
    terminal.expect("keyboard> ");
    terminal.type(":c\r");
    terminal.expect("Paused; press Enter to go on ");
    terminal.type("\r");
    terminal.expect("y is 2\r\n");
    EXPECT_EQ(terminal.exitCode(), 0);
}

TEST_F(TerminalTest, RunGivesAProgramItsArguments) {
    const auto file = directory / "program.py";
    std::ofstream(file) << "from __future__ import annotations\n"
                           "import sys\n"
                           "print(sys.argv[1:], len(sys.argv[0]) > 0)\n"
                           "raise SystemExit(3)\n";
    Terminal terminal(command({"run", file.string(), "a", "\u00e4 \"b\"\\"}), environment());
    terminal.expect("['a', '\u00e4 \"b\"\\\\'] True\r\n");
    EXPECT_EQ(terminal.exitCode(), 1);
}

TEST_F(TerminalTest, ErrorsAndWarningsAreToldApartByColour) {
    const std::string code =
        "import sys, warnings\nwarnings.warn('careful')\nsys.stderr.write('bad\\n')\nprint('good')";
    Terminal colored(command({"eval", code}), environment(""));
    EXPECT_EQ(colored.exitCode(), 0);
    EXPECT_THAT(colored.sent(), HasSubstr("\x1b[33mWarning: careful (UserWarning)\r\n\x1b[0m"));
    EXPECT_THAT(colored.sent(), HasSubstr("\x1b[31mbad\r\n\x1b[0m"));
    EXPECT_THAT(colored.sent(), HasSubstr("\x1b[0mgood\r\n"));
    Terminal plain(command({"eval", code}), environment("1"));
    EXPECT_EQ(plain.exitCode(), 0);
    EXPECT_THAT(plain.sent(), Not(HasSubstr("\x1b")));
    Terminal always(command({"eval", "--color", "always", code}), environment("1"));
    EXPECT_EQ(always.exitCode(), 0);
    EXPECT_THAT(always.sent(), HasSubstr("\x1b[31mbad\r\n\x1b[0m"));
    Terminal never(command({"eval", "--color", "never", code}), environment(""));
    EXPECT_EQ(never.exitCode(), 0);
    EXPECT_THAT(never.sent(), Not(HasSubstr("\x1b")));
}

TEST_F(TerminalReplTest, LinesAreEvaluatedInOneSession) {
    begin({});
    evaluate("x = 41");
    evaluate("x + 1", "42\r\n");
    evaluate("1 / 0", "ZeroDivisionError: division by zero\r\n");
    evaluate("'still ' + 'here'", "'still here'\r\n");
    leave();
}

TEST_F(TerminalReplTest, ABlockEndsWithAnEmptyLine) {
    begin();
    evaluate("for i in range(2):", "", "... ");
    evaluate("    print('i', i)", "", "... ");
    terminal->type("\r");
    terminal->expect("i 0\r\ni 1\r\n");
    expectPrompt();
    leave(":quit\r");
}

TEST_F(TerminalReplTest, CtrlCAtThePromptDropsWhatHasBeenTyped) {
    begin();
    terminal->type("garbage");
    terminal->expect("garbage");
    terminal->type("\x03");
    terminal->expect("^C");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave(":quit\r");
}

TEST_F(TerminalReplTest, CtrlCCancelsWhatRunsAndTheSessionGoesOn) {
    begin();
    enter("print('rea' + 'dy'); import time; time.sleep(1000)");
    terminal->expect("ready");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave(":quit\r");
}

TEST_F(TerminalReplTest, TheDebuggerCanBeSwitchedOff) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    evaluate(":c");
    evaluate(":debugger off");
    evaluate("breakpoint()", "Warning: breakpoint() goes on");
    evaluate(":debugger on");
    evaluate("breakpoint()", "", "debug> ");
    evaluate(":q", "krutil: the debugger was left with quit\r\n");
    leave();
}

TEST_F(TerminalReplTest, InputIsReadBetweenLines) {
    begin();
    enter("'hi ' + input('name? ')");
    terminal->expect("name? ");
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalReplTest, TimingIsShownOnDemand) {
    begin();
    evaluate(":timing on");
    evaluate("1", "answered after ");
    evaluate(":timing off");
    evaluate(":help", ":debugger on|off");
    // Eighty columns are enough for it.
    evaluate(":help", "runs; a second one within two\r\nseconds ends the engine.");
    evaluate(":timing", "Write ':timing on' or ':timing off'.\r\n");
    evaluate(":debugger", "Write ':debugger on' or ':debugger off'.\r\n");
    evaluate(":nonsense", "There is no command ':nonsense'; :help lists them.\r\n");
    leave(":quit\r");
}

TEST_F(TerminalReplTest, TheHistoryIsKeptForItsOwnerOnly) {
    begin();
    evaluate("'\u00e4' + 'mber'", "'\u00e4mber'\r\n");
    leave(":quit\r");
    struct stat status {};
    ASSERT_EQ(::stat((directory / "krutil/history").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
    begin();
    // The line before last, with the cursor keys.
    terminal->type("\x1b[A\x1b[A\r");
    terminal->expect("'\u00e4mber'\r\n");
    expectPrompt();
    leave();
}

TEST_F(TerminalReplTest, AHistoryThatMayBeAnotherUsersIsNotUsedAndSaid) {
    std::filesystem::create_directory(directory / "krutil");
    std::ofstream(directory / "elsewhere") << "precious\n";
    std::filesystem::create_hard_link(directory / "elsewhere", directory / "krutil/history");
    begin();
    EXPECT_THAT(terminal->sent(),
                HasSubstr("krutil: the history '" + (directory / "krutil/history").string() +
                          "' is not used: the file has 2 names; move it away, or use --no-history\r\n"));
    evaluate("6 * 7", "42\r\n");
    leave();
    EXPECT_EQ(std::filesystem::file_size(directory / "elsewhere"), 9U);
}

TEST_F(TerminalReplTest, WithoutHistoryNothingIsKept) {
    begin({"repl", "--no-history"});
    evaluate("1");
    leave();
    EXPECT_FALSE(std::filesystem::exists(directory / "krutil"));
}

TEST_F(TerminalReplTest, LinesThatComeFromNoTerminalAreReadPlainly) {
    const std::string lines = R"(def f(x):\n  return x + 1\n\nf(41)\ninput()\n1 / 0)";
    terminal = std::make_unique<Terminal>(
        std::vector<std::string>{"/bin/sh", "-c", "printf '" + lines + "' | " + KRUTIL_CLIENT}, environment());
    terminal->expect("42\r\n");
    terminal->expect("EOFError");
    terminal->expect("ZeroDivisionError: division by zero\r\n");
    EXPECT_EQ(terminal->exitCode(), 1);
    EXPECT_THAT(terminal->sent(), Not(HasSubstr(">>>")));
    EXPECT_FALSE(std::filesystem::exists(directory / "krutil"));
}

TEST_F(TerminalReplTest, SystemExitEndsTheSession) {
    begin();
    enter("raise SystemExit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

}  // namespace
}  // namespace krutil_client
