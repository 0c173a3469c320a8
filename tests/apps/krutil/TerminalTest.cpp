// The client and an engine as a person at a terminal meets them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "Terminal.hpp"

namespace client {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

class TerminalTest : public ::testing::Test {
  protected:
    TerminalTest() {
        std::string name = (std::filesystem::temp_directory_path() / "krutil-terminal-XXXXXX").string();
        if (::mkdtemp(name.data()) == nullptr) {
            throw std::runtime_error("no directory for the test's files");
        }
        directory = name;
    }
    ~TerminalTest() override { std::filesystem::remove_all(directory); }

    std::vector<std::pair<std::string, std::string>> environment(const std::string& noColor = "1") const {
        return {{"TERM", "xterm"}, {"XDG_STATE_HOME", directory.string()}, {"NO_COLOR", noColor}};
    }

    std::vector<std::string> command(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin(), KRUTIL_CLIENT);
        return arguments;
    }

    std::filesystem::path directory;
};

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
    const auto first = terminal.screen().find("ZeroDivisionError");
    EXPECT_EQ(terminal.screen().find("ZeroDivisionError", first + 1), std::string::npos) << terminal.screen();
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
    EXPECT_THAT(terminal.screen(), Not(HasSubstr("never here")));
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
    EXPECT_THAT(colored.screen(), HasSubstr("\x1b[33mWarning: careful (UserWarning)\r\n\x1b[0m"));
    EXPECT_THAT(colored.screen(), HasSubstr("\x1b[31mbad\r\n\x1b[0m"));
    EXPECT_THAT(colored.screen(), HasSubstr("\x1b[0mgood\r\n"));
    Terminal plain(command({"eval", code}), environment("1"));
    EXPECT_EQ(plain.exitCode(), 0);
    EXPECT_THAT(plain.screen(), Not(HasSubstr("\x1b")));
    Terminal always(command({"eval", "--color", "always", code}), environment("1"));
    EXPECT_EQ(always.exitCode(), 0);
    EXPECT_THAT(always.screen(), HasSubstr("\x1b[31mbad\r\n\x1b[0m"));
    Terminal never(command({"eval", "--color", "never", code}), environment(""));
    EXPECT_EQ(never.exitCode(), 0);
    EXPECT_THAT(never.screen(), Not(HasSubstr("\x1b")));
}

class TerminalReplTest : public TerminalTest {
  protected:
    void expectPrompt() { terminal->expect(">>> "); }

    void begin(const std::vector<std::string>& arguments = {"repl"}) {
        terminal = std::make_unique<Terminal>(command(arguments), environment());
        expectPrompt();
    }

    // A line whose end on the screen is waited for, so that what follows is what came of it.
    void enter(const std::string& line) {
        terminal->type(line);
        terminal->expect(line);
        terminal->type("\r");
        terminal->expect("\r\n");
    }

    std::unique_ptr<Terminal> terminal;
};

