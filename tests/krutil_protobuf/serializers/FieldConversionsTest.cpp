// Identifiers, text and enumerations: what all serializers share.

#include "FieldConversions.hpp"

#include <google/protobuf/stubs/logging.h>
#include <gtest/gtest.h>

#include <climits>
#include <type_traits>

#include "EvalIIPSerializer.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "IIPSerializer.hpp"
#include "IIPStateEventSerializer.hpp"
#include "RuntimeExceptionConversions.hpp"
#include "StreamTypeSerializer.hpp"
#include "TextBaseEventSerializer.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using foundation::msg_svc::exchange::IDType;
using krutil::protobuf_serializer::EvalIIPSerializer;
using krutil::protobuf_serializer::EventFamily;
using krutil::protobuf_serializer::IDTypeSerializer;
using krutil::protobuf_serializer::IIPEnqueueMessageSerializer;
using krutil::protobuf_serializer::TextBaseEventSerializer;
using krutil::protobuf_serializer::ustring_to_utf8;
using krutil::protobuf_serializer::utf8_to_ustring;
using transport::errorText;
namespace wire = krutil::protobuf;

// Without a fixed underlying type, a number outside the list would be undefined behaviour before anything could test
// it.
static_assert(std::is_same_v<std::underlying_type_t<cmddistributor::IqmStreamID>, std::int32_t>);
static_assert(std::is_same_v<std::underlying_type_t<cmddistributor::CodeType>, std::int32_t>);
static_assert(std::is_same_v<std::underlying_type_t<krutil::io::StreamTypeEnum>, std::int32_t>);
static_assert(std::is_same_v<std::underlying_type_t<krutil::cmddistributor::inExecutionStatus>, std::int32_t>);
static_assert(
    std::is_same_v<std::underlying_type_t<krutil::cmddistributor::WhenToDequeue::WhenToDequeue>, std::int32_t>);
static_assert(std::is_same_v<std::underlying_type_t<capabilities::Capability>, std::uint64_t>);

wire::TextBaseEvent textMessage(const std::u16string& text, IDType id = {}) {
    return TextBaseEventSerializer::toProtobuf(
        krutil::io::TextBaseEvent(id, krutil::io::StreamTypeEnum::OUTPUT_STREAM, text));
}

// ---- Identifiers ----------------------------------------------------------------------------------------------------

TEST(IdentifierTest, ADefaultIdentifierIsPresentOnTheWireAndReadsBack) {
    const wire::TextBaseEvent proto = textMessage(u"");
    EXPECT_TRUE(proto.has_id());
    EXPECT_EQ(proto.SerializeAsString(), std::string("\x0A\x00", 2));
    EXPECT_EQ(IDTypeSerializer::fromProtobuf(proto.id()), IDType());
}

TEST(IdentifierTest, AnAbsentIdentifierThatIsNotRequiredReadsAsTheDefault) {
    const auto event = TextBaseEventSerializer::fromProtobuf(wire::TextBaseEvent());
    EXPECT_EQ(dynamic_cast<const krutil::io::TextBaseEvent&>(*event).getRequestId(), IDType());
}

TEST(IdentifierTest, HalvesKeepTheirPlaces) {
    const auto proto = IDTypeSerializer::toProtobuf(IDType(1, 2));
    EXPECT_EQ(proto.hi(), 1U);
    EXPECT_EQ(proto.lo(), 2U);
    EXPECT_EQ(IDTypeSerializer::fromProtobuf(proto), IDType(1, 2));
}

// ---- Text -----------------------------------------------------------------------------------------------------------

TEST(FieldTextTest, EmptyTextIsAbsentOnTheWireAndReadsBackEmpty) {
    const wire::TextBaseEvent proto = textMessage(u"", IDType(1, 2));
    EXPECT_EQ(proto.SerializeAsString(), "\x0A\x04\x08\x01\x10\x02");
    const auto event = TextBaseEventSerializer::fromProtobuf(proto);
    EXPECT_EQ(dynamic_cast<const krutil::io::TextBaseEvent&>(*event).getText(), u"");
}

TEST(FieldTextTest, CharactersOutsideTheBasicPlaneTravelAsFourBytes) {
    const std::u16string text = u"\U0001F600\U0010FFFF";
    const wire::TextBaseEvent proto = textMessage(text);
    EXPECT_EQ(proto.text(), "\xF0\x9F\x98\x80\xF4\x8F\xBF\xBF");
    const auto event = TextBaseEventSerializer::fromProtobuf(proto);
    EXPECT_EQ(dynamic_cast<const krutil::io::TextBaseEvent&>(*event).getText(), text);
}

TEST(FieldTextTest, EmbeddedNulIsKept) {
    const std::u16string text(u"a\0b", 3);
    EXPECT_EQ(textMessage(text).text(), std::string("a\0b", 3));
    EXPECT_EQ(utf8_to_ustring(std::string("a\0b", 3)), text);
}

