#include "programs/lifecycle/Lifecycle.hpp"

#include <gmock/gmock.h>

#include <algorithm>
#include <csignal>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <utility>

#include "support/Eventually.hpp"

namespace programs_test {
namespace {

using ::testing::MatchesRegex;
using Way = Relay::Way;

// Steps of the table.

template <char... keys>
void type(LifecycleTest& test) {
    test.client().type({keys...});
}

void pressCtrlC(LifecycleTest& test) {
    test.client().pressCtrlC();
}

void passAll(LifecycleTest& test) {
    test.relay().passAll(Way::ToEngine);
    test.relay().passAll(Way::ToClient);
}

constexpr std::uint64_t partOfAHello = 20;
constexpr std::uint64_t partOfAnArray = 1U << 20;
constexpr std::size_t arrayBytes = 8U << 20;

// Bytes in a file as NumPy stores them.
void writeArray(const std::string& path) {
    std::string header = "{'descr': '|u1', 'fortran_order': False, 'shape': (" + std::to_string(arrayBytes) + ",), }";
    constexpr std::size_t headerBytes = 117;
    header.resize(headerBytes, ' ');
    std::ofstream(path, std::ios::binary)
        << "\x93NUMPY\x01" << '\0' << static_cast<char>(headerBytes + 1) << '\0' << header << '\n'
        << std::string(arrayBytes, 'x');
}

std::vector<Stage> makeStages() {
    const std::string on = "print('o' + 'n')\n";
    const std::string cancelled = "krutil: cancelled\n";
    return {
        // The engine has not begun to speak.
        {.name = "Silence",
         .links = {Link::Child},
         .arguments = {"eval", "--engine", "kill -STOP $$; exec " + quotedForShell(enginePath()) + " --stdio", "6 * 7"},
         .reach = [](LifecycleTest& test) { awaitStopped(onlyChildOf(test.client().pid())); },
         .answer = [](LifecycleTest& test) { resume(onlyChildOf(test.client().pid())); },
         .finish = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("42\r\n")); },
         // The client may have spoken or not.
         .engineLost = "the peer closed the stream during the handshake: 0 of (16 bytes of the peer's first message|4 "
                       "bytes of the peer's verdict) had arrived",
         .when = " before the session began",
         .running = false},
        // Both ends have a part of the other's first message.
        {.name = "Handshake",
         .links = {Link::Network},
         .arguments = {"eval", "6 * 7"},
         .prepare =
             [](LifecycleTest& test) {
                 test.relay().passAtMost(Way::ToEngine, partOfAHello);
                 test.relay().passAtMost(Way::ToClient, partOfAHello);
             },
         .reach =
             [](LifecycleTest& test) {
                 test.relay().waitUntilHeld(Way::ToEngine);
                 test.relay().waitUntilHeld(Way::ToClient);
             },
         .answer = passAll,
         .finish = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("42\r\n")); },
         .clientLost = "the peer closed the stream during the handshake: 4 of [0-9]+ bytes of the peer's hello had "
                       "arrived",
         .engineLost = "the peer closed the stream during the handshake: 4 of [0-9]+ bytes of the peer's hello had "
                       "arrived",
         .when = " before the session began",
         .running = false},
        {.name = "Idle",
         .links = {Link::Child, Link::Listener},
         .arguments = {"repl", "--no-history"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut(">>> ")); },
         .answer = type<'6', '*', '7', '\r'>,
         .finish =
             [](LifecycleTest& test) {
                 EXPECT_TRUE(test.client().waitForOut("42\r\n"));
                 EXPECT_TRUE(test.client().waitForOut(">>> "));
                 test.client().type("\x04");
             },
         .when = " while it was idle",
         // Ctrl-C only drops what has been typed; Ctrl-D leaves, which Ctrl-C cuts short.
         .leave =
             [](LifecycleTest& test) {
                 test.client().type("\x04");
                 EXPECT_TRUE(test.client().waitForOut("\n"));
             },
         .running = false},
        {.name = "TightLoop",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval", on + "while True: pass"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("on\r\n")); },
         .answer = pressCtrlC,
         .exitCode = 6,
         .end = cancelled},
        {.name = "Sleep",
         .links = {Link::Child},
         .arguments = {"eval", on + "import time\ntime.sleep(1000)"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("on\r\n")); },
         .answer = pressCtrlC,
         .exitCode = 6,
         .end = cancelled},
        {.name = "Output",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval", on + "while True: print('and on')"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("and on\r\n")); },
         .answer = pressCtrlC,
         .exitCode = 6,
         .end = cancelled,
         .clientLost = "the stream ended (between two messages, before the engine's shutdown event|in the middle of a "
                       "message: [0-9]+ of [0-9]+ [a-z]+ bytes of frame [0-9].* had arrived)"},
        {.name = "InputPrompt",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval", "print('hello ' + input('name? '))"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("name? ")); },
         .answer = type<'A', 'd', 'a', '\r'>,
         .finish = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("hello Ada\r\n")); }},
        {.name = "DebugPrompt",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval", "breakpoint()\nprint('be' + 'hind')"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("debug> ")); },
         .answer = type<':', 'c', '\r'>,
         .finish = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("behind\r\n")); }},
        // A request runs inside one that stands at a debug prompt.
        {.name = "NestedRequest",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval", "breakpoint()\nprint('be' + 'hind')"},
         .reach =
             [](LifecycleTest& test) {
                 EXPECT_TRUE(test.client().waitForOut("debug> "));
                 test.client().type("import time; print('o' + 'n'); time.sleep(1000)\r");
                 EXPECT_TRUE(test.client().waitForOut("on\r\n"));
             },
         .answer = pressCtrlC,
         .finish =
             [](LifecycleTest& test) {
                 EXPECT_TRUE(test.client().waitForOut("debug> "));
                 test.client().type(":c\r");
                 EXPECT_TRUE(test.client().waitForOut("behind\r\n"));
             },
         .end = cancelled},
        // Code that never asks whether it is to stop, and keeps every other thread from running Python.
        {.name = "PendingCancel",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval",
                       "import itertools, os\n"
                       "all(itertools.chain(map(os.write, [1], [b'o\\x6e\\n']), itertools.repeat(1)))"},
         .reach =
             [](LifecycleTest& test) {
                 EXPECT_TRUE(test.client().waitForOut("on\r\n"));
                 test.client().pressCtrlC();
                 EXPECT_TRUE(test.client().waitForErr("twice to end the engine\n"));
             },
         .said = "krutil: the engine has not stopped yet; code that is not Python's may hold it up. Press Ctrl-C twice "
                 "to end the engine\n"},
        // The client has said goodbye, and the engine takes its time.
        {.name = "Goodbye",
         .links = {Link::Child, Link::Listener},
         .arguments = {"eval",
                       "import atexit, time\n"
                       "def leave():\n"
                       "    print('leaving', flush=True)\n"
                       "    time.sleep(1000)\n"
                       "_ = atexit.register(leave)"},
         .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("leaving\r\n")); },
         .engineLost = "the client has gone before the engine's shutdown event",
         .when = " after it answered",
         .lostExitCode = 0,
         .running = false},
        {.name = "ArrayToEngine",
         .links = {Link::Network},
         .arguments = {"call", "len"},
         .prepare =
             [](LifecycleTest& test) {
                 writeArray(test.file("array.npy"));
                 test.addArgument(test.file("array.npy"));
                 test.relay().passAtMost(Way::ToEngine, partOfAnArray);
             },
         .reach = [](LifecycleTest& test) { test.relay().waitUntilHeld(Way::ToEngine); },
         .answer = passAll,
         .finish = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("int64: 8388608\r\n")); },
         .engineLost = "the stream ended in the middle of a message: [0-9]+ of 8388608 content bytes of frame 1 had "
                       "arrived"},
        {.name = "ArrayToClient",
         .links = {Link::Network},
         .arguments = {"call", "numpy.zeros", "1048576", "-o"},
         .prepare =
             [](LifecycleTest& test) {
                 test.addArgument(test.file("array.npy"));
                 test.relay().passAtMost(Way::ToClient, partOfAnArray);
             },
         .reach = [](LifecycleTest& test) { test.relay().waitUntilHeld(Way::ToClient); },
         .answer = passAll,
         .finish =
             [](LifecycleTest& test) {
                 EXPECT_TRUE(test.client().waitForOut("double, 1048576 elements -> " + test.file("array.npy")));
             },
         .clientLost = "the stream ended in the middle of a message: [0-9]+ of 8388608 content bytes of frame 1 had "
                       "arrived"},
    };
}

}  // namespace

