// What counts as a difference between a recording and what an engine says now.
#include "krutil/replay/Comparison.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "krutil.protobuf.IssuedWarningEvent.pb.h"
#include "krutil.protobuf.TextBaseEvent.pb.h"

namespace krutil_client {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

Said message(std::uint32_t stream, const std::string& tag, const std::string& content = {}) {
    return {Said::Kind::Message, stream, {{true, 29, tag, content}}, 100, 0};
}

Said text(std::uint32_t stream, const std::string& written, int sink = 0) {
    krutil::protobuf::TextBaseEvent event;
    event.mutable_id()->set_lo(stream);
    event.set_stream(static_cast<krutil::protobuf::StreamType>(sink));
    event.set_text(written);
    return message(stream, "krutil:TextBaseEvent", event.SerializeAsString());
}

Said warning(double time, const std::string& identifier) {
    krutil::protobuf::IssuedWarningEvent event;
    event.mutable_id()->set_lo(1);
    auto& said = *event.mutable_warning();
    said.set_identifier(identifier);
    said.set_format("f");
    said.set_message("m");
    said.set_wasdisabled(false);
    said.set_datenum(time);
    return message(1, "korvel:lang:diagnostic:IssuedWarningEvent", event.SerializeAsString());
}

const Said reply = message(1, "krutil:IIPReply");
const Said shutdown = message(0, "krutil:QVMShutdownEvent");

// Of a session with one request, on stream 1.
std::vector<std::string> differences(std::vector<Said> before, const std::vector<Said>& now) {
    Talk talk;
    talk.client.push_back({message(1, "krutil:IIPEnqueueMessage"), 0});
    talk.engine = std::move(before);
    const auto all = compare(talk, now);
    EXPECT_EQ(all.size(), 2U);
    EXPECT_EQ(all[0].what, "request 1 on stream 1 (krutil:IIPEnqueueMessage)");
    EXPECT_EQ(all[1].what, "messages of no request");
    std::vector<std::string> found = all[0].differences;
    found.insert(found.end(), all[1].differences.begin(), all[1].differences.end());
    return found;
}

TEST(ComparisonTest, TextMayComeInOtherPieces) {
    EXPECT_THAT(differences({text(1, "ab"), text(1, "cd"), reply, shutdown},
                            {text(1, "a"), text(1, "bc"), text(1, "d"), reply, shutdown}),
                IsEmpty());
    EXPECT_THAT(differences({text(1, "ab"), text(1, "cd", 1), reply, shutdown},
                            {text(1, "abc"), text(1, "d", 1), reply, shutdown}),
                ElementsAre("message 1, krutil:TextBaseEvent (byte 100), frame 1: modified: text: \"ab\" -> \"abc\"",
                            "message 2, krutil:TextBaseEvent (byte 100), frame 1: modified: text: \"cd\" -> \"d\""));
}

TEST(ComparisonTest, TextOfNoRequestHasAnOrderForEachSink) {
    EXPECT_THAT(differences({text(0, "a"), text(0, "x", 1), text(0, "b"), reply, shutdown},
                            {text(0, "x", 1), text(0, "ab"), reply, shutdown}),
                IsEmpty());
}

TEST(ComparisonTest, AddressesAndTimesMayDiffer) {
    EXPECT_THAT(differences({text(1, "at 0x7f12ab> 0x1f"), warning(1, "w"), reply, shutdown},
                            {text(1, "at 0x55ffff00> 0x1f"), warning(2, "w"), reply, shutdown}),
                IsEmpty());
    EXPECT_THAT(differences({text(1, "0x1f"), warning(1, "w"), reply, shutdown},
                            {text(1, "0x2f"), warning(1, "v"), reply, shutdown}),
                ElementsAre("message 1, krutil:TextBaseEvent (byte 100), frame 1: modified: text: \"0x1f\" -> \"0x2f\"",
                            "message 2, korvel:lang:diagnostic:IssuedWarningEvent (byte 100), frame 1: modified: "
                            "warning.identifier: \"w\" -> \"v\""));
}

TEST(ComparisonTest, MissingAndFurtherMessagesAreNamed) {
    EXPECT_THAT(differences({text(1, "a"), reply, shutdown}, {text(1, "a")}),
                ElementsAre("message 2 (byte 100): expected krutil:IIPReply, got no more",
                            "message 1 (byte 100): expected krutil:QVMShutdownEvent, got no more"));
    EXPECT_THAT(differences({reply, shutdown}, {text(1, "a"), reply, shutdown}),
                ElementsAre("message 1, krutil:IIPReply (byte 100): got krutil:TextBaseEvent"));
    EXPECT_THAT(differences({shutdown}, {text(1, "a"), shutdown}),
                ElementsAre("message 1: expected no more, got krutil:TextBaseEvent"));
    // The recording ends early.
    EXPECT_THAT(differences({text(1, "a")}, {text(1, "a"), reply, shutdown}), IsEmpty());
}

TEST(ComparisonTest, DataIsComparedByteForByte) {
    const auto array = [](const std::string& bytes) {
        Said said = reply;
        said.frames.insert(said.frames.begin(), SaidFrame{false, 11, {}, bytes});
        return said;
    };
    EXPECT_THAT(differences({array("12345678"), shutdown}, {array("12345678"), shutdown}), IsEmpty());
    EXPECT_THAT(differences({array("12345678"), shutdown}, {array("12345x78"), shutdown}),
                ElementsAre("message 1, krutil:IIPReply (byte 100), frame 1: its 8 bytes differ from byte 5 on"));
    EXPECT_THAT(differences({array("12345678"), shutdown}, {array("1234"), shutdown}),
                ElementsAre("message 1, krutil:IIPReply (byte 100), frame 1: expected 8 bytes, got 4"));
    EXPECT_THAT(differences({array("12345678"), shutdown}, {reply, shutdown}),
                ElementsAre("message 1, krutil:IIPReply (byte 100): expected 2 frames, got 1"));
}

TEST(ComparisonTest, RequestsOnAStreamFollowEachOther) {
    Talk talk;
    talk.client.push_back({message(1, "krutil:IIPEnqueueMessage"), 0});
    talk.client.push_back({message(2, "krutil:IIPCancelMessage"), 0});
    talk.client.push_back({message(1, "krutil:IIPEnqueueMessage"), 0});
    talk.engine = {text(1, "first"), reply, text(1, "second"), message(2, "krutil:IIPCancelReply"), reply, shutdown};
    const auto all = compare(
        talk, {message(2, "krutil:IIPCancelReply"), text(1, "first"), reply, text(1, "other"), reply, shutdown});
    ASSERT_EQ(all.size(), 4U);
    EXPECT_THAT(all[0].differences, IsEmpty());
    EXPECT_EQ(all[1].what, "request 2 on stream 2 (krutil:IIPCancelMessage)");
    EXPECT_THAT(all[1].differences, IsEmpty());
    EXPECT_EQ(all[2].what, "request 3 on stream 1 (krutil:IIPEnqueueMessage)");
    EXPECT_EQ(all[2].differences.size(), 1U);
    EXPECT_THAT(all[3].differences, IsEmpty());
}

}  // namespace
}  // namespace krutil_client