TEST(FieldTextTest, EveryCodePointRoundTrips) {
    for (char32_t point = 0; point <= 0x10FFFF; ++point) {
        if (point >= 0xD800 && point <= 0xDFFF) {
            continue;
        }
        std::u16string text;
        if (point < 0x10000) {
            text = static_cast<char16_t>(point);
        } else {
            text = {static_cast<char16_t>(0xD800 + ((point - 0x10000) >> 10)),
                    static_cast<char16_t>(0xDC00 + ((point - 0x10000) & 0x3FF))};
        }
        const std::string utf8 = ustring_to_utf8(text);
        ASSERT_EQ(utf8.size(), point < 0x80 ? 1U : point < 0x800 ? 2U : point < 0x10000 ? 3U : 4U);
        ASSERT_EQ(utf8_to_ustring(utf8), text) << std::hex << static_cast<unsigned int>(point);
    }
}

TEST(FieldTextTest, UnpairedSurrogatesBecomeReplacementCharacters) {
    const std::string replacement = "\xEF\xBF\xBD";
    EXPECT_EQ(ustring_to_utf8(std::u16string{u'a', 0xD800, u'b'}), "a" + replacement + "b");
    EXPECT_EQ(ustring_to_utf8(std::u16string{u'a', 0xDC00, u'b'}), "a" + replacement + "b");
    EXPECT_EQ(ustring_to_utf8(std::u16string{0xDC00, 0xD800}), replacement + replacement);
    EXPECT_EQ(ustring_to_utf8(std::u16string{0xD800}), replacement);
}

TEST(FieldTextTest, IllFormedUtf8BecomesReplacementCharacters) {
    EXPECT_EQ(utf8_to_ustring("a\xFF"
                              "b"),
              u"a\uFFFDb");
    EXPECT_EQ(utf8_to_ustring("\xC0\xAF"), u"\uFFFD\uFFFD");
    EXPECT_EQ(utf8_to_ustring("\xE2\x82"), u"\uFFFD");
    EXPECT_EQ(utf8_to_ustring("\xF0\x9F\x98"
                              "b"),
              u"\uFFFDb");
    EXPECT_EQ(utf8_to_ustring("\xED\xA0\x80"), u"\uFFFD\uFFFD\uFFFD");
    EXPECT_EQ(utf8_to_ustring("\xF4\x90\x80\x80"), u"\uFFFD\uFFFD\uFFFD\uFFFD");
}

// ---- Bytes that are no UTF-8 in string fields
// --------------------------------------------------------------------------

std::vector<std::string> logged;

void keepLog(google::protobuf::LogLevel /*level*/, const char* /*file*/, int /*line*/, const std::string& text) {
    logged.push_back(text);
}

// The parser complains through the process-wide handler, which belongs to the host: the library neither sets nor
// resets it.
class IllFormedFieldTextTest : public testing::Test {
  protected:
    IllFormedFieldTextTest() {
        logged.clear();
        previous_ = google::protobuf::SetLogHandler(&keepLog);
    }
    ~IllFormedFieldTextTest() override { EXPECT_EQ(google::protobuf::SetLogHandler(previous_), &keepLog); }

  private:
    google::protobuf::LogHandler* previous_;
};

TEST_F(IllFormedFieldTextTest, TheBytesAreStoredAndTheParseStopsThere) {
    // msgText (3) has a bad byte; functionName (4) stands behind it and is lost.
    const std::string bytes = std::string("\x08\x02\x12\x02id\x1A\x03") +
                              "a\xFF"
                              "b" +
                              "\x22\x01"
                              "f";
    wire::RuntimeException proto;
    EXPECT_FALSE(proto.ParseFromString(bytes));
    const auto exception = krutil::protobuf_serializer::fromProtobuf(proto);
    EXPECT_EQ(exception.getExecutionStatus(), krutil::cmddistributor::inRUNTIME_ERROR);
    EXPECT_EQ(exception.GetID(), "id");
    EXPECT_EQ(exception.GetUnicodeMessageTxt(), u"a\uFFFDb");
    EXPECT_EQ(exception.getFunctionName(), "");
}

TEST_F(IllFormedFieldTextTest, APlugInTypeThatIsNoUtf8LosesTheTraitsAndSoTheRequest) {
    const auto registry = transport::sessionRegistry();
    const samples::Object request =
        boost::shared_ptr<const cmddistributor::IIP>(boost::make_shared<cmddistributor::EvalIIP>(
            "\xFF", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, krutil::io::SinkTraits(),
            krutil::io::SinkTraits(), u"1", cmddistributor::CodeType::CodeBlockType));
    const auto frames = transport::writtenFrames(*registry->find("krutil:EvalIIP"), request, registry);
    EXPECT_EQ(errorText<std::logic_error>([&] { transport::readObject(frames[0].tag, frames[0].bytes); }),
              "Required field protobuf::IIP.outTraits is missing.");
}

