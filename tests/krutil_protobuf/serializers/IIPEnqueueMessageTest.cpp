// Messages that hand a request to an engine's queue: the request first, then the message that refers to it.

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include <stdexcept>

#include "EvalIIPSerializer.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/serializers/SerializerTest.hpp"

namespace {

using cmddistributor::EvalIIP;
using cmddistributor::IIP;
using cmddistributor::IIPEnqueueMessage;
using foundation::msg_svc::exchange::IDType;
using krutil::io::SinkTraits;
using krutil::protobuf_serializer::EvalIIPSerializer;
using krutil::protobuf_serializer::IIPEnqueueMessageSerializer;
using krutil::protobuf_serializer::IIPFamily;
using krutil::protobuf_serializer::MessageFamily;
using krutil::protobuf_serializer::SharedFamily;
using transport::errorText;
using transport::FrameContent;
using transport::FrameIndex;
using transport::FrameType;
using transport::parsed;
using transport::Registry;
using transport::SerializationContext;
namespace modes = krutil::cmddistributor::WhenToDequeue;
namespace wire = krutil::protobuf;

const std::string evalTag = "krutil:EvalIIP";
const std::string enqueueTag = "krutil:IIPEnqueueMessage";

boost::shared_ptr<const IIP> evalRequest() {
    return boost::make_shared<EvalIIP>("x", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, SinkTraits(),
                                       SinkTraits(), u"1", cmddistributor::CodeType::CodeBlockType);
}

std::string evalBytes() {
    return EvalIIPSerializer::toProtobuf(dynamic_cast<const EvalIIP&>(*evalRequest())).SerializeAsString();
}

boost::shared_ptr<IIPEnqueueMessage> enqueue(const boost::shared_ptr<const IIP>& request,
                                             boost::optional<krutil::contextmgr::QvmID> qvmID = boost::none) {
    return boost::make_shared<IIPEnqueueMessage>(request, IDType(1, 2), 3, qvmID, nullptr, modes::DEQUEUE_AT_PROMPT,
                                                 u"n", capabilities::CapabilityList(), nullptr, false);
}

// As a request that a host derives for itself: no serializer is registered for it.
class UnregisteredIIP : public EvalIIP {
  public:
    using EvalIIP::EvalIIP;
};

boost::shared_ptr<const IIP> unregisteredRequest() {
    return boost::make_shared<UnregisteredIIP>("x", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr,
                                               SinkTraits(), SinkTraits(), u"1",
                                               cmddistributor::CodeType::CodeBlockType);
}

// Writes a request as three data frames and its tagged frame, as one with bulk bytes would be.
class BulkySerializer : public IIPFamily {
  public:
    BulkySerializer() : IIPFamily("test:Bulky", typeid(UnregisteredIIP), {1U, 0U}) {}

    FrameIndex serialize(const boost::shared_ptr<const IIP>&, transport::StreamID streamID, FrameIndex frameIndex,
                         const std::shared_ptr<transport::MessageStream>& stream,
                         const std::shared_ptr<const Registry>&, const SerializationContext&) const override {
        for (int i = 0; i < 4; ++i) {
            auto frame = transport::makeFrame(
                {i == 3, FrameType::Object, streamID, frameIndex++, i == 3 ? name() : std::string(), "b"});
            stream->append(frame);
        }
        return frameIndex;
    }

    boost::shared_ptr<const IIP> deserialize(FrameIndex, const std::unique_ptr<transport::Message>&,
                                             const std::shared_ptr<const Registry>&,
                                             const SerializationContext&) const override {
        throw std::runtime_error("not read here");
    }
};

class IIPEnqueueMessageTest : public transport::SerializerTest {
  protected:
    FrameIndex write(const boost::shared_ptr<const IIPEnqueueMessage>& message, FrameIndex first) const {
        return writeAs<MessageFamily>(enqueueTag, message, first);
    }

    boost::shared_ptr<const IIPEnqueueMessage> read(const std::unique_ptr<transport::Message>& message,
                                                    FrameIndex index) const {
        return boost::dynamic_pointer_cast<const IIPEnqueueMessage>(readAs<MessageFamily>(enqueueTag, message, index));
    }

