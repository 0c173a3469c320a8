// Client, engine and what is between them killed, stopped, slowed and cut at each stage of a session: the other side
// ends in good order or says what is wrong, and nothing is left.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pty.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <fstream>

#include "programs/lifecycle/Lifecycle.hpp"

namespace programs_test {
namespace {

using ::testing::ValuesIn;
using Way = Relay::Way;

// A stage of the table, and one of the ways in which the two are joined there.
struct Case {
    std::string stage;
    Link link;
};

std::ostream& operator<<(std::ostream& out, const Case& each) {
    return out << each.stage << nameOf(each.link);
}

std::vector<Case> casesOf(const std::vector<Link>& links, bool (*wanted)(const Stage&)) {
    std::vector<Case> cases;
    for (const Stage& stage : stages()) {
        for (const Link link : stage.links) {
            if (wanted(stage) && std::find(links.begin(), links.end(), link) != links.end()) {
                cases.push_back({stage.name, link});
            }
        }
    }
    return cases;
}

bool any(const Stage&) {
    return true;
}

bool leadsOut(const Stage& stage) {
    return stage.answer != nullptr;
}

bool isCommon(const Stage& stage) {
    return stage.name == "Idle" || stage.name == "TightLoop" || stage.name == "DebugPrompt";
}

const std::vector<Link> eachLink{Link::Child, Link::Listener, Link::Network};

const auto caseName = [](const ::testing::TestParamInfo<Case>& info) { return ::testing::PrintToString(info.param); };

class StageTest : public LifecycleTest, public ::testing::WithParamInterface<Case> {
  protected:
    void reach() { LifecycleTest::reach(stageNamed(GetParam().stage), GetParam().link); }
};

// Killed.

class KilledEngineTest : public StageTest {};

TEST_P(KilledEngineTest, IsTalkedAboutByItsClient) {
    reach();
    signalOne(engine(), SIGKILL);
    expectLostEngine("was killed by signal 9 (Killed)");
    expectEngineGone(
        plain("krutil-qvm: the session of process " + std::to_string(engine()) + " was ended by signal 9 (Killed)\n"));
}

INSTANTIATE_TEST_SUITE_P(Stages, KilledEngineTest, ValuesIn(casesOf(eachLink, any)), caseName);

class KilledClientTest : public StageTest {};

TEST_P(KilledClientTest, EndsItsEngine) {
    reach();
    client().signal(SIGKILL);
    EXPECT_TRUE(waitUntilGone(client().pid()));
    // There is a stage where it stands still.
    resume(engine());
    expectLostClient(SIGKILL);
}

INSTANTIATE_TEST_SUITE_P(Stages, KilledClientTest, ValuesIn(casesOf(eachLink, any)), caseName);

// Signals by which a person, a terminal or a system ends programs.

struct Signal {
    int number;
    const char* name;
    const char* description;
};

std::ostream& operator<<(std::ostream& out, const Signal& signal) {
    return out << signal.name;
}

class EndedTest : public LifecycleTest, public ::testing::WithParamInterface<std::tuple<Case, Signal>> {
  protected:
    const Signal& signal() const { return std::get<Signal>(GetParam()); }
    void reach() {
        const Case& each = std::get<Case>(GetParam());
        LifecycleTest::reach(stageNamed(each.stage), each.link);
    }
};

TEST_P(EndedTest, EngineIsTalkedAboutByItsClient) {
    reach();
    signalOne(engine(), signal().number);
    const std::string how = "by signal " + std::to_string(signal().number) + " (" + signal().description + ")";
    expectLostEngine("was killed " + how);
    expectEngineGone(
        plain("krutil-qvm: the session of process " + std::to_string(engine()) + " was ended " + how + "\n"));
}

TEST_P(EndedTest, ClientEndsItsEngine) {
    reach();
    client().signal(signal().number);
    expectLostClient(signal().number);
}

INSTANTIATE_TEST_SUITE_P(Stages, EndedTest,
                         ::testing::Combine(ValuesIn(casesOf({Link::Child, Link::Listener}, isCommon)),
                                            ::testing::Values(Signal{SIGTERM, "Term", "Terminated"},
                                                              Signal{SIGHUP, "Hup", "Hangup"})),
                         [](const auto& each) {
                             return ::testing::PrintToString(std::get<Case>(each.param)) +
                                    std::get<Signal>(each.param).name;
                         });

// What a terminal does to all that runs in it.
class TerminalEndTest : public LifecycleTest {
  protected:
    TerminalEndTest() {
        terminal_ = -1;
        client_ = ::forkpty(&terminal_, nullptr, nullptr, nullptr);
        if (client_ == 0) {
            const std::string program = clientCommand({}).front();
            ::execl(program.c_str(), program.c_str(), "eval", "print('o' + 'n')\nwhile True: pass", nullptr);
            ::_exit(127);
        }
        std::string screen;
        char byte = 0;
        while (screen.find("on\r\n") == std::string::npos && ::read(terminal_, &byte, 1) == 1) {
            screen += byte;
        }
        engine_ = onlyChildOf(client_);
    }

