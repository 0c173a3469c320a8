// Processes that running code starts keep out of the session.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "apps/qvm/fixture/EngineFixture.hpp"

namespace qvm_test {
namespace {

using testing::HasSubstr;

class ForkTest : public testing::Test {
  protected:
    EngineClient& client() { return engine_.client; }

    // Code that runs `child` in a forked child, waits for it and shows its exit status.
    static std::string inChild(const std::string& child) {
        return "import os\n"
               "pid = os.fork()\n"
               "if pid == 0:\n"
               "    " +
               child +
               "\n"
               "else:\n"
               "    print('status', os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]))";
    }

    // The session is whole: it goes on and ends as agreed.
    void expectWholeSession() {
        EXPECT_EQ(client().eval("1").shown(), "1\n");
        EXPECT_EQ(client().goodbye().reason, session::SessionEnd::Reason::Finished);
        EXPECT_EQ(engine_.process.wait(), 0);
    }

    EngineSession engine_;
};

// The thread sanitizer does not support forks of processes with threads, and loses signals that such a child is ended
// by; this suite is not run under it.
using ThreadForkTest = ForkTest;

TEST_F(ForkTest, ForkedChildWritesToThePlainDescriptors) {
    const Evaluation result =
        client().eval(inChild("import sys; print('of the child'); print('error', file=sys.stderr)"));
    EXPECT_EQ(result.output(), "status 0\n");
    EXPECT_EQ(result.errors(), "");
    EXPECT_EQ(client().backgroundText(), "of the child\nerror\n");
    expectWholeSession();
    EXPECT_EQ(engine_.process.stderrText(), "");
}

TEST_F(ForkTest, ForkedChildHasNoDescriptorOfTheSession) {
    const Evaluation result = client().eval(
        inChild("print([l for l in (os.readlink(f'/proc/self/fd/{n}') for n in os.listdir('/proc/self/fd')"
                " if os.path.exists(f'/proc/self/fd/{n}')) if 'socket' in l])"));
    EXPECT_EQ(result.output(), "status 0\n");
    EXPECT_EQ(client().backgroundText(), "[]\n");
    expectWholeSession();
}

TEST_F(ForkTest, TextHeldAtTheForkIsSentOnce) {
    const Evaluation result = client().eval("print('held ', end='')\n" + inChild("pass"));
    EXPECT_EQ(result.output(), "held status 0\n");
    expectWholeSession();
    EXPECT_EQ(engine_.process.stderrText(), "");
}

TEST_F(ForkTest, ForkedChildThatReturnsEndsWithoutTouchingTheSession) {
    EXPECT_EQ(client().eval(inChild("x = 1")).output(), "status 0\n");
    EXPECT_EQ(client().eval(inChild("raise SystemExit(5)")).output(), "status 5\n");
    EXPECT_EQ(client().eval(inChild("raise SystemExit")).output(), "status 0\n");
    EXPECT_EQ(client().eval(inChild("os._exit(6)")).output(), "status 6\n");
    expectWholeSession();
    EXPECT_EQ(engine_.process.stderrText(), "");
}

TEST_F(ForkTest, ErrorOfAForkedChildIsPrintedThere) {
    EXPECT_EQ(client().eval(inChild("raise ValueError('in the child')")).output(), "status 1\n");
    const std::string text = client().backgroundText();
    EXPECT_THAT(text, HasSubstr("Traceback (most recent call last):\n  File \"<eval-1>\", line 4, in <module>\n"));
    EXPECT_THAT(text, HasSubstr("ValueError: in the child\n"));
    EXPECT_EQ(client().eval(inChild("raise SystemExit('said at the end')")).output(), "status 1\n");
    EXPECT_THAT(client().backgroundText(), testing::EndsWith("said at the end\n"));
    expectWholeSession();
}

TEST_F(ForkTest, ChildThatIsForkedWhileThreadsWriteStaysOut) {
    const Evaluation result = client().eval(
        "import os, threading\n"
        "stop = False\n"
        "def write():\n"
        "    while not stop: print('noise')\n"
        "threads = [threading.Thread(target=write) for i in range(2)]\n"
        "for t in threads: t.start()\n"
        "for i in range(30):\n"
        "    pid = os.fork()\n"
        "    if pid == 0:\n"
        "        print('child')\n"
        "        os._exit(0)\n"
        "    os.waitpid(pid, 0)\n"
        "stop = True\n"
        "for t in threads: t.join()\n"
        "print('whole')");
    EXPECT_EQ(result.output(), "whole\n");
    expectWholeSession();
    // What each child wrote arrives once: nothing that its parent held was sent again.
    const std::string text = client().backgroundText();
    int children = 0;
    for (std::size_t place = text.find("child"); place != text.npos; place = text.find("child", place + 1)) {
        ++children;
    }
    EXPECT_EQ(children, 30);
}

TEST_F(ThreadForkTest, ThreadThatForksLeavesAChildThatEndsWithIt) {
    const Evaluation result = client().eval(
        "import os, threading\n"
        "pids = []\n"
        "def fork():\n"
        "    pid = os.fork()\n"
        "    if pid == 0: print('child of a thread')\n"
        "    else: pids.append(pid)\n"
        "thread = threading.Thread(target=fork)\n"
        "thread.start()\n"
        "thread.join()\n"
        "print(os.waitstatus_to_exitcode(os.waitpid(pids[0], 0)[1]))");
    EXPECT_EQ(result.output(), "0\n");
    EXPECT_EQ(client().backgroundText(), "child of a thread\n");
    expectWholeSession();
}

TEST_F(ThreadForkTest, MultiprocessingWorks) {
    const Evaluation result = client().eval(
        "import multiprocessing\n"
        "def square(x):\n"
        "    print('worker', x)\n"
        "    return x * x\n"
        "with multiprocessing.get_context('fork').Pool(2) as pool:\n"
        "    print(pool.map(square, range(5)))");
    EXPECT_EQ(result.output(), "[0, 1, 4, 9, 16]\n");
    for (const char* line : {"worker 0\n", "worker 1\n", "worker 2\n", "worker 3\n", "worker 4\n"}) {
        EXPECT_THAT(client().backgroundText(), HasSubstr(line));
    }
    expectWholeSession();
}

TEST_F(ForkTest, SubprocessWritesToThePlainDescriptors) {
    client().eval("import subprocess\nsubprocess.run(['echo', 'of the program'])\nNone");
    EXPECT_EQ(client().backgroundText(), "of the program\n");
    expectWholeSession();
}

TEST_F(ForkTest, WritingToDescriptorOneDoesNotReachTheProtocol) {
    client().eval(
        "import os, sys\nos.write(1, b'plain\\n')\nsubprocess = __import__('subprocess')\n"
        "subprocess.run(['echo', 'given'], stdout=sys.stdout)\nNone");
    EXPECT_EQ(client().backgroundText(), "plain\ngiven\n");
    expectWholeSession();
}

TEST_F(ForkTest, SubprocessInheritsNothingButTheStandardDescriptors) {
    const Evaluation result = client().eval(
        "import subprocess, sys\n"
        "print(subprocess.run([sys.executable, '-c',\n"
        "    'import os; d = os.open(\"/proc/self/fd\", os.O_RDONLY); print([n for n in os.listdir(d)"
        " if int(n) != d and os.path.exists(f\"/proc/self/fd/{n}\")])'],\n"
        "    close_fds=False, capture_output=True, text=True).stdout, end='')");
    EXPECT_EQ(result.output(), "['0', '1', '2']\n");
    expectWholeSession();
}

}  // namespace
}  // namespace qvm_test
