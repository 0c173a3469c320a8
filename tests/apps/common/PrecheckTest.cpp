#include "common/Precheck.hpp"

#include <gtest/gtest.h>

#include <boost/shared_ptr.hpp>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "KrutilProtocol.hpp"
#include "apps/common/UnknownNumbers.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/transport/layers/message/Message.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"
#include "foundation/msg_svc/transport/layers/session/SessionError.hpp"

namespace apps {
namespace {

namespace proto = krutil::protobuf;
namespace serialization = foundation::msg_svc::transport::layers::serialization;
namespace session = foundation::msg_svc::transport::layers::session;
using foundation::msg_svc::transport::layers::message::Message;
using foundation::vantor::carrier::framing::Frame;
using foundation::vantor::carrier::framing::FrameBuffer;
using foundation::vantor::carrier::framing::FrameType;
using foundation::vantor::carrier::framing::TaggedFrame;
using namespace apps_test;

std::unique_ptr<TaggedFrame> frameOf(const std::string& tag, const std::string& content) {
    FrameBuffer buffer(FrameBuffer::first_type(new char[content.size() + 1], std::default_delete<char[]>()),
                       content.size());
    std::memcpy(buffer.first.get(), content.data(), content.size());
    return std::make_unique<TaggedFrame>(FrameType::Object, 1, tag, std::move(buffer), 1);
}

// What the check says; empty when it lets the frame pass.
std::string verdict(const std::string& tag, const std::string& content) {
    try {
        precheck(*frameOf(tag, content));
        return {};
    } catch (const session::ProtocolViolation& violation) {
        return violation.what();
    }
}

struct ErrorMessage {
    const char* tag;
    std::string (*make)(int depth, int status);
};

const std::vector<ErrorMessage> errorMessages{
    {"krutil:IIPResult", result}, {"krutil:FEvalResult", callResult}, {"krutil:PrintableErrorEvent", printableError}};

TEST(PrecheckTest, StreamsOfTextsOutsideTheirRangeAreRefused) {
    for (const int stream : {0, 1, 2}) {
        EXPECT_EQ(verdict("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(stream)), "");
        EXPECT_EQ(verdict("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(stream)), "");
    }
    for (const int stream : {-1, 3, 2'147'483'647, -2'147'483'647 - 1}) {
        const std::string expected = R"(": expected a stream from 0 to 2, got )" + std::to_string(stream);
        EXPECT_EQ(verdict("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(stream)),
                  R"(frame "krutil:TextBaseEvent)" + expected);
        EXPECT_EQ(verdict("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(stream)),
                  R"(frame "krutil:SinkTextEvent)" + expected);
    }
}

TEST(PrecheckTest, StatusesOutsideTheirRangeAreRefusedAtAnyDepth) {
    for (const auto& [tag, make] : errorMessages) {
        for (const int depth : {0, 1, 2, 30}) {
            for (const int status : {0, 1, 2, 3, 4, 5}) {
                EXPECT_EQ(verdict(tag, make(depth, status)), "") << depth;
            }
            for (const int status : {-1, 6, 2'147'483'647}) {
                EXPECT_EQ(
                    verdict(tag, make(depth, status)),
                    "frame \"" + std::string(tag) + "\": expected a status from 0 to 5, got " + std::to_string(status))
                    << depth;
            }
        }
    }
}

TEST(PrecheckTest, SentenceNamesTheFrameAndTheNumber) {
    EXPECT_EQ(verdict("krutil:IIPResult", result(0, 6)),
              "frame \"krutil:IIPResult\": expected a status from 0 to 5, got 6");
}

TEST(PrecheckTest, WhatLiesBelowTheParsersDepthIsNotSeenByTheSerializersEither) {
    for (const auto& [tag, make] : errorMessages) {
        EXPECT_EQ(verdict(tag, make(150, 99)), "") << tag;
    }
}

TEST(PrecheckTest, FramesOfOtherTypesAndEmptyOnesPass) {
    // The number that would be a bad stream of a text.
    EXPECT_EQ(verdict("krutil:IIPReply", textEvent<proto::TextBaseEvent>(7)), "");
    EXPECT_EQ(verdict("unknown", textEvent<proto::TextBaseEvent>(7)), "");
    for (const char* tag : {"krutil:TextBaseEvent", "krutil:SinkTextEvent", "krutil:IIPResult", "krutil:FEvalResult",
                            "krutil:PrintableErrorEvent"}) {
        EXPECT_EQ(verdict(tag, ""), "");
        EXPECT_EQ(verdict(tag, "\xff\xff\xff"), "");
    }
}

// The serializers themselves, which end the process for what the check is to refuse.
class PrecheckAgainstSerializersTest : public ::testing::Test {
  protected:
    using Event = boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>;
    using EventSerializer = serialization::SerializerAPI<foundation::msg_svc::eventmgr::BaseEvent, Event, Event>;

    PrecheckAgainstSerializersTest() {
        ::testing::FLAGS_gtest_death_test_style = "threadsafe";
        using krutil::protobuf::KrutilProtocol;
        KrutilProtocol::protocolInitializer(registry, KrutilProtocol::protocolVersion, {{"ZEROCOPY", "enable"}});
    }

    void read(const std::string& tag, const std::string& content) const {
        std::vector<std::unique_ptr<Frame>> frames(1);
        frames.push_back(frameOf(tag, content));
        const auto message = std::make_unique<Message>(std::move(frames));
        dynamic_cast<const EventSerializer&>(*registry->find(tag)).deserialize(1, message, registry, {});
    }

    // The check refuses what the serializer dies of, at whichever byte the content is cut, and lets the rest pass.
    void checkEachCut(const std::string& tag, const std::string& content, const std::string& lastWords) {
        std::vector<std::size_t> refused;
        for (std::size_t length = 0; length <= content.size(); ++length) {
            if (verdict(tag, content.substr(0, length)).empty()) {
                read(tag, content.substr(0, length));
            } else {
                refused.push_back(length);
            }
        }
        ASSERT_GE(refused.size(), 2U);
        ASSERT_LT(refused.size(), content.size());
        EXPECT_DEATH(read(tag, content.substr(0, refused.front())), lastWords);
        EXPECT_DEATH(read(tag, content.substr(0, refused.back())), lastWords);
    }

    std::shared_ptr<serialization::Registry> registry = std::make_shared<serialization::Registry>();
};

TEST_F(PrecheckAgainstSerializersTest, CutTextEventsAreJudgedAsTheyAreRead) {
    checkEachCut("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(7),
                 "Unsupported krutil::protobuf::StreamType");
    checkEachCut("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(-7),
                 "Unsupported krutil::protobuf::StreamType");
}

TEST_F(PrecheckAgainstSerializersTest, CutErrorsAreJudgedAsTheyAreRead) {
    checkEachCut("krutil:PrintableErrorEvent", printableError(3, 9), "Unsupported protobuf::ExecutionStatus value");
}

TEST_F(PrecheckAgainstSerializersTest, ErrorsBelowTheParsersDepthAreRead) {
    read("krutil:PrintableErrorEvent", printableError(150, 99));
}

}  // namespace
}  // namespace apps
