// A client that stops reading holds up the code whose events it does not read, and the engine does not grow.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "support/Eventually.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using namespace krutil::cmddistributor::WhenToDequeue;
using capabilities::Capability;
using cmddistributor::IIPCancelReply;
using krutil::cmddistributor::inEXECUTION_CTRLC;
using test_support::eventually;

// What the engine may hold for a client that does not read: the session's room and what lies around each message. A
// sanitizer keeps freed memory for a while.
#if defined(KRUTIL_SANITIZED)
constexpr std::size_t mostGrowth = std::size_t{1} << 30;
#else
constexpr std::size_t mostGrowth = std::size_t{64} << 20;
#endif

// Numbers that running code and the test share through a file, so that nothing of them travels in the session.
class SharedNumbers {
  public:
    SharedNumbers() : path_(directory_.file("numbers")) {
        const int file = ::open(path_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        if (file < 0 || ::ftruncate(file, 4096) != 0) {
            throw std::runtime_error("Cannot make " + path_);
        }
        void* const memory = ::mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
        ::close(file);
        if (memory == MAP_FAILED) {
            throw std::runtime_error("Cannot map " + path_);
        }
        numbers_ = static_cast<std::atomic<std::uint64_t>*>(memory);
    }
    ~SharedNumbers() { ::munmap(numbers_, 4096); }
    SharedNumbers(const SharedNumbers&) = delete;
    SharedNumbers& operator=(const SharedNumbers&) = delete;

    // Code that does `event` again and again, and counts. A cancel is noted before it goes on its way.
    std::string loop(const std::string& setup, const std::string& event) const {
        return "import mmap, os, sys, warnings, qvm\n"
               "shared = memoryview(mmap.mmap(os.open('" +
               path_ +
               "', os.O_RDWR), 4096)).cast('Q')\n"
               "def repeat():\n"
               "    while not shared[1]:\n"
               "        " +
               event +
               "\n"
               "        shared[0] += 1\n" +
               setup +
               "\n"
               "print('ready\\n', end='')\n"
               "try:\n"
               "    run()\n"
               "except KeyboardInterrupt:\n"
               "    shared[2] = 1\n"
               "    raise\n";
    }

    std::uint64_t count() const { return numbers_[0]; }
    void stop() { numbers_[1] = 1; }
    bool cancelled() const { return numbers_[2] != 0; }

  private:
    test_support::TemporaryDirectory directory_;
    std::string path_;
    std::atomic<std::uint64_t>* numbers_ = nullptr;
};

// Memory of a process that is in use, in bytes.
std::size_t residentBytes(pid_t process) {
    std::ifstream file("/proc/" + std::to_string(process) + "/statm");
    std::size_t total = 0;
    std::size_t resident = 0;
    file >> total >> resident;
    return resident * static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
}

bool sleeps(pid_t process) {
    std::ifstream file("/proc/" + std::to_string(process) + "/stat");
    std::string text;
    std::getline(file, text);
    return text.substr(text.rfind(')') + 1, 2) == " S";
}

struct EventKind {
    std::string name;
    std::string setup;
    std::string event;
};

std::ostream& operator<<(std::ostream& stream, const EventKind& kind) {
    return stream << kind.name;
}

constexpr char here[] = "run = repeat";
constexpr char inAThread[] =
    "import threading\n"
    "def run():\n"
    "    thread = threading.Thread(target=repeat, daemon=True)\n"
    "    thread.start()\n"
    "    thread.join()";

const EventKind eventKinds[] = {
    {"Text", here, "print('t' * 1000)"},
    {"TextWithoutNewlines", here, "sys.stdout.write('t' * 1000)"},
    {"TextOfAThread", inAThread, "print('t' * 1000)"},
    {"TextOnADescriptor", here, "os.write(2, b't' * 1000)"},
    {"ShownValues", here, "sys.displayhook('t' * 1000)"},
    {"Warnings", here, "qvm.warning('test:kind', 'w' * 1000)"},
    {"HiddenWarnings", std::string("warnings.simplefilter('ignore')\n") + here, "warnings.warn('w' * 1000)"},
    {"TakenWarnings", std::string("warnings.showwarning = lambda *a: None\n") + here, "warnings.warn(str(shared[0]))"},
    {"WarningsOfAThread", inAThread, "qvm.warning('test:kind', 'w' * 1000)"},
    {"HiddenWarningsOfAThread", std::string("warnings.simplefilter('ignore')\n") + inAThread,
     "warnings.warn('w' * 1000)"},
    {"DebuggerToggles", here, "qvm.debugger(shared[0] % 2 == 0)"},
    {"DebuggerTogglesOfAThread", inAThread, "qvm.debugger(shared[0] % 2 == 0)"},
    {"TimedPauses", here, "qvm.pause(0)"},
};

class BackPressureTest : public testing::TestWithParam<EventKind> {
  protected:
    // Runs the code to where it waits for the client, which does not read.
    IDType held() {
        const IDType id = client().enqueue(numbers_.loop(GetParam().setup, GetParam().event));
        client().awaitText("ready\n");
        const std::size_t before = residentBytes(engine_.process.pid());
        client().stopReading();
        std::uint64_t last = 0;
        int same = 0;
        EXPECT_TRUE(eventually([&] {
            const std::uint64_t now = numbers_.count();
            same = now > 0 && now == last && sleeps(engine_.process.pid()) ? same + 1 : 0;
            last = now;
            const std::size_t resident = residentBytes(engine_.process.pid());
            grown_ = resident - std::min(before, resident);
            return same >= 30 || grown_ > mostGrowth;
        }));
        EXPECT_LE(grown_, mostGrowth) << "after " << numbers_.count() << " events";
        return id;
    }

