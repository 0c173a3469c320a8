#include "krutil/session/EngineProcess.hpp"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>

#include "krutil/base/ExitCode.hpp"
#include "programs/support/Program.hpp"
#include "support/AnotherUser.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

using namespace std::chrono_literals;

EngineProcess shell(const std::string& command) {
    return EngineProcess::start({"/bin/sh", "-c", command});
}

std::string readLine(int fd) {
    std::string line;
    for (char c = 0; ::read(fd, &c, 1) == 1 && c != '\n';) {
        line += c;
    }
    return line;
}

TEST(EngineProcessTest, TellsHowTheChildEnded) {
    auto exits = shell("exit 7");
    const auto exited = exits.waitForEnd(60s);
    ASSERT_TRUE(exited);
    EXPECT_EQ(exited->text(), "exited with code 7");
    auto dies = shell("kill -SEGV $$");
    const auto died = dies.waitForEnd(60s);
    ASSERT_TRUE(died);
    EXPECT_EQ(died->text(), "was killed by signal 11 (Segmentation fault)");
}

TEST(EngineProcessTest, ItsStreamIsItsStandardInputAndOutput) {
    auto engine = shell("read line; echo \"got $line\"");
    ASSERT_EQ(::write(engine.stream(), "this\n", 5), 5);
    EXPECT_EQ(readLine(engine.stream()), "got this");
}

TEST(EngineProcessTest, AChildThatRunsIsKilledWhenTheObjectGoes) {
    pid_t pid = 0;
    {
        auto engine = shell("echo $$; exec sleep 600");
        pid = std::stoi(readLine(engine.stream()));
        EXPECT_FALSE(engine.waitForEnd(0s));
        EXPECT_TRUE(engine.isChild());
    }
    EXPECT_EQ(::kill(pid, 0), -1);
}

TEST(EngineProcessTest, TheWatchIsReadableWhenTheChildHasEnded) {
    auto engine = shell("exit 0");
    pollfd watched{engine.watch(), POLLIN, 0};
    EXPECT_EQ(::poll(&watched, 1, 60'000), 1);
}

TEST(EngineProcessTest, InheritsNothingButStandardError) {
    const foundation::core::posix::OwnedDescriptor leaked(::dup(STDIN_FILENO));
    auto engine = shell("exec ls /proc/self/fd");
    std::string names;
    for (std::string line; !(line = readLine(engine.stream())).empty();) {
        names += line + " ";
    }
    // 3 is the directory that is being listed.
    EXPECT_EQ(names, "0 1 2 3 ");
}

TEST(EngineProcessTest, CtrlCOfTheTerminalIsNoSignalToIt) {
    auto engine = shell("kill -INT $$; echo survived");
    EXPECT_EQ(readLine(engine.stream()), "survived");
}

TEST(EngineProcessTest, ACommandHasAProcessGroupOfItsOwn) {
    auto engine = EngineProcess::startCommand("echo $$; exec ps -o pgid= -p $$");
    const std::string pid = readLine(engine.stream());
    EXPECT_EQ(std::stoi(readLine(engine.stream())), std::stoi(pid));
}

TEST(EngineProcessTest, ACommandIsKilledWithWhatItStarted) {
    pid_t pid = 0;
    {
        auto engine = EngineProcess::startCommand("sleep 600 & echo $!; wait");
        pid = std::stoi(readLine(engine.stream()));
    }
    EXPECT_TRUE(programs_test::waitUntilGone(pid));
}

TEST(EngineProcessTest, AProgramThatIsNotThereIsSaidToBe) {
    try {
        EngineProcess::start({"/nonexistent/engine", "--stdio"});
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Stream);
        EXPECT_STREQ(failure.what(), "cannot start the engine '/nonexistent/engine': No such file or directory");
    }
}

TEST(EngineProcessTest, ASocketPathHasALimit) {
    for (const std::string& path : {std::string(), std::string(108, 'x')}) {
        try {
            EngineProcess::connect(path);
            FAIL();
        } catch (const Failure& failure) {
            EXPECT_EQ(failure.code(), ExitCode::Stream);
            EXPECT_EQ(failure.what(), "cannot connect to '" + path + "': a socket's path has 1 to 107 bytes");
        }
    }
}

// A Unix socket of that path, which does not listen yet.
foundation::core::posix::OwnedDescriptor socketAt(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    foundation::core::posix::OwnedDescriptor made(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::bind(made.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    return made;
}

TEST(EngineProcessTest, AnEngineOfAnotherUserIsRefusedBeforeAByteIsSent) {
    if (!test_support::AnotherUser::isPossible()) {
        GTEST_SKIP() << "needs to become another user";
    }
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("s");
    const auto listener = socketAt(path);
    {
        const test_support::AnotherUser nobody;
        ASSERT_EQ(::listen(listener.get(), 1), 0);
    }
    try {
        EngineProcess::connect(path);
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(failure.code(), ExitCode::Stream);
        EXPECT_EQ(failure.what(), "cannot connect to '" + path +
                                      "': the engine there runs as user 65534, not as user 0 as this program does");
    }
    const foundation::core::posix::OwnedDescriptor accepted(::accept(listener.get(), nullptr, nullptr));
    char byte = 0;
    EXPECT_EQ(::read(accepted.get(), &byte, 1), 0);
}

// The system's service manager listens as root, and starts the engine as this program's user.
TEST(EngineProcessTest, ASocketOfTheServiceManagerIsThoughtTheUsersOwn) {
    if (!test_support::AnotherUser::isPossible()) {
        GTEST_SKIP() << "needs to become another user";
    }
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("s");
    const auto listener = socketAt(path);
    ASSERT_EQ(::listen(listener.get(), 1), 0);
    ASSERT_EQ(::chmod(path.c_str(), 0666), 0);
    ASSERT_EQ(::chmod(directory.path().c_str(), 0711), 0);
    const test_support::AnotherUser nobody;
    EXPECT_GE(EngineProcess::connect(path).stream(), 0);
}

TEST(EngineProcessTest, AConnectionIsNoChild) {
    const test_support::TemporaryDirectory directory;
    const std::string path = directory.file("s");
    const auto listener = socketAt(path);
    ASSERT_EQ(::listen(listener.get(), 1), 0);
    auto engine = EngineProcess::connect(path);
    EXPECT_FALSE(engine.isChild());
    EXPECT_EQ(engine.watch(), -1);
    EXPECT_FALSE(engine.waitForEnd(60s));
    EXPECT_GE(engine.stream(), 0);
}

}  // namespace
}  // namespace krutil_client
