#include "common/Precheck.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <boost/shared_ptr.hpp>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "KrutilProtocol.hpp"
#include "apps/common/UnknownNumbers.hpp"
#include "common/MessageNames.hpp"
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
        precheck(true)->check(*frameOf(tag, content));
        return {};
    } catch (const session::ProtocolViolation& violation) {
        return violation.what();
    }
}

struct ErrorMessage {
    const char* tag;
    const char* path;
    std::string (*make)(int depth, int status);
};

const std::vector<ErrorMessage> errorMessages{{"krutil:IIPResult", "exception", result},
                                              {"krutil:FEvalResult", "iipResult.exception", callResult},
                                              {"krutil:PrintableErrorEvent", "except", printableError}};

TEST(PrecheckTest, StreamsOfTextsOutsideTheirRangeAreRefused) {
    for (const int stream : {0, 1, 2}) {
        EXPECT_EQ(verdict("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(stream)), "");
        EXPECT_EQ(verdict("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(stream)), "");
    }
    for (const int stream : {-1, 3, 2'147'483'647, -2'147'483'647 - 1}) {
        EXPECT_EQ(verdict("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(stream)),
                  refusalOfStream("krutil:TextBaseEvent", stream));
        EXPECT_EQ(verdict("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(stream)),
                  refusalOfStream("krutil:SinkTextEvent", stream));
    }
}

TEST(PrecheckTest, StatusesOutsideTheirRangeAreRefusedAtAnyDepth) {
    for (const auto& [tag, path, make] : errorMessages) {
        for (const int depth : {0, 1, 2, 30}) {
            for (const int status : {0, 1, 2, 3, 4, 5}) {
                EXPECT_EQ(verdict(tag, make(depth, status)), "") << depth;
            }
            for (const int status : {-1, 6, 2'147'483'647}) {
                const std::string message = make(depth, status);
                EXPECT_EQ(verdict(tag, message), refusalOfStatus(tag, path, message, depth, status)) << depth;
            }
        }
    }
}

TEST(PrecheckTest, SentenceNamesTheFrameThePlaceAndTheNumber) {
    EXPECT_EQ(
        verdict("krutil:IIPResult", result(2, 6)),
        "frame \"krutil:IIPResult\", byte 32, field exception.causes (2 times).status: expected a status from 0 to "
        "5, got 6");
}

TEST(PrecheckTest, SentenceNamesWhatIsKnownOfThePlace) {
    EXPECT_EQ(verdict("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(7)),
              R"(frame "krutil:TextBaseEvent", byte 2, field stream: expected a stream from 0 to 2, got 7)");
    EXPECT_EQ(verdict("krutil:TextBaseEvent", std::string(1, '\0')),
              R"(frame "krutil:TextBaseEvent", byte 0: expected a field number from 1 on, got 0)");
}

TEST(PrecheckTest, WithoutNumbersOnlyTheirRangesAreFree) {
    const auto structure = precheck(false);
    for (const auto& [tag, path, make] : errorMessages) {
        EXPECT_NO_THROW(structure->check(*frameOf(tag, make(3, 6))));
        EXPECT_THROW(structure->check(*frameOf(tag, make(3, 6) + "\x08")), session::ProtocolViolation);
    }
    EXPECT_EQ(precheck(false), structure) << "made once";
}

TEST(PrecheckTest, WhatIsDeeperThanTheParserReadsIsRefused) {
    for (const auto& [tag, path, make] : errorMessages) {
        EXPECT_THAT(verdict(tag, make(150, 5)),
                    testing::EndsWith(": expected at most 100 messages inside one another, got more"))
            << tag;
    }
}

TEST(PrecheckTest, ContentsOfEveryTypeAreLookedAt) {
    for (const MessageName& name : messageNames()) {
        const std::string tag(name.tag);
        EXPECT_EQ(verdict(tag, ""), "");
        EXPECT_EQ(verdict(tag, "\xff\xff\xff"), "frame \"" + tag + "\", byte 0: expected 1 more byte, got none");
    }
    EXPECT_EQ(verdict("unknown", "\xff\xff\xff"), "");
    // The number that would be a bad stream of a text.
    EXPECT_EQ(verdict("krutil:IIPReply", textEvent<proto::TextBaseEvent>(7)), "");
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

    // What the serializer dies of is refused.
    void checkFatal(const std::string& tag, const std::string& content, const std::string& lastWords) {
        EXPECT_NE(verdict(tag, content), "");
        EXPECT_DEATH(read(tag, content), lastWords);
    }

    std::shared_ptr<serialization::Registry> registry = std::make_shared<serialization::Registry>();
};

TEST_F(PrecheckAgainstSerializersTest, NumbersThatTheyDieOf) {
    checkFatal("krutil:TextBaseEvent", textEvent<proto::TextBaseEvent>(7), "Unsupported krutil::protobuf::StreamType");
    checkFatal("krutil:SinkTextEvent", textEvent<proto::SinkTextEvent>(-7), "Unsupported krutil::protobuf::StreamType");
    checkFatal("krutil:PrintableErrorEvent", printableError(3, 9), "Unsupported protobuf::ExecutionStatus value");
    // The parser has read the number when the content ends.
    const std::string whole = textEvent<proto::TextBaseEvent>(7);
    checkFatal("krutil:TextBaseEvent", whole.substr(0, 4), "Unsupported krutil::protobuf::StreamType");
}

// They take what they have read for the whole, so it is refused before they see it.
TEST_F(PrecheckAgainstSerializersTest, EachCutIsReadByThemAndRefusedBefore) {
    const std::string whole = textEvent<proto::TextBaseEvent>(1);
    for (std::size_t length = 0; length <= whole.size(); ++length) {
        const std::string cut = whole.substr(0, length);
        EXPECT_NO_THROW(read("krutil:TextBaseEvent", cut));
        // A field ends there.
        const bool isWhole = length == 0 || length == 2 || length == 4 || length == whole.size();
        EXPECT_EQ(verdict("krutil:TextBaseEvent", cut).empty(), isWhole) << length;
    }
}

TEST_F(PrecheckAgainstSerializersTest, ErrorsBelowTheParsersDepthAreRead) {
    read("krutil:PrintableErrorEvent", printableError(150, 99));
}

}  // namespace
}  // namespace apps