std::string nameOf(Link link) {
    return link == Link::Child ? "Child" : link == Link::Listener ? "Listener" : "Network";
}

std::ostream& operator<<(std::ostream& out, const Stage& stage) {
    return out << stage.name;
}

const std::vector<Stage>& stages() {
    static const std::vector<Stage> table = makeStages();
    return table;
}

const Stage& stageNamed(const std::string& name) {
    return *std::find_if(stages().begin(), stages().end(), [&name](const Stage& stage) { return stage.name == name; });
}

std::string plain(const std::string& text) {
    std::string expression;
    for (const char c : text) {
        expression +=
            std::string(".()[]{}*+?|^$\\").find(c) != std::string::npos ? std::string{'\\', c} : std::string(1, c);
    }
    return expression;
}

LifecycleTest::LifecycleTest() {
    adoptOrphans();
}

void LifecycleTest::TearDown() {
    client_.reset();
    relay_.reset();
    if (listener_) {
        expectNoSessions();
        listener_->signal(SIGTERM);
        expectListenerGone();
    }
    expectNoDescendants();
}

void LifecycleTest::listen(const std::vector<std::string>& before) {
    std::vector<std::string> command = before;
    command.insert(command.end(), {enginePath(), "--handshake-timeout", "60", "--listen", socket()});
    listener_.emplace(command);
    ASSERT_TRUE(listener_->waitForErr("krutil-qvm: serving " + socket() + "\n"));
    log_ = plain("krutil-qvm: serving " + socket() + "\n");
    descriptors_ = descriptorsOf(listener_->pid());
}

