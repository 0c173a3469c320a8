// What a later file of a recording repeats of earlier ones.
#include "common/RecordedState.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace apps {
namespace {

using Direction = RecordedState::Direction;
using Part = RecordedState::Part;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr unsigned last = 0x80;

class RecordedStateTest : public ::testing::Test {
  protected:
    RecordedStateTest() { state_.beginSession(RecordedState::Role::Client); }

    // Of a tagged frame; without a tag of a data frame.
    static std::string frame(unsigned bits, unsigned stream, const std::string& tag, std::size_t content = 1) {
        std::string bytes(24, '\0');
        bytes[0] = static_cast<char>((tag.empty() ? 2U : 1U) | bits);
        bytes[2] = static_cast<char>(tag.size());
        bytes[4] = static_cast<char>(stream);
        return bytes + tag + std::string(content, 'c');
    }

    void note(Direction direction, std::string bytes, Part part = Part::Frame) {
        // In pieces, as a session hands them over.
        std::string first = bytes.substr(0, 2);
        std::string rest = bytes.substr(2);
        const std::array<iovec, 2> pieces{iovec{first.data(), first.size()}, iovec{rest.data(), rest.size()}};
        state_.note(direction, part, ++time_, pieces, bytes.size());
    }

    void clientBegins(unsigned stream) {
        note(Direction::Sent, frame(0, stream, "krutil:EvalIIP"));
        note(Direction::Sent, frame(last, stream, "krutil:IIPEnqueueMessage"));
    }

    void engineSays(unsigned stream, const std::string& tag) { note(Direction::Received, frame(last, stream, tag)); }

    // Tags of what is kept, with the stream.
    std::vector<std::string> kept() const {
        std::vector<std::string> tags;
        for (const RecordedState::Unit* unit : state_.units()) {
            tags.push_back(std::to_string(unit->bytes.at(4)) + " " +
                           unit->bytes.substr(24, static_cast<unsigned char>(unit->bytes.at(2))));
        }
        return tags;
    }

