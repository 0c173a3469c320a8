// What happened to requests, from messages of a recording.
#include "krutil/inspect/Timelines.hpp"

#include <gtest/gtest.h>

#include <string>

#include "krutil.protobuf.EvalIIP.pb.h"
#include "krutil.protobuf.IIPEnqueueMessage.pb.h"

namespace krutil_client {
namespace {

using Role = apps::RecordedUnit::Role;

InspectedFrame taggedFrame(Role sender, std::uint64_t nanoseconds, const std::string& tag, const std::string& content) {
    InspectedFrame frame;
    frame.tag = tag;
    frame.content = content.size();
    frame.header.kind = static_cast<std::uint8_t>(FrameKind::Tagged);
    frame.header.tagSize = static_cast<std::uint16_t>(tag.size());
    frame.header.contentSize = content.size();
    frame.unit.sender = sender;
    frame.unit.nanoseconds = nanoseconds;
    frame.unit.bytes = std::string(FrameHeader::size, '\0') + tag + content;
    frame.unit.size = frame.unit.bytes.size();
    return frame;
}

InspectedMessage request(std::uint64_t nanoseconds, const std::string& identifier) {
    krutil::protobuf::EvalIIP eval;
    eval.set_cmd("1 + 1");
    krutil::protobuf::IIPEnqueueMessage enqueue;
    enqueue.set_iiphandle(1);
    InspectedMessage message;
    message.frames.push_back(taggedFrame(Role::Client, nanoseconds, "krutil:EvalIIP", eval.SerializeAsString()));
    message.frames.push_back(
        taggedFrame(Role::Client, nanoseconds, "krutil:IIPEnqueueMessage", enqueue.SerializeAsString()));
    message.request = identifier;
    return message;
}

InspectedMessage event(std::uint64_t nanoseconds, const std::string& identifier, const std::string& tag) {
    InspectedMessage message;
    message.frames.push_back(taggedFrame(Role::Engine, nanoseconds, tag, {}));
    message.request = identifier;
    return message;
}

TEST(TimelinesTest, RequestIsShownWithItsReply) {
    Timelines timelines;
    EXPECT_EQ(timelines.take(request(1'000'000, "ab")), "");
    EXPECT_EQ(timelines.take(event(1'500'000, "ab", "krutil:IIPStartedEvent")), "");
    EXPECT_EQ(timelines.take(event(2'000'000, "", "krutil:IIPStartedEvent")), "");
    EXPECT_EQ(timelines.take(event(2'001'000'000, "ab", "krutil:IIPReply")),
              "request ab: eval \"1 + 1\"\n"
              "   +0.000000 --> IIPEnqueueMessage, 95 bytes\n"
              "   +0.000500 <-- IIPStartedEvent, 46 bytes\n"
              "   +2.000000 <-- IIPReply: no result, 39 bytes\n");
    EXPECT_EQ(timelines.rest(), "");
}

TEST(TimelinesTest, MessagesOfOneTypeAreOneLine) {
    Timelines timelines;
    timelines.take(request(0, "ab"));
    for (std::uint64_t i = 1; i <= 1000; ++i) {
        EXPECT_EQ(timelines.take(event(i * 1'000, "ab", "krutil:TextBaseEvent")), "");
    }
    timelines.take(event(2'000'000, "ab", "krutil:IIPStartedEvent"));
    timelines.take(event(3'000'000, "ab", "krutil:TextBaseEvent"));
    EXPECT_EQ(timelines.take(event(4'000'000, "ab", "krutil:IIPReply")),
              "request ab: eval \"1 + 1\"\n"
              "   +0.000000 --> IIPEnqueueMessage, 95 bytes\n"
              "   +0.000001 <-- TextBaseEvent: output \"\" (1000 messages), 44000 bytes\n"
              "   +0.002000 <-- IIPStartedEvent, 46 bytes\n"
              "   +0.003000 <-- TextBaseEvent: output \"\", 44 bytes\n"
              "   +0.004000 <-- IIPReply: no result, 39 bytes\n");
}

TEST(TimelinesTest, RequestsOfTwoSessionsAreApart) {
    Timelines timelines;
    timelines.take(request(0, "ab"));
    InspectedMessage other = request(1'000'000, "ab");
    other.frames.front().unit.session = 1;
    EXPECT_EQ(timelines.take(other), "");
    EXPECT_EQ(timelines.take(event(2'000'000, "ab", "krutil:IIPReply")),
              "request ab: eval \"1 + 1\"\n"
              "   +0.000000 --> IIPEnqueueMessage, 95 bytes\n"
              "   +0.002000 <-- IIPReply: no result, 39 bytes\n");
}

TEST(TimelinesTest, RequestsWithoutAReplyAreShownInTheirOrder) {
    Timelines timelines;
    std::string expected;
    for (char c = 'z'; c >= 'a'; --c) {
        const std::string identifier(1, c);
        timelines.take(request(static_cast<std::uint64_t>('z' - c), identifier));
        expected += "request " + identifier +
                    ": eval \"1 + 1\"\n"
                    "   +0.000000 --> IIPEnqueueMessage, 95 bytes\n"
                    "   no reply\n";
    }
    EXPECT_EQ(timelines.rest(), expected);
    EXPECT_EQ(timelines.rest(), "");
}

}  // namespace
}  // namespace krutil_client
