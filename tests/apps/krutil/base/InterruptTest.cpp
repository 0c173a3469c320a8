#include "krutil/base/Interrupt.hpp"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <csignal>
#include <thread>

#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

bool readable(int fd) {
    pollfd watched{fd, POLLIN, 0};
    return ::poll(&watched, 1, 0) == 1;
}

TEST(InterruptTest, CtrlCIsReadableUntilItIsDispatched) {
    Interrupt interrupt;
    EXPECT_FALSE(readable(interrupt.fd()));
    interrupt.dispatch();
    ::raise(SIGINT);
    EXPECT_TRUE(readable(interrupt.fd()));
    EXPECT_THROW(interrupt.dispatch(), Cancelled);
    EXPECT_FALSE(readable(interrupt.fd()));
    interrupt.dispatch();
}

TEST(InterruptTest, TheActionCanBeReplacedEvenByItself) {
    Interrupt interrupt;
    int first = 0;
    int second = 0;
    interrupt.setAction([&] {
        ++first;
        interrupt.setAction([&] { ++second; });
    });
    ::raise(SIGINT);
    interrupt.dispatch();
    ::raise(SIGINT);
    interrupt.dispatch();
    EXPECT_EQ(first, 1);
    EXPECT_EQ(second, 1);
}

TEST(InterruptTest, ASocketIsShutDownOnlyWhileThatIsAskedFor) {
    Interrupt interrupt;
    interrupt.setAction([] {});
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
    const foundation::core::posix::OwnedDescriptor here(ends[0]);
    const foundation::core::posix::OwnedDescriptor there(ends[1]);
    { const Interrupt::ShutsDown shutsDown(here.get()); }
    ::raise(SIGINT);
    EXPECT_FALSE(readable(there.get()));
    {
        const Interrupt::ShutsDown shutsDown(here.get());
        ::raise(SIGINT);
    }
    char byte = 0;
    EXPECT_TRUE(readable(there.get()));
    EXPECT_EQ(::read(there.get(), &byte, 1), 0);
}

TEST(InterruptTest, WakingIsNoCtrlC) {
    Interrupt interrupt;
    Interrupt::wake();
    EXPECT_TRUE(readable(interrupt.fd()));
    interrupt.dispatch();
    EXPECT_FALSE(readable(interrupt.fd()));
}

TEST(InterruptTest, InputIsWaitedForUntilCtrlC) {
    Interrupt interrupt;
    int ends[2];
    ASSERT_EQ(::pipe(ends), 0);
    const foundation::core::posix::OwnedDescriptor input(ends[0]);
    foundation::core::posix::OwnedDescriptor output(ends[1]);
    ::raise(SIGINT);
    EXPECT_THROW(interrupt.waitForInput(input.get()), Cancelled);
    // Ctrl-C counts where there is input, too: a file without end always has some.
    ASSERT_EQ(::write(output.get(), "1", 1), 1);
    interrupt.waitForInput(input.get());
    ::raise(SIGINT);
    EXPECT_THROW(interrupt.waitForInput(input.get()), Cancelled);
    char byte = 0;
    ASSERT_EQ(::read(input.get(), &byte, 1), 1);
    // An action that does not throw, and a wake-up, are no input.
    int pressed = 0;
    interrupt.setAction([&] {
        ++pressed;
        output.reset();
    });
    Interrupt::wake();
    std::thread person([main = ::pthread_self()] { ::pthread_kill(main, SIGINT); });
    interrupt.waitForInput(input.get());
    person.join();
    EXPECT_EQ(pressed, 1);
    EXPECT_EQ(::read(input.get(), &byte, 1), 0);
}

TEST(InterruptTest, CtrlCAfterItsEndDoesNothing) {
    { const Interrupt interrupt; }
    ::raise(SIGINT);
    Interrupt next;
    EXPECT_FALSE(readable(next.fd()));
}

TEST(InterruptTest, AnIgnoredCtrlCStaysIgnored) {
    const auto previous = std::signal(SIGINT, SIG_IGN);
    {
        Interrupt interrupt;
        ::raise(SIGINT);
        EXPECT_FALSE(readable(interrupt.fd()));
    }
    std::signal(SIGINT, previous);
}

}  // namespace
}  // namespace krutil_client
