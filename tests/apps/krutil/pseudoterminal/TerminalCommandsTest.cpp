// What a person types in the line editor besides code.

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"

namespace krutil_client {
namespace {

using ::testing::ElementsAre;
using ::testing::MatchesRegex;

class TerminalCommandsTest : public TerminalReplTest {};

TEST_F(TerminalCommandsTest, ALineSaysWhatIsAtTheOtherEnd) {
    begin();
    EXPECT_THAT(
        terminal->lines(),
        ElementsAre(MatchesRegex("krutil-qvm [0-9.]+, Python 3[0-9.]+; :help tells what to type, Ctrl-D leaves"),
                    ">>> " + at));
    leave();
}

TEST_F(TerminalCommandsTest, AQuestionMarkAsksAboutAName) {
    begin();
    evaluate("import qvm; qvm.inspect = lambda text, cursor: f'<{text} {cursor}>' if text != 'x' else ''");
    evaluate("?str.join", "<str.join 8>\r\n");
    evaluate("str.join?", "<str.join 8>\r\n");
    evaluate(" str.join ??", "<str.join 8>\r\n");
    evaluate("?x", "There is nothing to tell about 'x'.\r\n");
    evaluate("?", "?NAME tells about a name, for example ?print or ?str.join.\r\n");
    evaluate("1 + 1 ?", "SyntaxError");
    evaluate("qvm.inspect = 7");
    evaluate("?x", "The engine cannot tell about names.\r\n");
    evaluate("breakpoint()", "", "debug> ");
    evaluate("?x", "The engine cannot tell about names.\r\n", "debug> ");
    evaluate(":c");
    leave();
}

TEST_F(TerminalCommandsTest, AShellsCommandIsShownAsPython) {
    begin();
    evaluate("!ls -l \"a b\"", "    import subprocess; subprocess.run(\"ls -l \\\"a b\\\"\", shell=True)\r\n");
    leave();
}

TEST_F(TerminalCommandsTest, WordsAreCommandsOfTheDebugger) {
    begin();
    // What each of them calls.
    evaluate(
        "import qvm; stepped = lambda word: lambda: [print('did', word), qvm.dbcont()]; "
        "qvm.next, qvm.step = stepped('next'), stepped('step')");
    evaluate(
        "told = lambda word: lambda: print('told', word); "
        "qvm.up, qvm.down, qvm.list, qvm.where, qvm.full = map(told, ['up', 'down', 'list', 'where', 'full'])");
    evaluate("n = 41; p = 5; breakpoint()", "", "debug> ");
    evaluate("p n", "41\r\n", "debug> ");
    evaluate("n + 1", "42\r\n", "debug> ");
    evaluate("p - 1", "4\r\n", "debug> ");
    evaluate("p if n else 0", "5\r\n", "debug> ");
    for (const std::string word : {"up", "down", "list", "where"}) {
        evaluate(word.substr(0, 1), "told " + word + "\r\n", "debug> ");
    }
    evaluate(":full", "told full\r\n", "debug> ");
    evaluate(":help", "  p NAME            show a variable, also one with the name of a command\r\n", "debug> ");
    evaluate("n", "did next\r\n");
    evaluate("breakpoint()", "", "debug> ");
    evaluate("s", "did step\r\n");
    evaluate(":full", "told full\r\n");
    // Elsewhere they are names.
    evaluate("n", "41\r\n");
    evaluate("qvm.keyboard()", "", "keyboard> ");
    evaluate("n", "41\r\n", "keyboard> ");
    evaluate(":full", "told full\r\n", "keyboard> ");
    evaluate(":c");
    leave();
}

TEST_F(TerminalCommandsTest, TheEngineTellsAboutNames) {
    begin();
    evaluate("?str.join", "Concatenate any number of strings.");
    evaluate("qvm = 'taken'");
    evaluate("str.join?", "Concatenate any number of strings.");
    leave();
}

TEST_F(TerminalCommandsTest, CodeIsSteppedThrough) {
    begin();
    terminal->type(std::string(pasteBegin) +
                   "def inner(n):\r    k = n + 1\r    return k\r\r"
                   "def outer(n):\r    breakpoint()\r    m = inner(n)\r    return m\r" +
                   pasteEnd + "\r");
    expectPrompt();
    evaluate("qvm = 'taken'; outer(41)", "    breakpoint()\r\n", "debug> ");
    evaluate("n", "    m = inner(n)\r\n", "debug> ");
    evaluate("s", "    k = n + 1\r\n", "debug> ");
    evaluate("n", "    return k\r\n", "debug> ");
    evaluate("k", "42\r\n", "debug> ");
    evaluate("u", "", "debug> ");
    evaluate("k", "NameError", "debug> ");
    evaluate("p n", "41\r\n", "debug> ");
    evaluate("l", "m = inner(n)", "debug> ");
    evaluate("w", "inner", "debug> ");
    evaluate("d", "", "debug> ");
    evaluate("k", "42\r\n", "debug> ");
    evaluate(":c", "42\r\n");
    leave();
}

TEST_F(TerminalCommandsTest, LongValuesAreCutInTheLineEditorOnly) {
    begin();
    evaluate("list(range(1200))", "... 200 more");
    evaluate(":full", "1199]\r\n");
    evaluate("print(list(range(1200)))", "1199]\r\n");
    leave();
    Terminal eval(command({"eval", "list(range(1200))"}), environment());
    eval.expect("1199]\r\n");
    EXPECT_EQ(eval.exitCode(), 0);
}

TEST_F(TerminalCommandsTest, ANewSessionBeginsOnRequest) {
    begin({"repl", "--no-history"});
    evaluate("x = 41");
    evaluate(":restart", "krutil: a new session; what the last one held is gone\r\n");
    evaluate("x", "NameError: name 'x' is not defined");
    terminal->type(std::string(up) + up + up);
    terminal->expectBottom({">>> x = 41" + at});
    leave("\x15\x04");
}

TEST_F(TerminalCommandsTest, ANewSessionDoesNotWaitForWhatTheLastOneRuns) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    terminal->type(std::string(pasteBegin) + ":c\rimport time; time.sleep(1000)" + pasteEnd + "\r");
    terminal->expect("krutil: runs now: import time");
    expectPrompt();
    evaluate(":restart", "krutil: a new session; what the last one held is gone\r\n");
    evaluate("6 * 7", "42\r\n");
    leave();
}

// Requests of a session that is lost have no end, so the trace of both sessions is not checked.
TEST_F(TerminalCommandsTest, ALostEngineIsReplacedOnRequest) {
    begin({"repl", "--trace-to", (directory / "trace").string()});
    evaluate("x = 41");
    enter("import os, signal; os.kill(os.getpid(), signal.SIGKILL)");
    terminal->expect("krutil: the engine was killed by signal 9 (Killed) before it answered\r\n");
    terminal->expect("krutil: what the session held is lost; Enter starts a new one, Ctrl-D leaves ");
    terminal->type("\r");
    expectPrompt();
    evaluate("x", "NameError: name 'x' is not defined");
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalCommandsTest, AnEngineThatIsKilledByCtrlCIsReplacedToo) {
    begin({"repl", "--trace-to", (directory / "trace").string()});
    terminal->type(std::string(pasteBegin) +
                   "try:\r    print('rea' + 'dy')\r    while True: pass\r"
                   "except KeyboardInterrupt:\r    while True: print('cau' + 'ght')\r" +
                   pasteEnd + "\r");
    terminal->expect("ready\r\n");
    terminal->type("\x03");
    terminal->expect("caught\r\n");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled; the engine was killed\r\n");
    terminal->expect("Ctrl-D leaves ");
    terminal->type("\r");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalCommandsTest, AnEngineThatCannotBeStartedAgainIsAskedForAgain) {
    const std::string script = (directory / "engine").string();
    std::ofstream(script) << "#!/bin/sh\nexec '" KRUTIL_ENGINE "' --stdio\n";
    std::filesystem::permissions(script, std::filesystem::perms::owner_all);
    begin({"repl", "--engine", script});
    std::filesystem::rename(script, script + ".away");
    evaluate(":restart", "krutil: the engine exited with code 127", "Ctrl-D leaves ");
    std::filesystem::rename(script + ".away", script);
    terminal->type("\r");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalCommandsTest, TheTraceGoesOnInTheNextSession) {
    const std::string trace = (directory / "trace").string();
    begin({"repl", "--trace-to", trace});
    evaluate("first = 1");
    evaluate(":restart");
    evaluate("second = 2");
    leave();
    std::ifstream file(trace);
    const std::string text((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    EXPECT_THAT(text, ::testing::HasSubstr("first = 1"));
    EXPECT_THAT(text, ::testing::HasSubstr("second = 2"));
}

}  // namespace
}  // namespace krutil_client