    RecordedState state_{1'000'000};
    std::uint64_t time_ = 0;
};

TEST_F(RecordedStateTest, HandshakeStays) {
    note(Direction::Sent, "the first message", Part::Handshake);
    note(Direction::Received, "a verdict", Part::Handshake);
    const auto units = state_.units();
    ASSERT_EQ(units.size(), 2U);
    EXPECT_EQ(units[0]->bytes, "the first message");
    EXPECT_EQ(units[0]->direction, Direction::Sent);
    EXPECT_EQ(units[0]->part, Part::Handshake);
    EXPECT_EQ(units[0]->nanoseconds, 1U);
    EXPECT_EQ(units[1]->bytes, "a verdict");
    EXPECT_EQ(units[1]->direction, Direction::Received);
    EXPECT_EQ(units[1]->size, 9U);
}

TEST_F(RecordedStateTest, ExchangesStayUntilTheirReply) {
    clientBegins(1);
    clientBegins(2);
    engineSays(1, "krutil:IIPStartedEvent");
    engineSays(1, "krutil:TextBaseEvent");
    EXPECT_THAT(kept(), ElementsAre("1 krutil:EvalIIP", "1 krutil:IIPEnqueueMessage", "2 krutil:EvalIIP",
                                    "2 krutil:IIPEnqueueMessage", "1 krutil:IIPStartedEvent"));
    note(Direction::Received, frame(0, 1, "krutil:IIPResult"));
    EXPECT_EQ(kept().back(), "1 krutil:IIPResult");
    engineSays(1, "krutil:IIPReply");
    EXPECT_THAT(kept(), ElementsAre("2 krutil:EvalIIP", "2 krutil:IIPEnqueueMessage"));
    note(Direction::Sent, frame(last, 3, "krutil:IIPCancelMessage"));
    engineSays(2, "krutil:IIPReply");
    EXPECT_THAT(kept(), ElementsAre("3 krutil:IIPCancelMessage"));
    engineSays(3, "krutil:IIPCancelReply");
    EXPECT_THAT(kept(), IsEmpty());
}

TEST_F(RecordedStateTest, PromptsAreForgottenWhenTheyClose) {
    note(Direction::Sent, frame(last, 1, "krutil:IIPEnqueueMessage"));
    for (int i = 0; i < 2; ++i) {
        engineSays(1, "krutil:IIPSuspendedEvent");
        engineSays(1, "krutil:DebugLoopEvent");
        EXPECT_THAT(kept(),
                    ElementsAre("1 krutil:IIPEnqueueMessage", "1 krutil:IIPSuspendedEvent", "1 krutil:DebugLoopEvent"));
        engineSays(1, "krutil:DebugLoopEvent");
        engineSays(1, "krutil:IIPResumedEvent");
        EXPECT_THAT(kept(), ElementsAre("1 krutil:IIPEnqueueMessage"));
    }
}

TEST_F(RecordedStateTest, EventsOfNoExchangeAreNotKept) {
    engineSays(0, "krutil:IIPStartedEvent");
    engineSays(7, "krutil:IIPStartedEvent");
    note(Direction::Sent, frame(last, 0, "krutil:capabilities_api:CapabilitiesChanged"));
    EXPECT_THAT(kept(), IsEmpty());
}

TEST_F(RecordedStateTest, GoodbyeStays) {
    note(Direction::Sent, "\x03" + std::string(23, '\0'));
    EXPECT_THAT(kept(), ElementsAre("0 "));
}

TEST_F(RecordedStateTest, PartsOfFramesAreNot) {
    note(Direction::Received, "\x81 cut");
    EXPECT_THAT(kept(), IsEmpty());
}

TEST_F(RecordedStateTest, OfLargeFramesHeaderAndTagAreKept) {
    note(Direction::Sent, frame(0, 1, "", 65'536 - 24));
    note(Direction::Sent, frame(0, 1, "", 65'537 - 24));
    note(Direction::Sent, frame(0, 1, "krutil:QDA", 100'000));
    const auto units = state_.units();
    ASSERT_EQ(units.size(), 3U);
    EXPECT_EQ(units[0]->bytes.size(), 65'536U);
    EXPECT_EQ(units[1]->bytes.size(), 24U);
    EXPECT_EQ(units[1]->size, 65'537U);
    EXPECT_EQ(units[2]->bytes.size(), 34U);
    EXPECT_EQ(units[2]->size, 100'034U);
}

TEST_F(RecordedStateTest, MemoryIsBounded) {
    state_ = RecordedState(1'000);
    state_.beginSession(RecordedState::Role::Client);
    // Whole, 24 + 4 + 400 + 160; then the header and the tag, 24 + 4 + 160; then nothing.
    note(Direction::Sent, frame(last, 1, "root", 400));
    note(Direction::Sent, frame(last, 2, "root", 400));
    note(Direction::Sent, frame(last, 3, "root", 400));
    note(Direction::Sent, frame(0, 4, "first", 1));
    note(Direction::Sent, frame(last, 4, "root", 400));
    engineSays(4, "krutil:IIPStartedEvent");
    EXPECT_THAT(kept(), ElementsAre("1 root", "2 root", "3 root"));
    EXPECT_EQ(state_.units()[0]->bytes.size(), 428U);
    EXPECT_EQ(state_.units()[1]->bytes.size(), 28U);
    // What is closed makes room.
    engineSays(1, "krutil:IIPReply");
    note(Direction::Sent, frame(last, 5, "root", 400));
    EXPECT_THAT(kept(), ElementsAre("2 root", "3 root", "5 root"));
    for (unsigned stream : {2U, 3U, 5U}) {
        engineSays(stream, "krutil:IIPReply");
    }
    note(Direction::Sent, frame(last, 6, "root", 800));
    EXPECT_EQ(state_.units().at(0)->bytes.size(), 828U);
}

TEST_F(RecordedStateTest, SessionBeginsWithNothing) {
    note(Direction::Sent, "hello", Part::Handshake);
    clientBegins(1);
    state_.beginSession(RecordedState::Role::Engine);
    EXPECT_THAT(kept(), IsEmpty());
    note(Direction::Received, frame(last, 1, "krutil:IIPEnqueueMessage"));
    EXPECT_THAT(kept(), ElementsAre("1 krutil:IIPEnqueueMessage"));
}

}  // namespace
}  // namespace apps
