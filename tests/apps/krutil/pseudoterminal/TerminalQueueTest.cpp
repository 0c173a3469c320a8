// Requests that wait, at prompts and behind them, as a person sees them.

#include <fstream>
#include <iterator>
#include <string>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"
#include "programs/support/Goodbye.hpp"
#include "programs/support/Program.hpp"
#include "programs/support/Relay.hpp"

namespace krutil_client {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;
using Way = programs_test::Relay::Way;

class TerminalQueueTest : public TerminalReplTest {
  protected:
    static std::string pasted(const std::string& lines) { return "\x1b[200~" + lines + "\x1b[201~\r"; }

    // An expression that waits until it happens.
    static std::string waiting(const std::filesystem::path& file) { return "open('" + file.string() + "').readline()"; }

    // Pastes `lines` at a debugger's prompt, so that the prompt takes them as one batch: while they come, something
    // else keeps the engine from taking any, and that they are there is seen by a last, large line that is refused.
    void pasteAtOnce(const std::string& lines) {
        const Happening busy(directory / "busy");
        const Happening free(directory / "free");
        begin(
            {"repl", "--trace-to", trace.string(), "--engine", "'" KRUTIL_ENGINE "' --stdio --max-queued-bytes 20000"});
        // A call that does not give up Python's lock.
        evaluate(first.thread("__import__('ctypes').PyDLL(None).system(b'echo > " + (directory / "busy").string() +
                              "; read line < " + (directory / "free").string() + "')"));
        evaluate("breakpoint()", "", "debug> ");
        first.happen();
        busy.await();
        terminal->type(pasted(lines + "'" + std::string(12000, 'a') + "'"));
        terminal->expect("The engine's queue is full: with this request, those that wait would hold more than 20000");
        free.happen();
    }

    // Begins, and has a line left behind that asks a question, up to where the answer is typed.
    void beginWithQuestionLeftBehind() {
        const std::string question = "'hi ' + input('name? ')";
        begin();
        evaluate("breakpoint()", "", "debug> ");
        terminal->type(pasted("x = 1\r:c\r" + question));
        terminal->expect("krutil: runs now: " + question + "\r\n");
        terminal->expect("name? ");
        terminal->expect(editing);
    }

    std::size_t traced(const std::string& name) const {
        std::ifstream file(trace);
        const std::string text((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
        return programs_test::countOf(text, name);
    }

    const std::filesystem::path trace = directory / "trace";
    const Happening first{directory / "first"};
    const Happening second{directory / "second"};
};

TEST_F(TerminalQueueTest, WhatGoingOnLeavesBehindIsRequeuedAndTakenAgain) {
    pasteAtOnce(":c\rprint('left', 6 * 7)\rprint('left', 6 * 8)\r");
    terminal->expect("krutil: left behind by the prompt, and waits for its turn: print('left', 6 * 7)\r\n");
    terminal->expect("krutil: left behind by the prompt, and waits for its turn: print('left', 6 * 8)\r\n");
    terminal->expect("krutil: runs now: print('left', 6 * 7)\r\n");
    terminal->expect("left 42\r\n");
    terminal->expect("krutil: runs now: print('left', 6 * 8)\r\n");
    terminal->expect("left 48\r\n");
    evaluate("6 * 9", "54\r\n");
    leave();
    EXPECT_EQ(traced(" krutil:IIPRequeuedEvent "), 2U);
    EXPECT_EQ(traced(" krutil:IIPReactivatedEvent "), 2U);
}

TEST_F(TerminalQueueTest, TheQueueIsListedAndCancelledByNumber) {
    pasteAtOnce(":c\r" + waiting(directory / "second") + "\rprint('never', 6 * 7)\r");
    terminal->expect("krutil: runs now: open(");
    terminal->expect(prompt);
    enter(":queue");
    terminal->expect("   4  running   " + waiting(directory / "second") + "\r\n");
    terminal->expect("   5  requeued  print('never', 6 * 7)\r\n");
    terminal->expect(
        "The engine states InteractiveCommandLine, WebWindow, Debugging; this client states InteractiveCommandLine, "
        "WebWindow, Debugging.\r\n");
    terminal->expect(prompt);
    evaluate(":queue cancel 5", "krutil: cancelled\r\n");
    evaluate(":queue cancel 5", "There is no request '5'; :queue lists those that there are.\r\n");
    evaluate(":queue cancel 4", "krutil: cancelled\r\n");
    evaluate(":queue", "Nothing runs, and nothing waits.\r\n");
    evaluate(":queue cancel x", "There is no request 'x'; :queue lists those that there are.\r\n");
    leave();
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("never 42")));
}

TEST_F(TerminalQueueTest, WhatThePromptHoldsUpIsCancelledByItsNumber) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    evaluate(":queue", "   1  held up   breakpoint()\r\n", "debug> ");
    evaluate(":nonsense", "There is no command ':nonsense' here; :c goes on, :q quits, :queue lists requests.\r\n",
             "debug> ");
    evaluate(":queue cancel 1", "krutil: cancelled\r\n");
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalQueueTest, WhatWaitsBehindAPastedLineThatStopsIsListed) {
    pasteAtOnce("breakpoint()\rprint('never', 6 * 7)\r'then ' + 'this'\r");
    terminal->expect("debug> ");
    evaluate(":queue", "   3  held up   breakpoint()\r\n   4  waiting   print('never', 6 * 7)\r\n", "debug> ");
    evaluate(":queue cancel 4", "krutil: cancelled\r\n", "debug> ");
    evaluate(":c", "'then this'\r\n", "debug> ");
    evaluate(":c");
    leave();
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("never 42")));
}

