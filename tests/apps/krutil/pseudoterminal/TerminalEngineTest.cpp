// The command of --engine on the terminal of the client: until the session begins it may ask, after that it is left
// alone.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "apps/krutil/pseudoterminal/TerminalFixture.hpp"
#include "programs/support/Program.hpp"

namespace krutil_client {
namespace {

using programs_test::quotedForShell;

const std::string engine = quotedForShell(KRUTIL_ENGINE) + " --stdio";

// Asks on the terminal as ssh does, with the echo switched off.
const std::string asksForPassword =
    "stty -echo < /dev/tty; printf 'password: ' > /dev/tty; read PASSWORD < /dev/tty; stty echo < /dev/tty; "
    "export PASSWORD; exec " +
    engine;

// Ends at a Ctrl-C, as relays do.
const std::string endsAtCtrlC =
    "exec /usr/bin/python3 -c 'import os, signal, subprocess, sys; "
    "signal.signal(signal.SIGINT, lambda *_: os._exit(1)); sys.exit(subprocess.call(sys.argv[1:]))' " +
    engine;

// The terminal's settings as a word each.
const std::string showEcho = "stty -a < /dev/tty | tr -s ' ;' '\\n\\n' | grep -x -- '-\\?echo'";

class TerminalEngineTest : public TerminalReplTest {};

TEST_F(TerminalEngineTest, ACommandAsksForAPassword) {
    terminal = std::make_unique<Terminal>(command({"repl", "--engine", asksForPassword, "--handshake-timeout", "50"}),
                                          environment());
    terminal->expect("password: ");
    terminal->type("open sesame\r");
    expectPrompt();
    EXPECT_EQ(terminal->sent().find("open sesame"), std::string::npos);
    evaluate("import os; os.environ['PASSWORD']", "'open sesame'");
    leave();
}

TEST_F(TerminalEngineTest, CtrlCWhereACommandAsksEndsTheClient) {
    Terminal asked(shell("\"$KRUTIL\" eval --engine " + quotedForShell(asksForPassword) +
                         " --handshake-timeout 50 1; echo ended $?; stty echo < /dev/tty"),
                   environment());
    asked.expect("password: ");
    asked.type("\x03");
    // The shell around the client is not in the foreground then, so it goes on.
    asked.expect("krutil: cancelled\r\nended 6\r\n");
    EXPECT_EQ(asked.exitCode(), 0);
}

TEST_F(TerminalEngineTest, CtrlCInASessionDoesNotReachTheCommand) {
    beginWith(command({"repl", "--engine", endsAtCtrlC, "--handshake-timeout", "50"}));
    enter("print('rea' + 'dy'); exec('while True: pass')");
    terminal->expect("ready");
    terminal->type("\x03");
    terminal->expect("krutil: cancelled");
    expectPrompt();
    evaluate("6 * 7", "42");
    leave();
}

TEST_F(TerminalEngineTest, ACommandThatIsKilledLeavesTheTerminalAsItWas) {
    Terminal asked(
        shell("\"$KRUTIL\" eval --engine 'stty -echo < /dev/tty; exec sleep 600' --handshake-timeout 1 1; " + showEcho),
        environment());
    asked.expect("krutil: the handshake timed out after 1000 milliseconds");
    asked.expect("\necho\r\n");
    EXPECT_EQ(asked.exitCode(), 0);
}

// Does what a shell with job control does for a client and a pager behind a pipe: they are one process group, which has
// the terminal before they begin. The pager changes the terminal's settings while that is lent, and is stopped.
constexpr const char* besideAPager = R"(
import os, signal, subprocess, sys, termios
lent, stopped, client, engine = sys.argv[1:]
os.mkfifo(lent)
os.mkfifo(stopped)
pager = os.fork()
if pager == 0:
    open(lent).read()
    terminal = os.open("/dev/tty", os.O_RDWR)
    termios.tcsetattr(terminal, termios.TCSANOW, termios.tcgetattr(terminal))
    os._exit(0)
os.setpgid(pager, pager)
os.tcsetpgrp(0, pager)
waits = f"echo > '{lent}'; read LINE < '{stopped}'; exec {engine}"
evaluation = subprocess.Popen([client, "eval", "--engine", waits, "--handshake-timeout", "50", "6*7"], process_group=pager)
status = os.waitpid(pager, os.WUNTRACED)[1]
assert os.WIFSTOPPED(status), status
with open(stopped, "w") as line:
    line.write("\n")
print("ended:", evaluation.wait(), os.waitpid(pager, 0)[1])
)";

TEST_F(TerminalEngineTest, APagerBehindThePipeGoesOn) {
    Terminal both(
        {"/usr/bin/python3", "-c", besideAPager, files.file("lent"), files.file("stopped"), KRUTIL_CLIENT, engine},
        environment());
    both.expect("42\r\n");
    both.expect("ended: 0 0\r\n");
    EXPECT_EQ(both.exitCode(), 0);
}

}  // namespace
}  // namespace krutil_client