TEST_F(TerminalReplTest, LinesAreEvaluatedInOneSession) {
    begin({});
    enter("x = 41");
    expectPrompt();
    enter("x + 1");
    terminal->expect("42\r\n");
    expectPrompt();
    enter("1 / 0");
    terminal->expect("ZeroDivisionError: division by zero\r\n");
    expectPrompt();
    enter("'still ' + 'here'");
    terminal->expect("'still here'\r\n");
    expectPrompt();
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, ABlockEndsWithAnEmptyLine) {
    begin();
    enter("for i in range(2):");
    terminal->expect("... ");
    enter("    print('i', i)");
    terminal->expect("... ");
    terminal->type("\r");
    terminal->expect("i 0\r\ni 1\r\n");
    expectPrompt();
    enter(":quit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, CtrlCAtThePromptDropsWhatHasBeenTyped) {
    begin();
    terminal->type("garbage");
    terminal->expect("garbage");
    terminal->type("\x03");
    terminal->expect("^C");
    expectPrompt();
    enter("6 * 7");
    terminal->expect("42\r\n");
    expectPrompt();
    enter(":quit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, CtrlCCancelsWhatRunsAndTheSessionGoesOn) {
    begin();
    enter("print('rea' + 'dy'); import time; time.sleep(1000)");
    terminal->expect("ready");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    expectPrompt();
    enter("6 * 7");
    terminal->expect("42\r\n");
    expectPrompt();
    enter(":quit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, TheDebuggerCanBeSwitchedOff) {
    begin();
    enter("breakpoint()");
    terminal->expect("debug> ");
    enter(":c");
    expectPrompt();
    enter(":debugger off");
    expectPrompt();
    enter("breakpoint()");
    terminal->expect("Warning: breakpoint() goes on");
    expectPrompt();
    enter(":debugger on");
    expectPrompt();
    enter("breakpoint()");
    terminal->expect("debug> ");
    enter(":q");
    terminal->expect("krutil: the debugger was left with quit\r\n");
    expectPrompt();
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, InputIsReadBetweenLines) {
    begin();
    enter("'hi ' + input('name? ')");
    terminal->expect("name? ");
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, TimingIsShownOnDemand) {
    begin();
    enter(":timing on");
    expectPrompt();
    enter("1");
    terminal->expect("answered after ");
    expectPrompt();
    enter(":timing off");
    expectPrompt();
    enter(":help");
    terminal->expect(":debugger on|off");
    expectPrompt();
    enter(":nonsense");
    terminal->expect("There is no command ':nonsense'; :help lists them.\r\n");
    expectPrompt();
    enter(":quit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, TheHistoryIsKeptForItsOwnerOnly) {
    begin();
    enter("'\u00e4' + 'mber'");
    terminal->expect("'\u00e4mber'\r\n");
    expectPrompt();
    enter(":quit");
    EXPECT_EQ(terminal->exitCode(), 0);
    struct stat status {};
    ASSERT_EQ(::stat((directory / "krutil/history").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
    begin();
    // The line before last, with the cursor keys.
    terminal->type("\x1b[A\x1b[A\r");
    terminal->expect("'\u00e4mber'\r\n");
    expectPrompt();
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalReplTest, WithoutHistoryNothingIsKept) {
    begin({"repl", "--no-history"});
    enter("1");
    expectPrompt();
    terminal->type("\x04");
    EXPECT_EQ(terminal->exitCode(), 0);
    EXPECT_FALSE(std::filesystem::exists(directory / "krutil"));
}

TEST_F(TerminalReplTest, AnEngineThatIsKilledAtThePromptIsTalkedAbout) {
    begin();
    enter("import os, signal, threading");
    expectPrompt();
    enter("threading.Timer(0.2, os.kill, (os.getpid(), signal.SIGKILL)).start()");
    terminal->expect("krutil: the engine was killed by signal 9 (Killed) while it was idle\r\n");
    EXPECT_EQ(terminal->exitCode(), 3);
}

TEST_F(TerminalReplTest, LinesThatComeFromNoTerminalAreReadPlainly) {
    const std::string lines = R"(def f(x):\n  return x + 1\n\nf(41)\ninput()\n1 / 0)";
    terminal = std::make_unique<Terminal>(
        std::vector<std::string>{"/bin/sh", "-c", "printf '" + lines + "' | " + KRUTIL_CLIENT}, environment());
    terminal->expect("42\r\n");
    terminal->expect("EOFError");
    terminal->expect("ZeroDivisionError: division by zero\r\n");
    EXPECT_EQ(terminal->exitCode(), 1);
    EXPECT_THAT(terminal->screen(), Not(HasSubstr(">>>")));
    EXPECT_FALSE(std::filesystem::exists(directory / "krutil"));
}

TEST_F(TerminalReplTest, SystemExitEndsTheSession) {
    begin();
    enter("raise SystemExit");
    EXPECT_EQ(terminal->exitCode(), 0);
}

}  // namespace
}  // namespace client
