// What a recorder is given of a session.
#include "foundation/msg_svc/transport/layers/session/SessionRecorder.hpp"

#include <future>
#include <mutex>
#include <string>
#include <vector>

#include "platform/session/support/TestSessions.hpp"
#include "platform/session/support/WireBytes.hpp"

namespace testing_sessions {
namespace {

using session::SessionRecorder;
using testing::ElementsAre;
using testing::SizeIs;

// Of an array that is shared. No other test's arrays have it: memory is kept by size, and the whole process has one
// pool.
constexpr std::size_t sharedSize = 3U << 20;

// Keeps the units: "> " before what was sent, "< " before what was received, "h" for those of the handshake.
class KeptUnits final : public SessionRecorder {
  public:
    void record(Direction direction, Part part, std::span<const iovec> unit) noexcept override {
        std::string text = direction == Direction::Sent ? ">" : "<";
        text += part == Part::Handshake ? "h " : " ";
        for (const iovec& piece : unit) {
            text.append(static_cast<const char*>(piece.iov_base), piece.iov_len);
        }
        const std::lock_guard lock(mutex_);
        units_.push_back(text);
    }

    std::vector<std::string> all() const {
        const std::lock_guard lock(mutex_);
        return units_;
    }

    // Without those of the handshake.
    std::vector<std::string> frames() const {
        std::vector<std::string> units = all();
        std::erase_if(units, [](const std::string& unit) { return unit[1] == 'h'; });
        return units;
    }

  private:
    mutable std::mutex mutex_;
    std::vector<std::string> units_;
};

class RecorderTest : public ::testing::Test {
  protected:
    SessionConfig recorded(Role role) {
        SessionConfig config = configOf(role);
        config.recorder = &units_;
        return config;
    }

    const Registered protocol_{"test"};
    KeptUnits units_{};
};

TEST_F(RecorderTest, SeesEachUnitOfTheStream) {
    SessionWithBytes end(recorded(Role::Client));
    const auto handshake = units_.all();
    ASSERT_THAT(handshake, SizeIs(4));
    EXPECT_EQ(handshake[0].substr(0, 11), ">h \x89KRUTIL\n");
    msg_svc::protobuf::SessionHello hello = wire::hello(msg_svc::protobuf::SessionHello::ENGINE);
    hello.set_build(configOf(Role::Client).build);
    EXPECT_EQ(handshake[1], "<h " + wire::helloBytes(hello));
    EXPECT_EQ(handshake[2], ">h " + wire::verdictBytes(wire::acceptance()));
    EXPECT_EQ(handshake[3], "<h " + wire::verdictBytes(wire::acceptance()));

    const auto bulk = std::make_shared<Bulk>();
    bulk->bytes = "bytes";
    end.session->send(1, question("q", {bulk}));
    end.peer->write(wire::tagged(1, 1, true, answerTag, "a"));
    end.saw.waitForLines(1);
    end.session->sayGoodbye();
    EXPECT_THAT(units_.frames(),
                ElementsAre("> " + wire::data(1, 1, false, "bytes"), "> " + wire::tagged(1, 2, true, questionTag, "q"),
                            "< " + wire::tagged(1, 1, true, answerTag, "a"), "> " + wire::goodbye()));
}

TEST_F(RecorderTest, RequestComesBeforeItsAnswerAtBothEnds) {
    SessionPair pair(recorded(Role::Client));
    pair.engineSaw.answerWith(
        [&](framing::StreamID stream, const Question&) { pair.engine->send(stream, answer("a")); });
    for (framing::StreamID stream = 1; stream <= 200; ++stream) {
        pair.client->send(stream, question("q"));
    }
    pair.clientSaw.waitForLines(200);
    std::size_t asked = 0;
    std::size_t answered = 0;
    for (const std::string& unit : units_.frames()) {
        (unit[0] == '>' ? asked : answered) += 1;
        ASSERT_LE(answered, asked);
    }
    EXPECT_EQ(answered, 200U);
}

TEST_F(RecorderTest, FrameThatWasRefusedIsRecordedAsFarAsItIsThere) {
    SessionWithBytes end(recorded(Role::Client));
    const std::string bad = wire::header({9, true, 29, 0, 1, 1, 5});
    end.peer->write(bad + "never");
    const std::string reason = end.saw.waitForEnd().text;
    EXPECT_THAT(units_.frames(), ElementsAre("< " + bad, "> " + wire::abort(reason)));
}

TEST_F(RecorderTest, FrameThatTheStreamCutIsRecordedAsFarAsItIsThere) {
    SessionWithBytes end(recorded(Role::Client));
    const std::string whole = wire::tagged(1, 1, true, noticeTag, "a notice");
    end.peer->write(whole.substr(0, whole.size() - 3));
    end.peer->close();
    end.saw.waitForEnd();
    EXPECT_THAT(units_.frames(), ElementsAre("< " + whole.substr(0, whole.size() - 3)));
}

TEST_F(RecorderTest, HandshakeThatFailsIsRecordedAsFarAsItCame) {
    const Ends ends = socketPair();
    wire::ByteEnd peer(ends.otherIn, ends.otherOut);
    peer.write("bash: no such thing\n");
    EXPECT_THROW(Session::open(ends.in, ends.out, recorded(Role::Client)), session::ProtocolViolation);
    EXPECT_THAT(units_.all(), ElementsAre(testing::StartsWith(">h \x89KRUTIL\n"), "<h bash: no such thing\n"));
}

TEST_F(RecorderTest, SharedContentFollowsItsFrameAtBothEnds) {
    KeptUnits engineUnits;
    SessionConfig client = recorded(Role::Client);
    client.sharedMemory = true;
    SessionConfig engine = configOf(Role::Engine);
    engine.sharedMemory = true;
    engine.recorder = &engineUnits;
    SessionPair pair(client, engine);
    const auto handshake = units_.all();
    ASSERT_THAT(handshake, SizeIs(8));
    EXPECT_THAT(handshake[4], SizeIs(3 + 8));
    EXPECT_THAT(handshake[6], SizeIs(3 + 1));

    // Memory is kept for the second one of its size.
    const framing::StreamID first = pair.client->newStreamID();
    pair.client->send(first, question("q", {bulkOf(sharedSize)}));
    pair.engineSaw.waitForLines(1);
    const framing::StreamID second = pair.client->newStreamID();
    pair.client->send(second, question("q", {bulkOf(sharedSize)}));
    pair.engineSaw.waitForLines(2);
    // What comes back may be there already, or not yet.
    std::vector<std::string> sent = units_.frames();
    std::erase_if(sent, [](const std::string& unit) { return unit[0] == '<'; });
    ASSERT_THAT(sent, SizeIs(4));
    EXPECT_TRUE(sent[0] == "> " + wire::data(first, 1, false, std::string(sharedSize, 'b')));
    const std::string shared = wire::sharedData(second, 1, 0, 0, sharedSize);
    EXPECT_EQ(sent[2].substr(0, 2 + 24), "> " + shared.substr(0, 24));
    EXPECT_EQ(sent[2].substr(2 + 40, 8), wire::little(sharedSize, 8));
    EXPECT_TRUE(sent[2].substr(2 + 48) == std::string(sharedSize, 'b'));
    std::vector<std::string> received = engineUnits.frames();
    std::erase_if(received, [](const std::string& unit) { return unit[0] == '>'; });
    ASSERT_THAT(received, SizeIs(4));
    EXPECT_TRUE(received[2].substr(1) == sent[2].substr(1));
}

}  // namespace
}  // namespace testing_sessions