    int terminal_;
    pid_t client_;
    pid_t engine_;
};

TEST_F(TerminalEndTest, AClosedTerminalEndsBoth) {
    ::close(terminal_);
    EXPECT_EQ(exitCodeOf(client_), 128 + SIGHUP);
    EXPECT_TRUE(waitUntilGone(engine_));
}

TEST_F(TerminalEndTest, TheQuitKeyEndsBoth) {
    EXPECT_EQ(::write(terminal_, "\x1c", 1), 1);
    EXPECT_EQ(exitCodeOf(client_), 128 + SIGQUIT);
    EXPECT_TRUE(waitUntilGone(engine_));
    ::close(terminal_);
}

// An engine that is not the client's own child, but one of a shell's.
class EngineBehindAShellTest : public LifecycleTest {
  protected:
    EngineBehindAShellTest() {
        Program::Options options;
        options.terminal = true;
        client_.emplace(clientCommand({"eval", "--engine", quotedForShell(enginePath()) + " --stdio; exit $?",
                                       "print('o' + 'n')\nwhile True: pass"}),
                        options);
        EXPECT_TRUE(client_->waitForOut("on\r\n"));
        shell_ = onlyChildOf(client_->pid());
        engine_ = onlyChildOf(shell_);
    }

    std::optional<Program> client_;
    pid_t shell_ = -1;
    pid_t engine_ = -1;
};

TEST_F(EngineBehindAShellTest, EndsWithItsClient) {
    client_->signal(SIGKILL);
    EXPECT_EQ(client_->finish().err,
              "krutil-qvm: the stream ended between two messages, without the client's goodbye\n");
    EXPECT_TRUE(waitUntilGone(engine_));
    EXPECT_EQ(exitCodeOf(shell_), 3);
}

TEST_F(EngineBehindAShellTest, EndsWithTheShellThatTheClientKills) {
    while (!endsWithin(client_->pid(), std::chrono::milliseconds(50))) {
        client_->pressCtrlC();
    }
    EXPECT_EQ(client_->finish().exitCode, 6);
    EXPECT_TRUE(waitUntilGone(engine_));
}

TEST_F(EngineBehindAShellTest, IsTalkedAboutWhenItIsKilled) {
    signalOne(engine_, SIGKILL);
    const Ran ran = client_->finish();
    EXPECT_THAT(ran.err, ::testing::EndsWith("krutil: the engine exited with code 137 before it answered\n"));
    EXPECT_EQ(ran.exitCode, 3);
}

// Stopped.

class StoppedEngineTest : public StageTest {};

TEST_P(StoppedEngineTest, GoesOnWhereItWas) {
    reach();
    stop(engine());
    stage().answer(*this);
    resume(engine());
    finish();
}

INSTANTIATE_TEST_SUITE_P(Stages, StoppedEngineTest, ValuesIn(casesOf({Link::Child, Link::Network}, leadsOut)),
                         caseName);

class StoppedClientTest : public StageTest {};

TEST_P(StoppedClientTest, GoesOnWhereItWas) {
    reach();
    stop(client().pid());
    stage().answer(*this);
    resume(client().pid());
    finish();
}

INSTANTIATE_TEST_SUITE_P(Stages, StoppedClientTest, ValuesIn(casesOf({Link::Child, Link::Network}, leadsOut)),
                         caseName);

TEST_F(LifecycleTest, AnEngineThatEndsWhileItsClientIsStoppedHasEndedWell) {
    static const Stage leaving{
        .name = "Leaving",
        .links = {},
        .arguments = {"eval"},
        .prepare =
            [](LifecycleTest& test) {
                test.addArgument(
                    "import atexit, os, time\n"
                    "def leave():\n"
                    "    print('leaving', flush=True)\n"
                    "    while not os.path.exists('" +
                    test.file("gate") +
                    "'): time.sleep(0.001)\n"
                    "_ = atexit.register(leave)");
            },
        .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("leaving\r\n")); }};
    reach(leaving, Link::Child);
    stop(client().pid());
    std::ofstream(file("gate")) << "open";
    EXPECT_TRUE(waitUntilGone(engine()));
    resume(client().pid());
    finish();
}

