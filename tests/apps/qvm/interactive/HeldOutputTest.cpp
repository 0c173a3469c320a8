// Output is held for a moment, so that a short request leaves in one write. Nothing is lost by that.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "apps/qvm/fixture/EngineFixture.hpp"

extern char** environ;

namespace qvm_test {
namespace {

using session::SessionEnd;

// Calls of read and write functions; none where the system does not count them.
struct Calls {
    long reads = 0;
    long writes = 0;
};

// `process` is what /proc calls a process or a thread.
Calls callsOf(const std::string& process) {
    std::ifstream io("/proc/" + process + "/io");
    Calls calls;
    long count = 0;
    for (std::string name; io >> name >> count;) {
        if (name == "syscr:") {
            calls.reads = count;
        } else if (name == "syscw:") {
            calls.writes = count;
        }
    }
    return calls;
}

// The thread of this process that reads from the engine.
std::string readingThread() {
    for (const auto& thread : std::filesystem::directory_iterator("/proc/self/task")) {
        std::string name;
        std::getline(std::ifstream(thread.path() / "comm") >> std::ws, name);
        if (name == "session-io") {
            return "self/task/" + thread.path().filename().string();
        }
    }
    throw std::runtime_error("no session is open");
}

// An engine between two pipes, one of which keeps writes apart; what comes is passed on to a client, and counted.
class CountedEngine {
  public:
    CountedEngine() {
        std::array<int, 2> in{};
        std::array<int, 2> out{};
        std::array<int, 2> ends{};
        if (::pipe2(in.data(), O_CLOEXEC) != 0 || ::pipe2(out.data(), O_CLOEXEC | O_DIRECT) != 0 ||
            ::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0) {
            throw std::runtime_error("pipe or socketpair");
        }
        posix_spawn_file_actions_t actions;
        ::posix_spawn_file_actions_init(&actions);
        ::posix_spawn_file_actions_adddup2(&actions, in[0], STDIN_FILENO);
        ::posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
        std::string program = KRUTIL_QVM;
        std::string option = "--stdio";
        std::array<char*, 3> argv{program.data(), option.data(), nullptr};
        const int error = ::posix_spawn(&pid_, KRUTIL_QVM, &actions, nullptr, argv.data(), environ);
        ::posix_spawn_file_actions_destroy(&actions);
        ::close(in[0]);
        ::close(out[1]);
        if (error != 0) {
            throw std::runtime_error("Cannot start " KRUTIL_QVM);
        }
        there_ = std::thread([from = ends[1], to = in[1]] { pass(from, to, nullptr); });
        back_ = std::thread([this, from = out[0], to = ends[1]] { pass(from, to, &writes_); });
        client_ = std::make_unique<EngineClient>(ends[0]);
    }
    ~CountedEngine() {
        client_->goodbye();
        client_.reset();
        there_.join();
        back_.join();
        ::waitpid(pid_, nullptr, 0);
    }

    EngineClient& client() { return *client_; }
    int writes() const { return writes_; }
    Calls calls() const { return callsOf(std::to_string(pid_)); }

  private:
    static void pass(int from, int to, std::atomic<int>* count) {
        std::array<char, 1U << 16> bytes;
        for (ssize_t got = 0; (got = ::read(from, bytes.data(), bytes.size())) > 0;) {
            if (count != nullptr) {
                ++*count;
            }
            if (::write(to, bytes.data(), static_cast<std::size_t>(got)) != got) {
                break;
            }
        }
        ::shutdown(to, SHUT_WR);
        if (count == nullptr) {
            ::close(to);
        }
    }

    pid_t pid_ = -1;
    std::atomic<int> writes_{0};
    std::thread there_;
    std::thread back_;
    std::unique_ptr<EngineClient> client_;
};

// A busy machine may take longer for an evaluation than output is held, so it is tried until it is fast enough.
TEST(HeldOutputTest, EvaluationLeavesInOneWriteAndTakesFewCalls) {
    CountedEngine engine;
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        const int writes = engine.writes();
        const Calls before = engine.calls();
        const Evaluation result = engine.client().eval("1+1");
        const Calls after = engine.calls();
        ASSERT_EQ(result.shown(), "2\n");
        EXPECT_GE(engine.writes() - writes, 1);
        // The request and the wake-up of the interpreter's thread are read and written once each.
        const bool few = after.reads - before.reads <= 2 && after.writes - before.writes <= 2;
        if (engine.writes() - writes == 1 && few) {
            break;
        }
        ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "no evaluation left in one write";
    }
}

TEST(HeldOutputTest, ClientWritesOnceForAnEvaluationAndReadsOnce) {
    EngineSession engine;
    engine.client.eval("pass");
    const std::string reader = readingThread();
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        const Calls before{callsOf(reader).reads, callsOf("thread-self").writes};
        ASSERT_EQ(engine.client.eval("1+1").shown(), "2\n");
        const Calls after{callsOf(reader).reads, callsOf("thread-self").writes};
        ASSERT_LE(after.writes - before.writes, 1);
        if (after.reads - before.reads <= 1) {
            break;
        }
        ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "no evaluation was read in one go";
    }
}