TEST_F(TerminalQueueTest, CtrlCCancelsAllPastedLines) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    terminal->type(pasted("print('rea' + 'dy'); " + waiting(directory / "first") + "\rprint('never', 6 * 7)"));
    terminal->expect("ready\r\n");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    terminal->expect("krutil: cancelled\r\n");
    terminal->expect("debug> ");
    evaluate("6 * 8", "48\r\n", "debug> ");
    evaluate(":c");
    leave();
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("never 42")));
}

TEST_F(TerminalQueueTest, ALineThatWasLeftBehindMayAsk) {
    beginWithQuestionLeftBehind();
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalQueueTest, CtrlCAtTheQuestionOfALineThatWasLeftBehindCancelsIt) {
    beginWithQuestionLeftBehind();
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    expectPrompt();
    evaluate("6 * 7", "42\r\n");
    leave();
}

TEST_F(TerminalQueueTest, WhoLeavesWaitsForWhatWasLeftBehind) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    terminal->type(pasted(":c\rline = " + waiting(directory / "first") + "\rprint('still', 6 * 7)"));
    terminal->expect("krutil: runs now: line");
    terminal->expect(prompt);
    terminal->type("\x04");
    terminal->expect("krutil: waits for 2 requests; Ctrl-C cancels what is left\r\n");
    first.happen();
    terminal->expect("still 42\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
}