TEST_F(LifecycleTest, WhatASessionHasBeenThroughLeavesNoDescriptor) {
    reach(stageNamed("Idle"), Link::Child);
    const auto enter = [this](const std::string& line, const std::string& shown) {
        client().type(line + "\r");
        EXPECT_TRUE(client().waitForOut(shown)) << line;
    };
    const auto all = [&] {
        enter("input('name' + '? ')", "name? ");
        enter("Ada", "'Ada'\r\n");
        EXPECT_TRUE(client().waitForOut(">>> "));
        enter("breakpoint()", "debug> ");
        enter("6 * 7", "42\r\n");
        EXPECT_TRUE(client().waitForOut("debug> "));
        enter(":q", ">>> ");
        enter("import time; print('o' + 'n'); time.sleep(1000)", "on\r\n");
        client().pressCtrlC();
        EXPECT_TRUE(client().waitForErr("krutil: cancelled\n"));
        EXPECT_TRUE(client().waitForOut(">>> "));
    };
    // Modules that are loaded when they are needed may stay open.
    all();
    const auto ofClient = descriptorsOf(client().pid());
    const auto ofEngine = descriptorsOf(engine());
    all();
    EXPECT_EQ(descriptorsOf(client().pid()), ofClient);
    EXPECT_EQ(descriptorsOf(engine()), ofEngine);
    client().type("\x04");
    EXPECT_EQ(client().finish().exitCode, 0);
    expectEngineGone("");
}

class DeadEngineTest : public StageTest {};

TEST_P(DeadEngineTest, CanBeLeft) {
    reach();
    stop(engine());
    leave();
    // It is killed if it is the client's child, and goes by itself when it finds that the client has gone.
    resume(engine());
    expectEngineGone("krutil-qvm: .*\n");
}

INSTANTIATE_TEST_SUITE_P(Stages, DeadEngineTest, ValuesIn(casesOf(eachLink, any)), caseName);

class DeadClientTest : public StageTest {};

TEST_P(DeadClientTest, CanBeKilled) {
    reach();
    stop(client().pid());
    client().signal(SIGKILL);
    expectLostClient(SIGKILL);
}

INSTANTIATE_TEST_SUITE_P(Stages, DeadClientTest,
                         ValuesIn(casesOf(eachLink,
                                          [](const Stage& stage) {
                                              return stage.name == "Output" || stage.name == "ArrayToClient";
                                          })),
                         caseName);

// Slowed and cut.

// The stages that a network can be in the way of.
std::vector<Case> casesOverANetwork(bool (*wanted)(const Stage&)) {
    std::vector<Case> cases = casesOf({Link::Listener, Link::Network}, wanted);
    for (Case& each : cases) {
        each.link = Link::Network;
    }
    return cases;
}