TEST(HeldOutputTest, RequestsThatWaitAreAnsweredTogether) {
    constexpr int requests = 100;
    CountedEngine engine;
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        const int writes = engine.writes();
        std::vector<IDType> sent;
        for (int i = 0; i < requests; ++i) {
            sent.push_back(engine.client().enqueue("pass"));
        }
        for (const IDType& id : sent) {
            engine.client().await(id);
        }
        if (engine.writes() - writes <= requests / 2) {
            break;
        }
        ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "replies did not share writes";
    }
}

TEST(HeldOutputTest, ReplyIsNotHeldByALongRequestThatFollows) {
    EngineSession engine;
    const IDType shortOne = engine.client.enqueue("print('done')");
    const IDType longOne = engine.client.enqueue("import time\ntime.sleep(3600)");
    EXPECT_EQ(engine.client.await(shortOne).output(), "done\n");
    engine.client.cancel(longOne);
    engine.client.await(longOne);
}

TEST(HeldOutputTest, LinesOfCodeThatGoesOnArrive) {
    EngineSession engine;
    const IDType id = engine.client.enqueue("import time\nprint('first')\nprint('second')\ntime.sleep(3600)");
    engine.client.awaitKind(id, "IIPStartedEvent");
    engine.client.awaitText("second");
    engine.client.cancel(id);
    EXPECT_EQ(engine.client.await(id).output(), "first\nsecond\n");
}

TEST(HeldOutputTest, LinesThatFollowShareEventsInTheOrderOfWriting) {
    EngineSession engine;
    std::string expected;
    for (int i = 0; i < 3000; ++i) {
        expected += "line " + std::to_string(i) + "\n";
    }
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        const Evaluation result = engine.client.eval("for i in range(3000): print('line', i)");
        ASSERT_EQ(result.output(), expected);
        // A busy machine may leave a millisecond between many of them.
        if (result.events.size() < 1500) {
            break;
        }
        ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "lines that follow each other share messages";
    }
}

struct Ending {
    std::string name;
    std::string code;  ///< ends the process
    int exitCode;      ///< as EngineProcess::wait() has it
};

void PrintTo(const Ending& ending, std::ostream* out) {
    *out << ending.name;
}

class SuddenEndTest : public testing::TestWithParam<Ending> {};

TEST_P(SuddenEndTest, LinesBeforeItArrive) {
#if defined(KRUTIL_SANITIZED)
    if (GetParam().exitCode < 0) {
        GTEST_SKIP() << "A sanitizer handles the signal itself.";
    }
#endif
    EngineSession engine;
    engine.client.eval(
        "import ctypes, os, resource, signal, sys, threading\n"
        "resource.setrlimit(resource.RLIMIT_CORE, (0, 0))");
    const IDType id = engine.client.enqueue("print('early words')\nprint('last words')\n" + GetParam().code);
    EXPECT_EQ(engine.client.awaitEnd().reason, SessionEnd::Reason::Lost);
    const Happening last = engine.client.awaitText("last words");
    EXPECT_EQ(last.id, id);
    EXPECT_EQ(engine.process.wait(), GetParam().exitCode);
}

INSTANTIATE_TEST_SUITE_P(
    Ways, SuddenEndTest,
    testing::Values(
        Ending{"Exit", "os._exit(7)", 7},
        Ending{"ExitOfAnotherThread", "threading.Thread(target=os._exit, args=(7,)).start()\nwhile True: pass", 7},
        Ending{"AnotherProgram", "os.execv(sys.executable, ['python3', '-c', 'raise SystemExit(7)'])", 7},
        Ending{"Abort", "os.abort()", -SIGABRT}, Ending{"Fault", "ctypes.string_at(0)", -SIGSEGV},
        Ending{"FullStack",
               "sys.setrecursionlimit(10**6)\nclass A:\n    def __repr__(self): return repr(self)\nrepr(A())",
               -SIGSEGV},
        Ending{"Termination", "os.kill(os.getpid(), signal.SIGTERM)\nwhile True: pass", -SIGTERM},
        Ending{"Alarm", "signal.setitimer(signal.ITIMER_REAL, 0.000001)\nwhile True: pass", -SIGALRM},
        Ending{"SignalWithItsDefaultActionAgain",
               "signal.signal(signal.SIGUSR1, lambda *ignored: None)\nsignal.signal(signal.SIGUSR1, signal.SIG_DFL)\n"
               "os.kill(os.getpid(), signal.SIGUSR1)\nwhile True: pass",
               -SIGUSR1}),
    [](const auto& ending) { return ending.param.name; });

}  // namespace
}  // namespace qvm_test
