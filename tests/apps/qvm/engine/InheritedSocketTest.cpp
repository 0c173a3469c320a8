// An engine that a service manager has started for a socket.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <filesystem>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "support/AnotherUser.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using foundation::core::posix::OwnedDescriptor;

TEST(InheritedSocketTest, OneThatListensIsServed) {
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("socket");
    const OwnedDescriptor listening(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof(address.sun_path) - 1);
    ASSERT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
    ASSERT_EQ(::listen(listening.get(), 8), 0);
    EngineProcess engine({"--listen-fds"}, listening.get());
    // Whoever connects before the engine is there waits.
    EngineClient first(connectTo(path));
    EngineClient second(connectTo(path));
    first.eval("x = 1");
    EXPECT_EQ(second.eval("x").errorId(), "NameError");
    EXPECT_EQ(second.eval("import os\nprint([name for name in os.environ if name.startswith('LISTEN')])").output(),
              "[]\n");
    // The session's own stream, once for each direction; the listening socket is not left.
    EXPECT_EQ(second
                  .eval("print(sum('socket' in os.readlink(f'/proc/self/fd/{n}') for n in os.listdir('/proc/self/fd')"
                        " if os.path.exists(f'/proc/self/fd/{n}')))")
                  .output(),
              "2\n");
    EXPECT_EQ(engine.stderrText(), "krutil-qvm: serving the socket of the service manager\n");
    engine.signal(SIGTERM);
    EXPECT_EQ(engine.wait(), 0);
    // It is the service manager's.
    EXPECT_TRUE(std::filesystem::is_socket(path));
}

TEST(InheritedSocketTest, AConnectionIsOneSession) {
    std::array<int, 2> pair{};
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()), 0);
    OwnedDescriptor theirs(pair[1]);
    EngineProcess engine({"--listen-fds"}, theirs.get());
    theirs.reset();
    EngineClient client(pair[0]);
    EXPECT_EQ(client.eval("6 * 7").shown(), "42\n");
    EXPECT_EQ(client.goodbye().reason, session::SessionEnd::Reason::Finished);
    EXPECT_EQ(engine.wait(), 0);
}

TEST(InheritedSocketTest, AConnectionOfAnotherUserIsRefused) {
    if (!test_support::AnotherUser::isPossible()) {
        GTEST_SKIP() << "needs to become another user";
    }
    std::array<int, 2> pair{};
    {
        const test_support::AnotherUser nobody;
        ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()), 0);
    }
    const OwnedDescriptor ours(pair[0]);
    OwnedDescriptor theirs(pair[1]);
    ASSERT_EQ(::write(ours.get(), "not looked at", 13), 13);
    EngineProcess engine({"--listen-fds"}, theirs.get());
    theirs.reset();
    EXPECT_EQ(engine.wait(), 5);
    EXPECT_EQ(engine.stderrText(),
              "krutil-qvm: refused a client of user 65534, since this engine serves user 0 only\n");
    // What is closed with bytes that nobody has read.
    char byte = 0;
    EXPECT_EQ(::read(ours.get(), &byte, 1), -1);
    EXPECT_EQ(errno, ECONNRESET);
}

TEST(InheritedSocketTest, NoneIsAnError) {
    EngineProcess engine({"--listen-fds"});
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(),
              "krutil-qvm: --listen-fds: expected one socket from a service manager (LISTEN_FDS=1, LISTEN_PID=" +
                  std::to_string(engine.pid()) +
                  "), got LISTEN_FDS=, LISTEN_PID=; start the engine by a socket unit, or use --listen PATH.\n");
}

TEST(InheritedSocketTest, OneOfANetworkIsRefused) {
    const OwnedDescriptor network(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EngineProcess engine({"--listen-fds"}, network.get());
    EXPECT_EQ(engine.wait(), 3);
    EXPECT_EQ(engine.stderrText(),
              "krutil-qvm: --listen-fds: expected a Unix socket of the type SOCK_STREAM, got another descriptor; an "
              "engine is not served unencrypted over a network.\n");
}

}  // namespace
}  // namespace qvm_test
