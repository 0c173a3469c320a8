// What the lines to a listener's sessions may do to it.
#include "qvm/process/Seats.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace qvm_test {
namespace {

// A file takes no part in a conversation, and is readable for ever.
TEST(SeatsTest, ALineThatFailsIsNotWatchedAnyMore) {
    qvm::Seats seats(1);
    seats.add(1, foundation::core::posix::OwnedDescriptor(::open("/dev/zero", O_RDONLY | O_CLOEXEC)));
    std::vector<pollfd> watched;
    seats.appendTo(watched);
    ASSERT_EQ(watched.size(), 1U);
    ASSERT_GE(watched[0].fd, 0);

    EXPECT_TRUE(seats.answer(qvm::Seats::Clock::now()).empty());
    watched.clear();
    seats.appendTo(watched);
    ASSERT_EQ(watched.size(), 1U);
    EXPECT_EQ(watched[0].fd, -1);
}

}  // namespace
}  // namespace qvm_test
