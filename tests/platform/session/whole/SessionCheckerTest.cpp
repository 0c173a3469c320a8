// Frames of recorded sessions that keep to the rules, and what only a recording can break. What a session refuses as
// well is in SessionRulesTest.
#include "foundation/msg_svc/transport/layers/session/SessionChecker.hpp"

#include <stdexcept>
#include <string>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using session::ProtocolViolation;
using session::SessionChecker;

class SessionCheckerTest : public testing::Test {
  protected:
    static std::string root(std::uint64_t stream, const std::string& tag, const std::string& content = {}) {
        return wire::tagged(stream, 1, true, tag, content);
    }

    // What is said of a frame; empty for one that keeps to the rules.
    std::string faultOf(Role sender, const std::string& frame) {
        try {
            checker_.take(sender, frame);
        } catch (const ProtocolViolation& violation) {
            return violation.what();
        }
        return {};
    }

    static SessionChecker::Settled settled() {
        SessionChecker::Settled result;
        result.clientLimits.frames = 2;
        result.engineLimits.tag = 13;
        result.sharedMemory = true;
        return result;
    }

    Registered protocol_{"test"};
    SessionChecker checker_{configOf(Role::Client), settled()};
};

TEST_F(SessionCheckerTest, WholeSessionBreaksNoRule) {
    EXPECT_EQ(faultOf(Role::Client, wire::data(1, 1, false, "bulk")), "");
    EXPECT_FALSE(checker_.atBoundary(Role::Client));
    EXPECT_TRUE(checker_.atBoundary(Role::Engine));
    EXPECT_EQ(faultOf(Role::Client, wire::tagged(1, 2, true, questionTag, "q")), "");
    EXPECT_TRUE(checker_.atBoundary(Role::Client));
    EXPECT_EQ(faultOf(Role::Engine, root(1, noticeTag, "n")), "");
    EXPECT_EQ(faultOf(Role::Engine, root(1, answerTag, "a")), "");
    // The number of an exchange that is over.
    EXPECT_EQ(faultOf(Role::Client, root(1, questionTag, "q")), "");
    EXPECT_EQ(faultOf(Role::Client, wire::goodbye()), "");
    EXPECT_EQ(faultOf(Role::Engine, root(1, answerTag, "a")), "");
    EXPECT_EQ(faultOf(Role::Engine, root(0, shutdownTag)), "");
}

TEST_F(SessionCheckerTest, EachEndHasLimitsOfItsOwn) {
    EXPECT_EQ(faultOf(Role::Client, wire::data(1, 1, false, "")), "");
    EXPECT_EQ(faultOf(Role::Client, wire::data(1, 2, false, "")), "");
    EXPECT_EQ(faultOf(Role::Client, wire::tagged(1, 3, true, questionTag, "q")), "");
    EXPECT_EQ(faultOf(Role::Engine, wire::data(1, 1, false, "")), "");
    EXPECT_EQ(faultOf(Role::Engine, wire::data(1, 2, false, "")), "");
    EXPECT_EQ(faultOf(Role::Engine, wire::tagged(1, 3, true, answerTag, "a")),
              "number of frames of a message exceeds the limit \"frames\": expected at most 2 frames, got 3");
    EXPECT_EQ(faultOf(Role::Client, root(2, "test:questions", "q")),
              "tag of frame 1 on stream 2 exceeds the limit \"tag\": expected at most 13 bytes, got 14");
}

TEST_F(SessionCheckerTest, FramesHaveTheSizesOfTheirHeaders) {
    const std::string frame = root(1, questionTag, "q");
    EXPECT_EQ(faultOf(Role::Client, frame.substr(0, 23)), "size of a frame: expected at least 24 bytes, got 23");
    SessionChecker longer(configOf(Role::Client), settled());
    EXPECT_EQ(textOf<ProtocolViolation>([&] { longer.take(Role::Client, frame + "x"); }),
              "size of frame 1 on stream 1: expected 14 bytes behind its header, got 15");
    SessionChecker shorter(configOf(Role::Client), settled());
    EXPECT_EQ(textOf<ProtocolViolation>([&] { shorter.take(Role::Client, frame.substr(0, frame.size() - 1)); }),
              "size of frame 1 on stream 1: expected 14 bytes behind its header, got 13");
}

TEST_F(SessionCheckerTest, NothingFollowsAnAbort) {
    EXPECT_EQ(faultOf(Role::Engine, wire::abort("why")), "");
    EXPECT_EQ(faultOf(Role::Client, wire::goodbye()), "");
    EXPECT_EQ(faultOf(Role::Engine, root(0, noticeTag, "n")), "frame behind an abort: expected none, got one more");
}

TEST_F(SessionCheckerTest, ContentsThatAreLentComeBackOnce) {
    const std::string content(1U << 20U, 'c');
    EXPECT_EQ(faultOf(Role::Client, wire::sharedData(1, 1, 7, 4096, content.size()) + content), "");
    EXPECT_EQ(faultOf(Role::Client, wire::tagged(1, 2, true, questionTag, "q")), "");
    // Not by the end that has lent it.
    SessionChecker own(configOf(Role::Client), settled());
    own.take(Role::Client, wire::sharedData(1, 1, 7, 4096, content.size()) + content);
    own.take(Role::Client, wire::tagged(1, 2, true, questionTag, "q"));
    EXPECT_EQ(textOf<ProtocolViolation>([&] { own.take(Role::Client, wire::giveBack(7)); }),
              "return frame: expected the number of a content that is lent, got 7");
    EXPECT_EQ(faultOf(Role::Engine, wire::giveBack(7)), "");
    EXPECT_EQ(faultOf(Role::Engine, wire::giveBack(7)),
              "return frame: expected the number of a content that is lent, got 7");
}

TEST_F(SessionCheckerTest, SharedContentsNeedASessionThatHasThem) {
    SessionChecker checker(configOf(Role::Client), {});
    EXPECT_EQ(textOf<ProtocolViolation>([&] { checker.take(Role::Client, wire::giveBack(7)); }),
              "frame kind: expected 1 (tagged), 2 (data), 3 (goodbye) or 4 (abort), got 6");
}

TEST_F(SessionCheckerTest, ProtocolMustBeRegistered) {
    SessionConfig config = configOf(Role::Client);
    config.protocol = "nothing";
    EXPECT_THROW(SessionChecker(config, {}), std::out_of_range);
}

}  // namespace
}  // namespace testing_sessions