    // An eval request at 1 and, at 2, an enqueue message as changed by `change`.
    template <class Change>
    static std::vector<FrameContent> framesWith(const Change& change) {
        wire::IIPEnqueueMessage proto;
        proto.set_iiphandle(1);
        change(proto);
        return {{true, FrameType::Object, 7, 1, evalTag, evalBytes()},
                {true, FrameType::Control, 7, 2, enqueueTag, proto.SerializeAsString()}};
    }
};

// ---- Writing --------------------------------------------------------------------------------------------------------

TEST_F(IIPEnqueueMessageTest, TheRequestIsWrittenFirstAndReferredToByItsIndex) {
    EXPECT_EQ(write(enqueue(evalRequest()), 0), 2U);
    ASSERT_EQ(frames().size(), 2U);
    const auto written = transport::contentOf(frames());
    EXPECT_EQ(written[0].tag, evalTag);
    EXPECT_EQ(written[0].index, 0U);
    EXPECT_EQ(written[0].type, FrameType::Object);
    EXPECT_EQ(written[1].tag, enqueueTag);
    EXPECT_EQ(written[1].index, 1U);
    EXPECT_EQ(written[1].type, FrameType::Control);
    EXPECT_EQ(parsed<wire::IIPEnqueueMessage>(*frames()[1]).iiphandle(), 0U);
    // A handle of 0 is an index like any other.
    const auto back = read(transport::makeMessage(written), 1);
    EXPECT_EQ(dynamic_cast<const EvalIIP&>(*back->getIIP()).getCommand(), u"1");
}

TEST_F(IIPEnqueueMessageTest, TheHandleIsTheLastFrameOfARequestThatNeedsSeveral) {
    registry_->insert(std::make_shared<BulkySerializer>());
    EXPECT_EQ(write(enqueue(unregisteredRequest()), 4), 9U);
    ASSERT_EQ(frames().size(), 5U);
    EXPECT_EQ(frames().back()->index(), 8U);
    EXPECT_EQ(parsed<wire::IIPEnqueueMessage>(*frames().back()).iiphandle(), 7U);
}

TEST_F(IIPEnqueueMessageTest, AnEmptyRequestIsBadTypeidAndWritesNothing) {
    EXPECT_THROW(write(enqueue(nullptr), 1), std::bad_typeid);
    EXPECT_TRUE(frames().empty());
}

TEST_F(IIPEnqueueMessageTest, ARequestWithoutASerializerIsOutOfRangeAndWritesNothing) {
    EXPECT_THROW(write(enqueue(unregisteredRequest()), 1), std::out_of_range);
    EXPECT_TRUE(frames().empty());
}

TEST_F(IIPEnqueueMessageTest, ASerializerOfAnotherFamilyIsBadCastAndWritesNothing) {
    registry_->insert(std::make_shared<transport::MisplacedSerializer<MessageFamily>>(typeid(UnregisteredIIP)));
    EXPECT_THROW(write(enqueue(unregisteredRequest()), 1), std::bad_cast);
    EXPECT_TRUE(frames().empty());
}

TEST_F(IIPEnqueueMessageTest, AStreamThatRefusesTheMessageKeepsItsRequest) {
    stream_ = std::make_shared<transport::ThrowingStream>(1);
    EXPECT_EQ(errorText<std::runtime_error>([&] { write(enqueue(evalRequest()), 1); }), "stream is full");
    ASSERT_EQ(frames().size(), 1U);
    EXPECT_EQ(transport::contentOf(*frames()[0]).tag, evalTag);
}

TEST_F(IIPEnqueueMessageTest, AnEmptyEngineIdentifierIsWrittenAsNothingAndReadsBackEmpty) {
    write(enqueue(evalRequest()), 1);
    EXPECT_EQ(parsed<wire::IIPEnqueueMessage>(*frames()[1]).qvmid(), 0U);
    EXPECT_FALSE(read(received(), 2)->getQvmID().has_value());
}

TEST_F(IIPEnqueueMessageTest, EngineIdentifierZeroReadsBackEmpty) {
    write(enqueue(evalRequest(), krutil::contextmgr::QvmID{0}), 1);
    EXPECT_FALSE(read(received(), 2)->getQvmID().has_value());
}

TEST_F(IIPEnqueueMessageTest, EveryFieldTravelsInItsOwnPlace) {
    const auto message = boost::make_shared<IIPEnqueueMessage>(
        evalRequest(), IDType(1, 2), -3, krutil::contextmgr::QvmID{4}, nullptr, modes::DEQUEUE_AT_DEBUG_PROMPT, u"n",
        capabilities::CapabilityList{capabilities::Capability::ModalDialogs}, nullptr, true);
    write(message, 1);
    const wire::IIPEnqueueMessage proto = parsed<wire::IIPEnqueueMessage>(*frames()[1]);
    EXPECT_EQ(proto.iiphandle(), 1U);
    EXPECT_EQ(proto.iipid().hi(), 1U);
    EXPECT_EQ(proto.iipid().lo(), 2U);
    EXPECT_EQ(proto.qcrid(), -3);
    EXPECT_EQ(proto.qvmid(), 4U);
    EXPECT_EQ(proto.dequeuemode(), wire::DEQUEUE_AT_DEBUG_PROMPT);
    EXPECT_EQ(proto.name(), "n");
    EXPECT_EQ(proto.capability_size(), 1);
    EXPECT_EQ(proto.capability(0), wire::ModalDialogs);
    EXPECT_TRUE(proto.oktoflushsparingly());
}

// ---- Reading --------------------------------------------------------------------------------------------------------

TEST_F(IIPEnqueueMessageTest, AReceivedMessageHasNoEventManagerAndNoImpersonation) {
    class Impersonation : public krutil::cmddistributor::Impersonable {};
    write(boost::make_shared<IIPEnqueueMessage>(evalRequest(), IDType(1, 2), 3, boost::none,
                                                boost::make_shared<foundation::msg_svc::eventmgr::EventMgr>(),
                                                modes::DEQUEUE_AT_PROMPT, u"n", capabilities::CapabilityList(),
                                                std::make_shared<Impersonation>(), false),
          1);
    const auto back = read(received(), 2);
    EXPECT_EQ(back->getEventMgr(), nullptr);
    EXPECT_EQ(back->getImpersonable(), nullptr);
}

TEST_F(IIPEnqueueMessageTest, AnAbsentIdentifierAndNameAreDefaults) {
    const auto back = read(transport::makeMessage(framesWith([](auto&) {})), 2);
    EXPECT_EQ(back->getID(), IDType());
    EXPECT_EQ(back->getDynamicName(), u"");
    EXPECT_EQ(back->getDequeueMode(), modes::DEQUEUE_UNKNOWN);
}

TEST_F(IIPEnqueueMessageTest, AnUnknownDequeueModeIsRefusedWithItsNumber) {
    for (const int mode : {8, -1}) {
        const auto given =
            framesWith([&](auto& proto) { proto.set_dequeuemode(static_cast<wire::WhenToDequeue>(mode)); });
        EXPECT_EQ(
            errorText<std::logic_error>([&] { read(transport::makeMessage(given), 2); }),
            "Invalid enum field value krutil::protobuf::IIPEnqueueMessage.WhenToDequeue = " + std::to_string(mode));
    }
}

TEST_F(IIPEnqueueMessageTest, AFaultyRequestIsReportedBeforeAnUnknownDequeueMode) {
    auto given = framesWith([](auto& proto) { proto.set_dequeuemode(static_cast<wire::WhenToDequeue>(8)); });
    given[0].bytes.clear();
    EXPECT_EQ(errorText<std::logic_error>([&] { read(transport::makeMessage(given), 2); }),
              "Required field missing: protobuf::EvalIIP.iip");
}

TEST_F(IIPEnqueueMessageTest, UnknownCapabilitiesAreDropped) {
    const auto given = framesWith([](auto& proto) {
        for (const int number : {0, 3, 9, -1, 3}) {
            proto.add_capability(static_cast<wire::Capability>(number));
        }
    });
    EXPECT_EQ(read(transport::makeMessage(given), 2)->getCapabilities(),
              capabilities::CapabilityList{capabilities::Capability::ComplexSwing});
}

TEST_F(IIPEnqueueMessageTest, AHandleWhoseTagIsNotRegisteredIsOutOfRange) {
    auto given = framesWith([](auto&) {});
    given[0].tag = "krutil:NoSuchType";
    EXPECT_THROW(read(transport::makeMessage(given), 2), std::out_of_range);
}

TEST_F(IIPEnqueueMessageTest, AHandleWhoseSerializerIsOfAnotherFamilyIsBadCastAndTheFrameStays) {
    for (const char* tag : {"krutil:IIPResult", "krutil:TextBaseEvent", "krutil:IIPReply"}) {
        auto given = framesWith([](auto&) {});
        given[0].tag = tag;
        const auto message = transport::makeMessage(given);
        EXPECT_THROW(read(message, 2), std::bad_cast) << tag;
        EXPECT_NE(message->frame(1), nullptr);
    }
}

TEST_F(IIPEnqueueMessageTest, AHostileHandleIsBadCast) {
    // None there, the message's own frame (taken out by then), past the end.
    for (const FrameIndex handle : {FrameIndex{0}, FrameIndex{2}, FrameIndex{3}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        const auto given = framesWith([&](auto& proto) { proto.set_iiphandle(handle); });
        EXPECT_THROW(read(transport::makeMessage(given), 2), std::bad_cast) << handle;
    }
}

TEST_F(IIPEnqueueMessageTest, AHandleOfADataFrameIsBadCast) {
    auto given = framesWith([](auto&) {});
    given[0].tagged = false;
    EXPECT_THROW(read(transport::makeMessage(given), 2), std::bad_cast);
}

TEST_F(IIPEnqueueMessageTest, AHandleThatWasReadAlreadyIsBadCast) {
    auto given = framesWith([](auto&) {});
    given.push_back(given[1]);
    given[2].index = 3;
    const auto message = transport::makeMessage(given);
    EXPECT_NE(read(message, 2), nullptr);
    EXPECT_THROW(read(message, 3), std::bad_cast);
}

TEST_F(IIPEnqueueMessageTest, AHandleOfAnEnqueueMessageIsBadCast) {
    // Two messages that refer to each other must not be followed in turn.
    const auto bytes = [](FrameIndex handle) {
        wire::IIPEnqueueMessage proto;
        proto.set_iiphandle(handle);
        return proto.SerializeAsString();
    };
    const auto message = transport::makeMessage({{true, FrameType::Control, 7, 1, enqueueTag, bytes(2)},
                                                 {true, FrameType::Control, 7, 2, enqueueTag, bytes(1)}});
    EXPECT_THROW(read(message, 2), std::bad_cast);
}

}  // namespace
