// What becomes of sessions when the engine that listens is killed or stopped, and what bad ends of sessions leave in
// it.

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>

#include "programs/lifecycle/Lifecycle.hpp"

namespace programs_test {
namespace {

class ListenerLifecycleTest : public LifecycleTest {
  protected:
    // Sessions at several stages at a time.
    std::vector<Apart> open() {
        std::vector<Apart> sessions;
        for (const char* stage : {"Idle", "TightLoop", "DebugPrompt"}) {
            reach(stageNamed(stage), Link::Listener);
            sessions.push_back(setApart());
        }
        return sessions;
    }

    std::vector<std::string> connecting(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin() + 1, {"--connect", socket()});
        return arguments;
    }

    // A connection on which `bytes` are all that is said.
    void say(const std::string& bytes) const {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        socket().copy(address.sun_path, sizeof address.sun_path - 1);
        const int connection = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        ASSERT_EQ(::connect(connection, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        ASSERT_EQ(::send(connection, bytes.data(), bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
        ::close(connection);
    }
};

class EndedListenerTest : public ListenerLifecycleTest, public ::testing::WithParamInterface<int> {};

TEST_P(EndedListenerTest, EndsItsSessionsAndLeavesNoFile) {
    auto sessions = open();
    listener().signal(GetParam());
    for (auto& session : sessions) {
        takeBack(std::move(session));
        expectLostEngine("");
        expectEngineGone("");
    }
    expectListenerGone();
}

INSTANTIATE_TEST_SUITE_P(Signals, EndedListenerTest, ::testing::Values(SIGTERM, SIGINT, SIGHUP),
                         [](const auto& each) { return ::sigabbrev_np(each.param); });

TEST_F(ListenerLifecycleTest, AStoppedSessionIsEndedToo) {
    reach(stageNamed("DebugPrompt"), Link::Listener);
    stop(engine());
    listener().signal(SIGTERM);
    expectLostEngine("");
    expectListenerGone();
}

TEST_F(ListenerLifecycleTest, AHangUpThatIsIgnoredStaysSo) {
    listen({"/usr/bin/env", "--ignore-signal=HUP"});
    listener().signal(SIGHUP);
    EXPECT_EQ(runClient(connecting({"eval", "6 * 7"})).out, "42\n");
}

TEST_F(ListenerLifecycleTest, AListenerWithoutPythonSaysSoAndServesNobody) {
    const Ran ran = run({"/usr/bin/env", "PYTHONHOME=/nonexistent", enginePath(), "--listen", socket()});
    const std::string said =
        "krutil-qvm: Python cannot be started: failed to get the Python codec of the filesystem encoding\n";
    EXPECT_EQ(ran.err.substr(ran.err.size() - std::min(ran.err.size(), said.size())), said) << ran.err;
    EXPECT_EQ(ran.exitCode, 3);
    EXPECT_FALSE(std::filesystem::exists(socket()));
}

TEST_F(ListenerLifecycleTest, AnEngineWithTooFewDescriptorsNamesTheLimit) {
    for (const std::string& limit : {std::string("20"), std::string("127")}) {
        for (const std::vector<std::string>& how : {std::vector<std::string>{"--listen", socket()}, {"--stdio"}}) {
            std::vector<std::string> arguments{"/usr/bin/prlimit", "--nofile=" + limit, enginePath()};
            arguments.insert(arguments.end(), how.begin(), how.end());
            const Ran ran = run(arguments);
            EXPECT_EQ(ran.err, "krutil-qvm: This process may have " + limit +
                                   " descriptors at a time (RLIMIT_NOFILE), and an engine needs 128. Raise the limit, "
                                   "for example with \"ulimit -n 1024\".\n");
            EXPECT_EQ(ran.exitCode, 3);
            EXPECT_FALSE(std::filesystem::exists(socket()));
        }
    }
}

TEST_F(ListenerLifecycleTest, AnEngineHasEnoughWithTheDescriptorsThatItNeeds) {
#if defined(KRUTIL_SANITIZED)
    GTEST_SKIP() << "sanitizers need descriptors";
#endif
    listen({"/usr/bin/prlimit", "--nofile=128"});
    const Ran ran = runClient(connecting({"eval", "import numpy; numpy.arange(3).sum()"}));
    EXPECT_EQ(ran.out + ran.err, "3\n");
}

TEST_F(ListenerLifecycleTest, SessionsOutliveAListenerThatIsKilled) {
    auto sessions = open();
    listener().signal(SIGKILL);
    EXPECT_TRUE(waitUntilGone(listener().pid()));
    // It could not tidy up; the next one does.
    EXPECT_TRUE(std::filesystem::is_socket(socket()));
    listen();
    EXPECT_EQ(runClient(connecting({"eval", "6 * 7"})).out, "42\n");
    for (auto& session : sessions) {
        takeBack(std::move(session));
        stage().answer(*this);
        finish();
        EXPECT_EQ(exitCodeOf(engine()), 0);
    }
}

TEST_F(ListenerLifecycleTest, AListenerThatIsStoppedKeepsNobodyWaitingForEver) {
    reach(stageNamed("DebugPrompt"), Link::Listener);
    stop(listener().pid());
    const Ran ran = runClient(connecting({"eval", "--handshake-timeout", "0.1", "6 * 7"}));
    EXPECT_EQ(ran.err,
              "krutil: the handshake timed out after 100 milliseconds: 0 of 16 bytes of the peer's first message had "
              "arrived\n");
    EXPECT_EQ(ran.exitCode, 3);
    // Sessions do not need it.
    stage().answer(*this);
    finish();
    resume(listener().pid());
    // The client that gave up is found when it is accepted, and has said why.
    const std::string said =
        "the session is refused by the client: the handshake timed out after 100 milliseconds: 0 of 16 bytes of the "
        "peer's first message had arrived\n";
    EXPECT_TRUE(listener().waitForErr(said));
    expectEngineGone("krutil-qvm: " + said);
}

TEST_F(ListenerLifecycleTest, BadEndsLeaveNothing) {
    listen();
    for (int i = 0; i < 3; ++i) {
        say("");
        say("GET / HTTP/1.1\r\n\r\n");
        say("\x89KRUTIL\n");
        runClient(connecting({"eval", "import os; os._exit(7)"}));
        runClient(connecting({"eval", "import os; os.abort()"}));
    }
    expectListenerSays("(krutil-qvm: .*\n)*");
}

}  // namespace
}  // namespace programs_test