class CutNetworkTest : public StageTest {};

TEST_P(CutNetworkTest, IsTalkedAboutAtBothEnds) {
    reach();
    relay().cut();
    expectLostEngine("");
    expectEngineGone("krutil-qvm: " + stage().engineLost + writing + "\n");
}

INSTANTIATE_TEST_SUITE_P(Stages, CutNetworkTest, ValuesIn(casesOverANetwork(any)), caseName);

class HalfCutNetworkTest : public LifecycleTest, public ::testing::WithParamInterface<Way> {};

TEST_P(HalfCutNetworkTest, IsTalkedAboutAtBothEnds) {
    reach(stageNamed("TightLoop"), Link::Network);
    relay().end(GetParam());
    expectLostEngine("");
    expectEngineGone("krutil-qvm: " + stage().engineLost + writing + "\n");
}

INSTANTIATE_TEST_SUITE_P(Ways, HalfCutNetworkTest, ::testing::Values(Way::ToEngine, Way::ToClient),
                         [](const auto& each) { return each.param == Way::ToEngine ? "ToEngine" : "ToClient"; });

class SilentNetworkTest : public StageTest {};

TEST_P(SilentNetworkTest, CanBeLeft) {
    reach();
    relay().hold(Way::ToEngine);
    relay().hold(Way::ToClient);
    leave();
    expectEngineGone("krutil-qvm: .*\n");
}

INSTANTIATE_TEST_SUITE_P(Stages, SilentNetworkTest, ValuesIn(casesOverANetwork(isCommon)), caseName);

class SlowNetworkTest : public StageTest {};

TEST_P(SlowNetworkTest, ChangesNothing) {
    makeNetwork();
    // A whole array would take a while byte by byte.
    relay().passInPieces(GetParam().stage.starts_with("Array") ? 997 : 1);
    reach();
    stage().answer(*this);
    finish();
}

INSTANTIATE_TEST_SUITE_P(Stages, SlowNetworkTest, ValuesIn(casesOverANetwork(leadsOut)), caseName);

class PeerThatDoesNotReadTest : public LifecycleTest {
  protected:
    // More than an engine keeps that is not written.
    static constexpr int lines = 30'000;

    void start(Link link) {
        static const Stage counting{
            .name = "Counting",
            .links = {},
            .arguments = {"eval", "for i in range(" + std::to_string(lines) + "): print(i)"},
            .reach = [](LifecycleTest& test) { EXPECT_TRUE(test.client().waitForOut("7\r\n")); }};
        reach(counting, link);
    }

    void expectAll() {
        const Ran ran = client().finish();
        std::string all;
        for (int i = 0; i < lines; ++i) {
            all += std::to_string(i) + "\r\n";
        }
        EXPECT_TRUE(ran.out == all) << ran.out.size() << " of " << all.size() << " bytes have come";
        EXPECT_EQ(ran.err, "");
        EXPECT_EQ(ran.exitCode, 0);
        expectEngineGone("");
    }
};

TEST_F(PeerThatDoesNotReadTest, LosesNothing) {
    start(Link::Network);
    relay().hold(Way::ToClient);
    relay().passAll(Way::ToClient);
    expectAll();
}

TEST_F(PeerThatDoesNotReadTest, CanBeAskedToCancelAllTheSame) {
    reach(stageNamed("Output"), Link::Network);
    relay().hold(Way::ToClient);
    client().pressCtrlC();
    relay().passAll(Way::ToClient);
    finish();
}

TEST_F(PeerThatDoesNotReadTest, MayStandStillAgainAndAgain) {
    start(Link::Child);
    for (int i = 0; i < 20; ++i) {
        for (const pid_t each : {engine(), client().pid()}) {
            stop(each);
            resume(each);
        }
        EXPECT_TRUE(client().waitForOut("\n"));
    }
    expectAll();
}

}  // namespace
}  // namespace programs_test