TEST_F(IllFormedFieldTextTest, TheComplaintGoesToTheHostsLogHandler) {
    const auto registry = transport::sessionRegistry();
    wire::TextBaseEvent proto;
    EXPECT_FALSE(proto.ParseFromString("\x1A\x01\xFF"));
    ASSERT_EQ(logged.size(), 1U);
    EXPECT_NE(logged[0].find("krutil.protobuf.TextBaseEvent.text"), std::string::npos) << logged[0];
}

// ---- Enumerations ---------------------------------------------------------------------------------------------------

TEST(WireEnumTest, AnUnknownCodeTypeIsALogicErrorThatEndsInTheNumber) {
    const std::string prefix = "Invalid enum krutil::protobuf::CodeType field value = ";
    for (const int number : {4, 9, -1, INT_MIN, INT_MAX}) {
        EXPECT_EQ(
            errorText<std::logic_error>([&] { EvalIIPSerializer::fromProtobuf(static_cast<wire::CodeType>(number)); }),
            prefix + std::to_string(number));
    }
    EXPECT_EQ(
        errorText<std::logic_error>([&] { EvalIIPSerializer::fromProtobuf(static_cast<wire::CodeType>(INT_MIN)); }),
        "Invalid enum krutil::protobuf::CodeType field value = -2147483648");
}

TEST(WireEnumTest, AnUnknownDequeueModeIsALogicErrorWithAWordOrderOfItsOwn) {
    const std::string prefix = "Invalid enum field value krutil::protobuf::IIPEnqueueMessage.WhenToDequeue = ";
    for (const int number : {8, -1, INT_MIN, INT_MAX}) {
        EXPECT_EQ(errorText<std::logic_error>(
                      [&] { IIPEnqueueMessageSerializer::fromProtobuf(static_cast<wire::WhenToDequeue>(number)); }),
                  prefix + std::to_string(number));
    }
}

TEST(WireEnumTest, KnownNumbersKeepTheirNumberInBothDirections) {
    using krutil::protobuf_serializer::fromProtobuf;
    using krutil::protobuf_serializer::IIPSerializer;
    using krutil::protobuf_serializer::StreamTypeSerializer;
    using krutil::protobuf_serializer::toProtobuf;
    for (int number = 0; number <= 3; ++number) {
        const auto inProcess = static_cast<cmddistributor::CodeType>(number);
        EXPECT_EQ(EvalIIPSerializer::toProtobuf(inProcess), number);
        EXPECT_EQ(EvalIIPSerializer::fromProtobuf(static_cast<wire::CodeType>(number)), inProcess);
    }
    for (int number = 0; number <= 7; ++number) {
        const auto inProcess = static_cast<krutil::cmddistributor::WhenToDequeue::WhenToDequeue>(number);
        EXPECT_EQ(IIPEnqueueMessageSerializer::toProtobuf(inProcess), number);
        EXPECT_EQ(IIPEnqueueMessageSerializer::fromProtobuf(static_cast<wire::WhenToDequeue>(number)), inProcess);
    }
    for (int number = 0; number <= 5; ++number) {
        const auto inProcess = static_cast<krutil::cmddistributor::inExecutionStatus>(number);
        EXPECT_EQ(toProtobuf(inProcess), number);
        EXPECT_EQ(fromProtobuf(static_cast<wire::ExecutionStatus>(number)), inProcess);
    }
    for (int number = 0; number <= 2; ++number) {
        const auto inProcess = static_cast<krutil::io::StreamTypeEnum>(number);
        EXPECT_EQ(StreamTypeSerializer::toProtobuf(inProcess), number);
        EXPECT_EQ(StreamTypeSerializer::fromProtobuf(static_cast<wire::StreamType>(number)), inProcess);
    }
    for (const int number : {-2, -1, 0, 1000}) {
        const auto inProcess = static_cast<cmddistributor::IqmStreamID>(number);
        EXPECT_EQ(IIPSerializer::toProtobuf(inProcess), number);
        EXPECT_EQ(IIPSerializer::fromProtobuf(static_cast<wire::IqmStreamID>(number)), inProcess);
    }
}

TEST(StateEventNameTest, ANumberAbove7IsOutOfRangeWithTheIndexInTheText) {
    using krutil::protobuf_serializer::stateEventName;
    EXPECT_EQ(stateEventName(0), "krutil:IIPStartedEvent");
    EXPECT_EQ(stateEventName(7), "krutil:detail::LastIIPEvent");
    EXPECT_EQ(errorText<std::out_of_range>([] { stateEventName(8); }),
              "array::at: __n (which is 8) >= _Nm (which is 8)");
    EXPECT_EQ(errorText<std::out_of_range>([] { stateEventName(~std::size_t{0}); }),
              "array::at: __n (which is 18446744073709551615) >= _Nm (which is 8)");
}

}  // namespace