    EngineClient& client() { return engine_.client; }

    SharedNumbers numbers_;
    EngineSession engine_{{}, {}, {Capability::InteractiveCommandLine, Capability::Debugging}};
    std::size_t grown_ = 0;
};

TEST_P(BackPressureTest, CodeWaitsAndGoesOn) {
    const IDType id = held();
    const std::uint64_t waitedAt = numbers_.count();
    client().readOn();
    EXPECT_TRUE(eventually([&] { return numbers_.count() > waitedAt; }));
    numbers_.stop();
    EXPECT_FALSE(client().await(id).error);
    EXPECT_EQ(client().eval("1 + 1").shown(), "2\n");
}

TEST_P(BackPressureTest, CodeThatWaitsCanBeCancelled) {
    const IDType id = held();
    const session::framing::StreamID cancel = client().startCancel(id);
    // Nothing is read meanwhile.
    EXPECT_TRUE(eventually([&] { return numbers_.cancelled(); }));
    numbers_.stop();
    client().readOn();
    EXPECT_EQ(client().awaitCancel(cancel), IIPCancelReply::PENDING_CANCEL);
    const Evaluation result = client().await(id);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->getExecutionStatus(), inEXECUTION_CTRLC);
}

INSTANTIATE_TEST_SUITE_P(Events, BackPressureTest, testing::ValuesIn(eventKinds),
                         [](const auto& each) { return each.param.name; });

// Each prompt here takes all the answers that wait, keeps one and gives the others back.
TEST(PromptBackPressureTest, PromptsWhoseAnswersWaitAreHeldUpToo) {
    SharedNumbers numbers;
    EngineSession engine({}, {}, {Capability::InteractiveCommandLine});
    Gate gate;
    constexpr std::uint64_t answers = 250;
    const IDType id =
        engine.client.enqueue(numbers.loop("def run():\n    " + gate.wait() + "\n    repeat()", "input()"));
    engine.client.awaitText("ready\n");
    EvalOptions atPrompt;
    atPrompt.mode = DEQUEUE_AT_PROMPT;
    for (std::uint64_t i = 0; i < answers; ++i) {
        engine.client.enqueue("answer", atPrompt);
    }
    // Messages are taken in order, so all answers wait now.
    engine.client.cancel(IDType::random(), false);
    engine.client.stopReading();
    gate.open();
    std::uint64_t last = 0;
    int same = 0;
    EXPECT_TRUE(eventually([&] {
        const std::uint64_t now = numbers.count();
        same = now > 0 && now == last && sleeps(engine.process.pid()) ? same + 1 : 0;
        last = now;
        return same >= 30;
    }));
    EXPECT_LT(numbers.count(), answers);
    engine.client.readOn();
    EXPECT_TRUE(eventually([&] { return numbers.count() == answers; }));
    numbers.stop();
    engine.client.enqueue("the last", atPrompt);
    EXPECT_FALSE(engine.client.await(id).error);
}

}  // namespace
}  // namespace qvm_test
