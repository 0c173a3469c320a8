// Memory of large arrays that a process keeps, and for how long.
#include <gtest/gtest.h>

#include <chrono>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "platform/session/support/TestSessions.hpp"
#include "support/Eventually.hpp"

namespace testing_sessions {
namespace {

TEST(KeptMemoryTest, SessionGivesItBackWhenNobodyUsesItAndNothingArrives) {
    using framing::BufferAllocator;
    const Registered protocol{"test"};
    SessionConfig config = configOf(Role::Client);
    config.keepMemory = std::chrono::milliseconds(1);
    SessionPair pair(std::move(config), configOf(Role::Engine));
    char* const buffer = BufferAllocator::allocate(5U << 20);
    pair.engine->send(0, notice("a message that arrives while the memory is used"));
    pair.clientSaw.waitForLines(1);
    BufferAllocator::release(buffer);
    EXPECT_TRUE(test_support::eventually([] { return BufferAllocator::largeBytes() == 0; }));
}

}  // namespace
}  // namespace testing_sessions