TEST_F(TerminalQueueTest, CtrlCWhileLeavingCancelsWhatWasLeftBehind) {
    begin();
    evaluate("breakpoint()", "", "debug> ");
    terminal->type(pasted(":c\rline = " + waiting(directory / "first") + "\rprint('never', 6 * 7)"));
    terminal->expect("krutil: runs now: line");
    terminal->expect(prompt);
    terminal->type("\x04");
    terminal->expect("krutil: waits for 2 requests; Ctrl-C cancels what is left\r\n");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    terminal->expect("krutil: cancelled\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
    EXPECT_THAT(terminal->sent(), Not(HasSubstr("never 42")));
}

TEST_F(TerminalQueueTest, ACommandWaitsForWhatWasLeftBehindToo) {
    terminal = std::make_unique<Terminal>(command({"eval", "breakpoint()\n6 * 7"}), environment());
    terminal->expect("debug> ");
    terminal->type(pasted("x = 1\r:c\rprint('still', 6 * 8)"));
    terminal->expect("42\r\n");
    terminal->expect("still 48\r\n");
    EXPECT_EQ(terminal->exitCode(), 0);
}

// A network that holds back what the test says.
class TerminalRelayTest : public TerminalQueueTest {
  protected:
    void beginAcross(const std::vector<std::string>& engineOptions = {}) {
        std::vector<std::string> listening{KRUTIL_ENGINE, "--listen", socket};
        listening.insert(listening.end(), engineOptions.begin(), engineOptions.end());
        engine = std::make_unique<programs_test::Program>(listening);
        ASSERT_TRUE(engine->waitForErr("krutil-qvm: serving "));
        relay.record();
        begin({"repl", "--connect", relay.path()});
    }

    void expectOrderlyEnd(std::size_t cancels) {
        EXPECT_EQ(programs_test::wrongGoodbye(relay.recorded(Way::ToEngine), cancels), "");
    }

    const std::string socket = (directory / "private/engine").string();
    std::unique_ptr<programs_test::Program> engine;
    programs_test::Relay relay{(directory / "relay").string(), socket};
};

TEST_F(TerminalRelayTest, APauseThatEndsWhileItsAnswerIsOnItsWayIsOver) {
    beginAcross();
    relay.holdAfterFrame(Way::ToClient, "krutil:DebugLoopEvent");
    enter("import qvm; qvm.pause(0.01); open('" + (directory / "first").string() +
          "', 'w').write('over\\n'); 'hi ' + input('name? ')");
    terminal->expect("Paused; press Enter to go on ");
    relay.hold(Way::ToEngine);
    terminal->type("too late\r");
    terminal->expect("\x1b[?2004l\r\n");
    // The engine's pause is over; the client hears of it when its answer is under way.
    first.await();
    relay.passAll(Way::ToClient);
    terminal->expect("name? ");
    relay.passAll(Way::ToEngine);
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    leave();
    expectOrderlyEnd(1);
}

TEST_F(TerminalRelayTest, APauseThatIsOverBeforeItIsAnsweredNeedsNoAnswer) {
    beginAcross();
    enter("import qvm; qvm.pause(0.01); 'hi ' + input('name? ')");
    terminal->expect("name? ");
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    leave();
    expectOrderlyEnd(0);
}

TEST_F(TerminalRelayTest, CancelsPrecedeTheGoodbye) {
    beginAcross();
    enter("print('rea' + 'dy'); " + waiting(directory / "first"));
    terminal->expect("ready\r\n");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled\r\n");
    expectPrompt();
    leave();
    expectOrderlyEnd(1);
}

TEST_F(TerminalRelayTest, AnErrorOfThisEndCancelsWhatWasLeftBehindBeforeTheGoodbye) {
    beginAcross({"--limit-tagged-frame", "2000"});
    evaluate("breakpoint()", "", "debug> ");
    terminal->type(pasted(":c\rline = " + waiting(directory / "first") + "\rprint('never', 6 * 7)"));
    terminal->expect("krutil: runs now: line");
    terminal->expect(prompt);
    terminal->type(pasted("'" + std::string(3000, 'a') + "'"));
    EXPECT_EQ(terminal->exitCode(), 2);
    expectOrderlyEnd(2);
}

TEST_F(TerminalRelayTest, ALineThatIsTooLargeAtAPromptIsSaidAndAskedForAgain) {
    beginAcross({"--limit-tagged-frame", "2000"});
    enter("'hi ' + input('name? ')");
    terminal->expect("name? ");
    terminal->expect(editing);
    terminal->type(std::string(3000, 'a') + "\r");
    terminal->expect("krutil: ");
    terminal->expect(editing);
    terminal->type("Ada\r");
    terminal->expect("'hi Ada'\r\n");
    expectPrompt();
    leave();
    expectOrderlyEnd(0);
}

}  // namespace
}  // namespace krutil_client
