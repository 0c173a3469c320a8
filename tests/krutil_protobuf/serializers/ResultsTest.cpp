// Records of errors, results and replies.

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include <bit>
#include <limits>
#include <stdexcept>

#include "IIPReplySerializer.hpp"
#include "IIPResultSerializer.hpp"
#include "RuntimeExceptionConversions.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/serializers/SerializerTest.hpp"

namespace {

using cmddistributor::IIPResult;
using cmddistributor::RuntimeException;
using cmddistributor::StackFrame;
using foundation::msg_svc::exchange::IDType;
using krutil::cmddistributor::IIPReply;
using krutil::protobuf_serializer::fromProtobuf;
using krutil::protobuf_serializer::IIPResultSerializer;
using krutil::protobuf_serializer::ReplyFamily;
using krutil::protobuf_serializer::toProtobuf;
using transport::errorText;
using transport::FrameContent;
using transport::FrameIndex;
using transport::FrameType;
using transport::parsed;
namespace status = krutil::cmddistributor;
namespace wire = krutil::protobuf;

RuntimeException exceptionWith(std::vector<StackFrame> frames, std::vector<RuntimeException> causes = {},
                               const std::string& id = "id") {
    return {status::inRUNTIME_ERROR, u"text", id, "function", std::move(frames), std::move(causes), false};
}

// ---- Runtime exceptions ---------------------------------------------------------------------------------------------

TEST(RuntimeExceptionTest, WithoutFramesAndCausesTheVectorsStayEmpty) {
    const RuntimeException back = fromProtobuf(toProtobuf(exceptionWith({})));
    EXPECT_TRUE(back.getStackFrames().empty());
    EXPECT_TRUE(back.getCauses().empty());
    EXPECT_EQ(back, exceptionWith({}));
}

TEST(RuntimeExceptionTest, CausesOfCausesKeepTheirOrderAtEachLevel) {
    const auto leaf = [](const std::string& id) { return exceptionWith({}, {}, id); };
    const RuntimeException root =
        exceptionWith({},
                      {exceptionWith({}, {leaf("1.1"), leaf("1.2")}, "1"),
                       exceptionWith({}, {leaf("2.1"), exceptionWith({}, {leaf("2.2.1")}, "2.2")}, "2"), leaf("3")},
                      "0");
    const RuntimeException back = fromProtobuf(toProtobuf(root));
    EXPECT_EQ(back, root);
    EXPECT_EQ(back.getCauses().at(1).getCauses().at(1).getCauses().at(0).GetID(), "2.2.1");
}

TEST(RuntimeExceptionTest, FramesKeepTheirOrder) {
    const RuntimeException root = exceptionWith({{u"a", "f", 1}, {u"b", "g", 2}, {u"c", "h", 3}});
    EXPECT_EQ(fromProtobuf(toProtobuf(root)), root);
}

TEST(RuntimeExceptionTest, AFrameByItselfRoundTrips) {
    const StackFrame frame{u"\u00E4.py", "f", 12.5};
    const wire::StackFrame proto = toProtobuf(frame);
    EXPECT_EQ(proto.file(), "\xC3\xA4.py");
    EXPECT_EQ(proto.func(), "f");
    EXPECT_EQ(proto.line(), 12.5);
    EXPECT_EQ(fromProtobuf(proto), frame);
}

TEST(RuntimeExceptionTest, ALineOf12Point5SurvivesAndALineOf0IsSentAsNothing) {
    const wire::RuntimeException proto = toProtobuf(exceptionWith({{u"", "", 12.5}, {u"", "", 0}}));
    EXPECT_EQ(proto.frames(0).line(), 12.5);
    EXPECT_EQ(proto.frames(1).line(), 0);
    EXPECT_EQ(proto.frames(1).ByteSizeLong(), 0U);
    const RuntimeException back = fromProtobuf(proto);
    EXPECT_EQ(back.getStackFrames()[0].line, 12.5);
    EXPECT_EQ(back.getStackFrames()[1].line, 0);
}

TEST(RuntimeExceptionTest, LinesKeepEveryBit) {
    for (const std::uint64_t bits : {0x8000000000000000ULL, 0x7FF0000000000000ULL, 0xFFF0000000000000ULL,
                                     0x7FF8000000C0FFEEULL, 0x0000000000000001ULL, 0x7FEFFFFFFFFFFFFFULL}) {
        const RuntimeException back =
            fromProtobuf(toProtobuf(exceptionWith({{u"", "", std::bit_cast<double>(std::uint64_t{bits})}})));
        EXPECT_EQ(std::bit_cast<std::uint64_t>(back.getStackFrames()[0].line), bits);
    }
}

TEST(RuntimeExceptionTest, NonAsciiTextAndFileNamesTravelAsUtf8) {
    const RuntimeException root(status::inCOMPILE_ERROR, u"\u03B1\U0001F600", "id", "f", {{u"\u00E9.py", "g", 1}}, {},
                                false);
    const wire::RuntimeException proto = toProtobuf(root);
    EXPECT_EQ(proto.msgtext(), "\xCE\xB1\xF0\x9F\x98\x80");
    EXPECT_EQ(proto.frames(0).file(), "\xC3\xA9.py");
    EXPECT_EQ(fromProtobuf(proto), root);
}

TEST(RuntimeExceptionTest, IdentifierAndFunctionNameAreNotMixedUp) {
    const wire::RuntimeException proto = toProtobuf(exceptionWith({}));
    EXPECT_EQ(proto.msgid(), "id");
    EXPECT_EQ(proto.functionname(), "function");
    EXPECT_EQ(proto.msgtext(), "text");
    const RuntimeException back = fromProtobuf(proto);
    EXPECT_EQ(back.GetID(), "id");
    EXPECT_EQ(back.getFunctionName(), "function");
}

TEST(RuntimeExceptionTest, ARebuiltRecordCountsAsNotShown) {
    const RuntimeException shown(status::inRUNTIME_ERROR, u"", "", "", {}, {}, true);
    EXPECT_FALSE(fromProtobuf(toProtobuf(shown)).getShown());
}

TEST(RuntimeExceptionTest, VectorsHaveRoomForExactlyWhatWasParsed) {
    for (const int count : {0, 1, 5, 1000}) {
        wire::RuntimeException proto;
        for (int i = 0; i < count; ++i) {
            proto.add_frames();
            proto.add_causes();
        }
        const RuntimeException back = fromProtobuf(proto);
        EXPECT_EQ(back.getStackFrames().size(), static_cast<std::size_t>(count));
        EXPECT_EQ(back.getStackFrames().capacity(), static_cast<std::size_t>(count));
        EXPECT_EQ(back.getCauses().capacity(), static_cast<std::size_t>(count));
    }
}

// A cause takes two bytes on the wire. What it costs here is bounded, by a factor that is known.
TEST(RuntimeExceptionTest, MemoryStaysInProportionToWhatWasSent) {
    constexpr std::size_t count = 10000;
    std::string bytes;
    for (std::size_t i = 0; i < count; ++i) {
        bytes += std::string("\x32\x00", 2);
    }
    AllocationRecorder recorder;
    {
        wire::RuntimeException proto;
        ASSERT_TRUE(proto.ParseFromString(bytes));
        const RuntimeException back = fromProtobuf(proto);
        recorder.stop();
        EXPECT_EQ(back.getCauses().size(), count);
    }
    // The parsed message with its pointer in a doubling array, and the record, no larger than its parts.
    const std::size_t perCause = sizeof(wire::RuntimeException) + 4 * sizeof(void*) + sizeof(RuntimeException);
    EXPECT_LE(recorder.bytes(), count * perCause + 4096);
    EXPECT_LE(recorder.largest(), count * sizeof(RuntimeException));
}

TEST(RuntimeExceptionTest, AClaimedLengthAloneTakesNoMemory) {
    // msgText, a frame and a cause that claim two gigabytes each and bring nothing.
    for (const char* key : {"\x1A", "\x2A", "\x32"}) {
        const std::string bytes = std::string(key) + "\xF0\xFF\xFF\xFF\x07";
        AllocationRecorder recorder;
        {
            wire::RuntimeException proto;
            EXPECT_FALSE(proto.ParseFromString(bytes));
            fromProtobuf(proto);
        }
        recorder.stop();
        EXPECT_LT(recorder.bytes(), 2048U) << key;
    }
}

TEST(RuntimeExceptionTest, AFailedAllocationReleasesWhatWasBuilt) {
    const RuntimeException cause = exceptionWith({{std::u16string(40, u'f'), std::string(40, 'g'), 1}});
    const wire::RuntimeException proto = toProtobuf(
        RuntimeException(status::inRUNTIME_ERROR, std::u16string(40, u't'), std::string(40, 'i'), std::string(40, 'f'),
                         {{std::u16string(40, u'a'), std::string(40, 'b'), 1}}, {cause, cause}, false));
    for (long failing = 0;; ++failing) {
        bool thrown = false;
        AllocationRecorder recorder(failing);
        try {
            fromProtobuf(proto);
        } catch (const std::bad_alloc&) {
            thrown = true;
        }
        recorder.stop();
        if (!recorder.failed()) {
            EXPECT_GT(failing, 10);
            break;
        }
        ASSERT_TRUE(thrown) << failing;
        ASSERT_EQ(recorder.outstanding(), 0) << failing;
    }
}

// ---- Nesting --------------------------------------------------------------------------------------------------------

// A record with `levels` levels of causes below it, each identified by its level.
wire::RuntimeException nested(int levels) {
    wire::RuntimeException root;
    wire::RuntimeException* innermost = &root;
    for (int level = 0;; ++level) {
        innermost->set_msgid(std::to_string(level));
        if (level == levels) {
            return root;
        }
        innermost = innermost->add_causes();
    }
}

int depthOf(const RuntimeException& exception) {
    return exception.getCauses().empty() ? 0 : 1 + depthOf(exception.getCauses().front());
}

// A field of messages or texts, with the given key.
std::string field(char key, const std::string& content) {
    std::string length;
    for (std::size_t rest = content.size(); rest != 0; rest >>= 7) {
        length += static_cast<char>((rest & 0x7F) | (rest > 0x7F ? 0x80 : 0));
    }
    return key + length + content;
}

// The frame of a result whose exception stands in front of its identifier.
std::string resultBytes(const wire::RuntimeException& exception) {
    wire::IIPResult id;
    id.mutable_id()->set_lo(9);
    return field('\x12', exception.SerializeAsString()) + id.SerializeAsString();
}

std::unique_ptr<IIPResult> readResult(const std::string& bytes) {
    return std::get<std::unique_ptr<IIPResult>>(transport::readObject("krutil:IIPResult", bytes));
}

TEST(NestingTest, ALadderOf64CausesTravels) {
    const auto result = readResult(resultBytes(nested(64)));
    EXPECT_EQ(depthOf(*result->getException()), 64);
    EXPECT_EQ(result->id, IDType(0, 9));
}

TEST(NestingTest, At100LevelsTheParseStopsAndLaterFieldsAreLost) {
    // The exception itself is the first of the hundred levels below the result.
    const auto result = readResult(resultBytes(nested(99)));
    EXPECT_EQ(depthOf(*result->getException()), 99);
    EXPECT_EQ(result->id, IDType(0, 9));
    EXPECT_EQ(errorText<std::logic_error>([] { readResult(resultBytes(nested(100))); }),
              "Required field is missing: protobuf::IIPResult.id");
    EXPECT_EQ(errorText<std::logic_error>([] { readResult(resultBytes(nested(5000))); }),
              "Required field is missing: protobuf::IIPResult.id");
}

TEST(NestingTest, AStackBelowOrAMessageAboveTakesOneOfTheLevels) {
    const auto withStack = [](int levels) {
        wire::RuntimeException error = nested(levels);
        wire::RuntimeException* innermost = &error;
        while (innermost->causes_size() != 0) {
            innermost = innermost->mutable_causes(0);
        }
        innermost->add_frames();
        return error;
    };
    EXPECT_EQ(depthOf(*readResult(resultBytes(withStack(98)))->getException()), 98);
    EXPECT_EQ(errorText<std::logic_error>([&] { readResult(resultBytes(withStack(99))); }),
              "Required field is missing: protobuf::IIPResult.id");

    const auto readCallResult = [](const wire::RuntimeException& error) {
        const std::string bytes = field('\x0a', resultBytes(error));
        return std::get<std::unique_ptr<IIPResult>>(transport::readObject("krutil:FEvalResult", bytes))->id;
    };
    EXPECT_EQ(readCallResult(nested(98)), IDType(0, 9));
    EXPECT_EQ(errorText<std::logic_error>([&] { readCallResult(nested(99)); }),
              "Required field is missing: protobuf::IIPResult.id");
}

TEST(NestingTest, WhatStandsInFrontOfTooDeepANestIsKept) {
    wire::IIPResult proto;
    proto.mutable_id()->set_lo(9);
    *proto.mutable_exception() = nested(300);
    const auto result = readResult(proto.SerializeAsString());
    EXPECT_EQ(result->id, IDType(0, 9));
    // The cause at the limit is made, but none of its fields is read.
    const RuntimeException* innermost = &*result->getException();
    for (int level = 0; !innermost->getCauses().empty(); ++level) {
        EXPECT_EQ(innermost->GetID(), std::to_string(level));
        innermost = &innermost->getCauses().front();
    }
    EXPECT_EQ(innermost->GetID(), "");
    EXPECT_EQ(depthOf(*result->getException()), 100);
}

// ---- Results --------------------------------------------------------------------------------------------------------

TEST(IIPResultTest, ASuccessfulResultHasNoExceptionOnTheWireAndReadsBackEmpty) {
    const wire::IIPResult proto = IIPResultSerializer::toProtobuf(IIPResult(IDType(1, 2), boost::none));
    EXPECT_FALSE(proto.has_exception());
    EXPECT_TRUE(proto.has_id());
    EXPECT_FALSE(IIPResultSerializer::fromProtobuf(proto)->getException().has_value());
}

TEST(IIPResultTest, APresentButEmptyExceptionIsAnException) {
    wire::IIPResult proto;
    proto.mutable_id();
    proto.mutable_exception();
    const auto result = IIPResultSerializer::fromProtobuf(proto);
    ASSERT_TRUE(result->getException().has_value());
    EXPECT_EQ(*result->getException(), RuntimeException(status::inEXECUTION_SUCCESS, u"", "", "", {}, {}, false));
}

TEST(IIPResultTest, AnAbsentIdentifierIsRefusedAndAnEmptyOneIsNot) {
    wire::IIPResult proto;
    proto.mutable_exception()->set_status(wire::inRUNTIME_ERROR);
    EXPECT_EQ(errorText<std::logic_error>([&] { IIPResultSerializer::fromProtobuf(proto); }),
              "Required field is missing: protobuf::IIPResult.id");
    proto.mutable_id();
    EXPECT_EQ(IIPResultSerializer::fromProtobuf(proto)->id, IDType());
}

// ---- Replies --------------------------------------------------------------------------------------------------------

// A result that a host derives for itself.
class UnregisteredResult : public IIPResult {
  public:
    using IIPResult::IIPResult;
};

class IIPReplyTest : public transport::SerializerTest {
  protected:
    FrameIndex write(std::unique_ptr<IIPResult> result, FrameIndex first) const {
        return writeAs<ReplyFamily>("krutil:IIPReply", boost::make_shared<IIPReply>(IDType(1, 2), std::move(result)),
                                    first);
    }

