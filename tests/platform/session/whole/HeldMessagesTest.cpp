// Messages that are held, for one write together with what follows.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/session/support/TestSessions.hpp"

namespace testing_sessions {
namespace {

using testing::ElementsAre;

class HeldMessagesTest : public testing::Test {
  protected:
    void hold(const std::string& text) { pair_.engine->send(0, notice(text), Session::Urgency::Held); }
    std::uint64_t written() const { return pair_.engine->traffic().written; }

    Registered protocol_{"test"};
    SessionPair pair_;
};

TEST_F(HeldMessagesTest, LeaveWithTheNextOneAndBeforeIt) {
    hold("1");
    hold("2");
    EXPECT_EQ(written(), 0U);
    pair_.engine->send(0, notice("3"));
    EXPECT_THAT(pair_.clientSaw.waitForLines(3), ElementsAre("event 0 1", "event 0 2", "event 0 3"));
}

TEST_F(HeldMessagesTest, LeaveWhenTheSenderSaysSo) {
    hold("1");
    EXPECT_EQ(written(), 0U);
    pair_.engine->sendHeld();
    EXPECT_GT(written(), 0U);
    EXPECT_THAT(pair_.clientSaw.waitForLines(1), ElementsAre("event 0 1"));
}

TEST_F(HeldMessagesTest, LeaveWhenTheyAreMany) {
    const std::string text(Session::heldBytes / 2, 'x');
    hold(text);
    EXPECT_EQ(written(), 0U);
    hold(text);
    EXPECT_GT(written(), Session::heldBytes);
    pair_.clientSaw.waitForLines(2);
}

TEST_F(HeldMessagesTest, LeaveBeforeAWaitForTheStream) {
    hold("1");
    EXPECT_TRUE(pair_.engine->waitUntilWritten());
    EXPECT_THAT(pair_.clientSaw.waitForLines(1), ElementsAre("event 0 1"));
}

TEST_F(HeldMessagesTest, LeaveBeforeTheSessionIsClosed) {
    hold("1");
    pair_.engine->close();
    EXPECT_EQ(pair_.clientSaw.waitForLines(2).front(), "event 0 1");
}

TEST_F(HeldMessagesTest, LeaveBeforeAnAbort) {
    hold("1");
    pair_.engine->abort("enough");
    EXPECT_THAT(pair_.clientSaw.waitForLines(2),
                ElementsAre("event 0 1", "end: violation: the peer closed the session: enough"));
}

TEST(HeldRoomTest, HeldMessagesTakeRoomUntilTheyAreWritten) {
    const Registered protocol{"test"};
    SessionConfig config = configOf(Role::Engine);
    config.roomBytes = 1;
    SessionPair pair(configOf(Role::Client), std::move(config));
    pair.engine->send(0, notice("1"), Session::Urgency::Held);
    // There is no room, so the wait sends what takes it.
    EXPECT_TRUE(pair.engine->waitForRoom());
    EXPECT_THAT(pair.clientSaw.waitForLines(1), ElementsAre("event 0 1"));
}

}  // namespace
}  // namespace testing_sessions