void LifecycleTest::makeNetwork() {
    if (!listener_) {
        listen();
    }
    relay_.emplace(files_.file("network"), socket());
}

void LifecycleTest::reach(const Stage& stage, Link link) {
    stage_ = &stage;
    link_ = link;
    if (link == Link::Network && !relay_) {
        makeNetwork();
    } else if (link == Link::Listener && !listener_) {
        listen();
    }
    arguments_ = stage.arguments;
    if (stage.prepare != nullptr) {
        stage.prepare(*this);
    }
    arguments_.insert(arguments_.begin() + 1, {"--handshake-timeout", "60"});
    if (link != Link::Child) {
        arguments_.insert(arguments_.begin() + 1, {"--connect", relay_ ? relay_->path() : socket()});
    }
    const std::vector<pid_t> before = link == Link::Child ? std::vector<pid_t>() : childrenOf(listener_->pid());
    Program::Options options;
    options.terminal = true;
    options.environment = {"TERM=xterm", "NO_COLOR=1"};
    client_ = std::make_unique<Program>(clientCommand(arguments_), options);
    stage.reach(*this);
    std::vector<pid_t> engines = childrenOf(link == Link::Child ? client_->pid() : listener_->pid());
    for (const pid_t other : before) {
        engines.erase(std::remove(engines.begin(), engines.end(), other), engines.end());
    }
    if (engines.size() != 1) {
        throw std::runtime_error("expected one engine at stage " + stage.name + ", got " +
                                 std::to_string(engines.size()));
    }
    engine_ = engines.front();
}

void LifecycleTest::finish() {
    if (stage_->finish != nullptr) {
        stage_->finish(*this);
    }
    const Ran ran = client_->finish();
    EXPECT_EQ(ran.err, stage_->said + stage_->end) << ran.out;
    EXPECT_EQ(ran.exitCode, stage_->exitCode);
    expectEngineGone("");
}

void LifecycleTest::leave() {
    if (stage_->leave != nullptr) {
        stage_->leave(*this);
    }
    constexpr std::chrono::milliseconds pause{50};
    constexpr int minute = 1200;
    for (int i = 0; i < minute && !endsWithin(client_->pid(), pause); ++i) {
        client_->pressCtrlC();
    }
    const std::string how = !stage_->running       ? ""
                            : link_ == Link::Child ? "; the engine was killed"
                                                   : "; the connection was closed, which ends the session";
    const Ran ran = client_->finish();
    EXPECT_EQ(ran.err, stage_->said + "krutil: cancelled" + how + "\n") << ran.out;
    EXPECT_EQ(ran.exitCode, 6);
}

void LifecycleTest::expectLostEngine(const std::string& how) {
    const std::string sentence =
        link_ == Link::Child ? plain("krutil: the engine " + how + stage_->when)
                             : "krutil: the engine was lost" + stage_->when + ": " + stage_->clientLost + writing;
    const Ran ran = client_->finish();
    EXPECT_THAT(ran.err, MatchesRegex(plain(stage_->said) + sentence + "\n")) << ran.out;
    EXPECT_EQ(ran.exitCode, stage_->lostExitCode);
}

void LifecycleTest::expectLostClient(int number) {
    const std::string sentence = "krutil-qvm: " + stage_->engineLost + writing + "\n";
    const Ran ran = client_->finish();
    EXPECT_EQ(ran.exitCode, 128 + number);
    EXPECT_THAT(ran.err, MatchesRegex(plain(stage_->said) + (link_ == Link::Child ? sentence : ""))) << ran.out;
    if (link_ == Link::Child) {
        EXPECT_EQ(exitCodeOf(engine_), 3);
    } else {
        expectEngineGone(sentence);
    }
}

void LifecycleTest::expectEngineGone(const std::string& said) {
    EXPECT_TRUE(waitUntilGone(engine_));
    if (link_ != Link::Child) {
        expectListenerSays(said);
    }
}

void LifecycleTest::expectNoSessions() {
    // It reaps them when it is told of their end.
    EXPECT_TRUE(test_support::eventually([this] { return childrenOf(listener_->pid()).empty(); }));
    EXPECT_EQ(descriptorsOf(listener_->pid()), descriptors_);
}

void LifecycleTest::expectListenerGone() {
    const Ran ran = listener_->finish();
    EXPECT_THAT(ran.err, MatchesRegex(log_));
    EXPECT_EQ(ran.exitCode, 0);
    EXPECT_TRUE(std::filesystem::is_empty(sockets_.file("")));
    listener_.reset();
}

LifecycleTest::Apart LifecycleTest::setApart() {
    return {stage_, engine_, std::move(client_)};
}

void LifecycleTest::takeBack(Apart&& apart) {
    stage_ = apart.stage;
    engine_ = apart.engine;
    client_ = std::move(apart.client);
}
}  // namespace programs_test