    boost::shared_ptr<const IIPReply> read(const std::unique_ptr<transport::Message>& message, FrameIndex index) const {
        return boost::dynamic_pointer_cast<const IIPReply>(readAs<ReplyFamily>("krutil:IIPReply", message, index));
    }

    // A result at 1 and, at 2, a reply that refers to `resultID`.
    static std::vector<FrameContent> framesWith(FrameIndex resultID, bool withID = true) {
        wire::IIPReply proto;
        if (withID) {
            proto.mutable_id()->set_lo(5);
        }
        proto.set_resultid(resultID);
        return {{true, FrameType::Object, 7, 1, "krutil:IIPResult",
                 IIPResultSerializer::toProtobuf(IIPResult(IDType(3, 4), boost::none)).SerializeAsString()},
                {true, FrameType::Object, 7, 2, "krutil:IIPReply", proto.SerializeAsString()}};
    }
};

TEST_F(IIPReplyTest, WithoutAResultItIsOneFrameWithResultIDZero) {
    EXPECT_EQ(write(nullptr, 4), 5U);
    ASSERT_EQ(frames().size(), 1U);
    EXPECT_EQ(parsed<wire::IIPReply>(*frames().at(0)).resultid(), 0U);
    const auto back = read(received(), 4);
    EXPECT_EQ(back->getID(), IDType(1, 2));
    EXPECT_EQ(back->getResult(), nullptr);
}

TEST_F(IIPReplyTest, APlainResultIsWrittenFirstAndReferredToByItsIndex) {
    EXPECT_EQ(write(std::make_unique<IIPResult>(IDType(3, 4), boost::none), 4), 6U);
    ASSERT_EQ(frames().size(), 2U);
    const auto written = transport::contentOf(frames());
    EXPECT_EQ(written[0].index, 4U);
    EXPECT_EQ(written[0].tag, "krutil:IIPResult");
    EXPECT_EQ(written[1].index, 5U);
    EXPECT_EQ(written[1].tag, "krutil:IIPReply");
    EXPECT_EQ(parsed<wire::IIPReply>(*frames().at(1)).resultid(), 4U);
    const auto back = read(received(), 5);
    EXPECT_EQ(back->getID(), IDType(1, 2));
    ASSERT_NE(back->getResult(), nullptr);
    EXPECT_EQ(back->getResult()->id, IDType(3, 4));
}

TEST_F(IIPReplyTest, AResultThatLandsAtIndexZeroReadsBackAsNone) {
    EXPECT_EQ(write(std::make_unique<IIPResult>(IDType(3, 4), boost::none), 0), 2U);
    EXPECT_EQ(parsed<wire::IIPReply>(*frames().at(1)).resultid(), 0U);
    const auto message = received();
    EXPECT_EQ(read(message, 1)->getResult(), nullptr);
    EXPECT_NE(message->frame(0), nullptr);
}

TEST_F(IIPReplyTest, AResultWithoutASerializerIsOutOfRangeAndWritesNothing) {
    EXPECT_THROW(write(std::make_unique<UnregisteredResult>(IDType(3, 4), boost::none), 1), std::out_of_range);
    EXPECT_TRUE(frames().empty());
}

TEST_F(IIPReplyTest, ASerializerOfAnotherFamilyIsBadCastAndWritesNothing) {
    registry_->insert(std::make_shared<transport::MisplacedSerializer<ReplyFamily>>(typeid(UnregisteredResult)));
    EXPECT_THROW(write(std::make_unique<UnregisteredResult>(IDType(3, 4), boost::none), 1), std::bad_cast);
    EXPECT_TRUE(frames().empty());
}

TEST_F(IIPReplyTest, AStreamThatRefusesTheReplyKeepsItsResult) {
    stream_ = std::make_shared<transport::ThrowingStream>(1);
    EXPECT_EQ(errorText<std::runtime_error>([&] { write(std::make_unique<IIPResult>(IDType(3, 4), boost::none), 1); }),
              "stream is full");
    ASSERT_EQ(frames().size(), 1U);
    EXPECT_EQ(transport::contentOf(*frames()[0]).tag, "krutil:IIPResult");
}

TEST_F(IIPReplyTest, AnAbsentIdentifierIsRefusedAfterTheResultWasRead) {
    const auto message = transport::makeMessage(framesWith(1, false));
    EXPECT_EQ(errorText<std::logic_error>([&] { read(message, 2); }),
              "Required field is missing: protobuf::IIPReply.id");
    EXPECT_EQ(message->frame(1), nullptr);

    auto faulty = framesWith(1, false);
    faulty[0].bytes.clear();
    EXPECT_EQ(errorText<std::logic_error>([&] { read(transport::makeMessage(faulty), 2); }),
              "Required field is missing: protobuf::IIPResult.id");
}

TEST_F(IIPReplyTest, AResultIDWhoseTagIsNotRegisteredIsOutOfRange) {
    auto given = framesWith(1);
    given[0].tag = "krutil:NoSuchType";
    EXPECT_THROW(read(transport::makeMessage(given), 2), std::out_of_range);
}

TEST_F(IIPReplyTest, AResultIDWhoseSerializerIsOfAnotherFamilyIsBadCast) {
    for (const char* tag : {"krutil:EvalIIP", "krutil:TextBaseEvent", "krutil:IIPReply"}) {
        auto given = framesWith(1);
        given[0].tag = tag;
        EXPECT_THROW(read(transport::makeMessage(given), 2), std::bad_cast) << tag;
    }
}

TEST_F(IIPReplyTest, AHostileResultIDIsBadCast) {
    // The reply's own frame, past the end.
    for (const FrameIndex index : {FrameIndex{2}, FrameIndex{3}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        EXPECT_THROW(read(transport::makeMessage(framesWith(index)), 2), std::bad_cast) << index;
    }
}

TEST_F(IIPReplyTest, AResultIDOfADataFrameIsBadCast) {
    auto given = framesWith(1);
    given[0].tagged = false;
    EXPECT_THROW(read(transport::makeMessage(given), 2), std::bad_cast);
}

TEST_F(IIPReplyTest, AResultThatWasReadAlreadyIsBadCast) {
    auto given = framesWith(1);
    given.push_back(given[1]);
    given[2].index = 3;
    const auto message = transport::makeMessage(given);
    EXPECT_NE(read(message, 2), nullptr);
    EXPECT_THROW(read(message, 3), std::bad_cast);
}

}  // namespace
