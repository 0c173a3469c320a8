// What an interactive session adds: cancels, debug loops, warnings and errors to print.

#include <google/protobuf/stubs/logging.h>
#include <gtest/gtest.h>

#include <bit>
#include <boost/make_shared.hpp>
#include <climits>
#include <limits>
#include <stdexcept>

#include "DebugLoopEventSerializer.hpp"
#include "IIPCancelMessageSerializer.hpp"
#include "IIPCancelReplySerializer.hpp"
#include "IssuedEnabledWarningEventSerializer.hpp"
#include "IssuedWarningEventSerializer.hpp"
#include "PrintableErrorEventSerializer.hpp"
#include "RuntimeExceptionConversions.hpp"
#include "WarningConversions.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using cmddistributor::DebugLoopEvent;
using cmddistributor::IIPCancelMessage;
using cmddistributor::IIPCancelReply;
using foundation::msg_svc::exchange::IDType;
using korvel::lang::PrintfArgument;
using korvel::lang::diagnostic::IssuedEnabledWarningEvent;
using korvel::lang::diagnostic::IssuedWarningEvent;
using korvel::lang::diagnostic::Warning;
using krutil::io::PrintableErrorEvent;
using krutil::prompt::InputRequester;
using krutil::protobuf_serializer::DebugLoopEventSerializer;
using krutil::protobuf_serializer::IIPCancelMessageSerializer;
using krutil::protobuf_serializer::IIPCancelReplySerializer;
using krutil::protobuf_serializer::IssuedEnabledWarningEventSerializer;
using krutil::protobuf_serializer::IssuedWarningEventSerializer;
using krutil::protobuf_serializer::PrintableErrorEventSerializer;
using krutil::protobuf_serializer::WarningConversions;
using transport::errorText;
using transport::readObject;
namespace wire = krutil::protobuf;

template <class Event>
const Event& asEvent(const samples::Object& object) {
    using foundation::msg_svc::eventmgr::BaseEvent;
    return dynamic_cast<const Event&>(*std::get<boost::shared_ptr<const BaseEvent>>(object));
}

// ---- Cancel ---------------------------------------------------------------------------------------------------------

TEST(IIPCancelMessageTest, AnAbsentIdentifierIsRefusedAndAnEmptyOneIsNot) {
    wire::IIPCancelMessage proto;
    proto.set_evenifrunning(true);
    // The misspelling is settled.
    EXPECT_EQ(errorText<std::logic_error>([&] { IIPCancelMessageSerializer::fromProtobuf(proto); }),
              "Requied field is missing: protobuf::IIPCancelMessage.iipId");
    proto.mutable_iipid();
    const auto back =
        boost::dynamic_pointer_cast<const IIPCancelMessage>(IIPCancelMessageSerializer::fromProtobuf(proto));
    EXPECT_EQ(back->getID(), IDType());
    EXPECT_TRUE(back->getEvenIfRunning());
}

TEST(IIPCancelMessageTest, AnAbsentEvenIfRunningReadsAsFalse) {
    wire::IIPCancelMessage proto;
    proto.mutable_iipid()->set_lo(1);
    const auto back =
        boost::dynamic_pointer_cast<const IIPCancelMessage>(IIPCancelMessageSerializer::fromProtobuf(proto));
    EXPECT_FALSE(back->getEvenIfRunning());
}

TEST(IIPCancelReplyTest, AnyStatusPassesUncheckedInBothDirections) {
    for (const int number : {0, 1, 2, 3, 7, -1, INT_MIN}) {
        const wire::IIPCancelReply proto =
            IIPCancelReplySerializer::toProtobuf(IIPCancelReply(static_cast<IIPCancelReply::CancelStatus>(number)));
        EXPECT_EQ(static_cast<int>(proto.status()), number);
        const samples::Object back = readObject("krutil:IIPCancelReply", proto.SerializeAsString());
        const auto& reply = std::get<boost::shared_ptr<const foundation::msg_svc::exchange::Reply>>(back);
        EXPECT_EQ(static_cast<int>(dynamic_cast<const IIPCancelReply&>(*reply).getStatus()), number);
    }
}

// So the reply's memory goes with its last owner, while a weak reference keeps the message's.
TEST(IIPCancelReplyTest, IsAllocatedByItselfAndTheMessageTogetherWithItsCount) {
    wire::IIPCancelMessage message;
    message.mutable_iipid();
    {
        AllocationRecorder recorder;
        const auto built = IIPCancelMessageSerializer::fromProtobuf(message);
        EXPECT_EQ(recorder.allocations(), 1U);
    }
    AllocationRecorder recorder;
    const auto built = IIPCancelReplySerializer::fromProtobuf(wire::IIPCancelReply());
    EXPECT_EQ(recorder.allocations(), 2U);
}

TEST(IIPCancelReplyTest, TheCheckedConversionsKeepTheFourNumbers) {
    for (int number = 0; number <= 3; ++number) {
        const auto status = static_cast<IIPCancelReply::CancelStatus>(number);
        EXPECT_EQ(IIPCancelReplySerializer::toProtobuf(status), number);
        EXPECT_EQ(IIPCancelReplySerializer::fromProtobuf(static_cast<wire::CancelStatus>(number)), status);
    }
}

// ---- Debug loops ----------------------------------------------------------------------------------------------------

std::string debugLoopRefusal(int state, int whichLoop) {
    wire::DebugLoopEvent proto;
    proto.set_state(static_cast<wire::DebugLoopEvent_State>(state));
    proto.set_whichloop(static_cast<wire::InputRequester>(whichLoop));
    return errorText<std::logic_error>([&] { readObject("krutil:DebugLoopEvent", proto.SerializeAsString()); });
}

TEST(DebugLoopEventTest, StateZeroIsRefusedAlthoughItIsTheDefault) {
    const std::string prefix = "Invalid enum krutil::protobuf::DebugLoopEvent_State field value = ";
    EXPECT_EQ(errorText<std::logic_error>([] { readObject("krutil:DebugLoopEvent", ""); }), prefix + "0");
    EXPECT_EQ(debugLoopRefusal(3, 0), prefix + "3");
    EXPECT_EQ(debugLoopRefusal(-1, 0), prefix + "-1");
    EXPECT_EQ(debugLoopRefusal(INT_MIN, 0), prefix + "-2147483648");
}

TEST(DebugLoopEventTest, LoopsBelowMinusOneAndAbove11AreRefused) {
    const std::string prefix = "Invalid enum krutil::protobuf::InputRequester field value = ";
    EXPECT_EQ(debugLoopRefusal(1, 12), prefix + "12");
    EXPECT_EQ(debugLoopRefusal(1, -2), prefix + "-2");
    EXPECT_EQ(debugLoopRefusal(1, INT_MIN), prefix + "-2147483648");
    EXPECT_EQ(debugLoopRefusal(1, -1), "no exception");
}

TEST(DebugLoopEventTest, TheStateIsReportedBeforeTheLoop) {
    EXPECT_EQ(debugLoopRefusal(0, 12), "Invalid enum krutil::protobuf::DebugLoopEvent_State field value = 0");
}

TEST(DebugLoopEventTest, AnAbsentIdentifierReadsAsTheDefault) {
    const samples::Object back = readObject("krutil:DebugLoopEvent", "\x10\x01");
    EXPECT_EQ(asEvent<DebugLoopEvent>(back).getRequestId(), IDType());
}

TEST(DebugLoopEventTest, EveryStateAndEveryLoopRoundTrips) {
    for (const auto state : {DebugLoopEvent::EXIT, DebugLoopEvent::ENTER}) {
        for (int number = -1; number <= 11; ++number) {
            const auto loop = static_cast<InputRequester>(number);
            const wire::DebugLoopEvent proto =
                DebugLoopEventSerializer::toProtobuf(DebugLoopEvent(IDType(1, 2), state, loop));
            EXPECT_EQ(static_cast<int>(proto.state()), static_cast<int>(state));
            EXPECT_EQ(static_cast<int>(proto.whichloop()), number);
            const samples::Object back = readObject("krutil:DebugLoopEvent", proto.SerializeAsString());
            EXPECT_EQ(asEvent<DebugLoopEvent>(back).getLoopState(), state);
            EXPECT_EQ(asEvent<DebugLoopEvent>(back).getWhichDebugLoop(), loop);
            EXPECT_EQ(asEvent<DebugLoopEvent>(back).getRequestId(), IDType(1, 2));
        }
    }
}

// ---- Warnings -------------------------------------------------------------------------------------------------------

TEST(PrintfArgumentTest, EachTypeTravelsInItsOwnFieldAndComesBackAsItself) {
    const std::pair<PrintfArgument, wire::PrintfArgument::ValueCase> arguments[] = {
        {PrintfArgument(-1), wire::PrintfArgument::kI32},
        {PrintfArgument(std::numeric_limits<unsigned int>::max()), wire::PrintfArgument::kU32},
        {PrintfArgument(-1L), wire::PrintfArgument::kI64},
        {PrintfArgument(std::numeric_limits<unsigned long>::max()), wire::PrintfArgument::kU64},
        {PrintfArgument(0.5), wire::PrintfArgument::kDbl},
        {PrintfArgument(std::u16string(u"\u03B1")), wire::PrintfArgument::kStr},
    };
    int alternative = 0;
    for (const auto& [argument, field] : arguments) {
        const wire::PrintfArgument proto = WarningConversions::toProtobuf(argument);
        EXPECT_EQ(proto.Value_case(), field);
        const PrintfArgument back = WarningConversions::fromProtobuf(proto);
        EXPECT_EQ(back.getValue().which(), alternative++);
        EXPECT_TRUE(back == argument);
    }
}

TEST(PrintfArgumentTest, NoFieldReadsAsTheIntZero) {
    const PrintfArgument back = WarningConversions::fromProtobuf(wire::PrintfArgument());
    EXPECT_EQ(back.getValue().which(), 0);
    EXPECT_EQ(boost::get<int>(back.getValue()), 0);
}

TEST(PrintfArgumentTest, DoublesKeepEveryBit) {
    for (const std::uint64_t bits : {0x7FF8000000C0FFEEULL, 0x8000000000000000ULL, 0xFFF0000000000000ULL}) {
        const PrintfArgument back = WarningConversions::fromProtobuf(
            WarningConversions::toProtobuf(PrintfArgument(std::bit_cast<double>(std::uint64_t{bits}))));
        EXPECT_EQ(std::bit_cast<std::uint64_t>(boost::get<double>(back.getValue())), bits);
    }
}

TEST(WarningSerializerTest, WithoutArgumentsAndStackTheListsStayEmpty) {
    const wire::Warning proto = WarningConversions::toProtobuf(Warning("i", u"f", {}, u"m", {}, true, 1));
    EXPECT_EQ(proto.arguments_size(), 0);
    EXPECT_EQ(proto.stack_size(), 0);
    const Warning back = WarningConversions::fromProtobuf(proto);
    EXPECT_TRUE(back.getArguments().empty());
    EXPECT_TRUE(back.getStack().empty());
    EXPECT_EQ(back.getIdentifier(), "i");
    EXPECT_EQ(back.getFormat(), u"f");
    EXPECT_EQ(back.getMessage(), u"m");
}

TEST(WarningSerializerTest, TheTimeIsCopiedBitForBit) {
    for (const double time : {738000.5, -1.25, 0.0, -0.0, std::numeric_limits<double>::infinity(),
                              std::bit_cast<double>(std::uint64_t{0x7FF8000000C0FFEEULL})}) {
        const wire::Warning proto = WarningConversions::toProtobuf(Warning("", u"", {}, u"", {}, false, time));
        const double back = WarningConversions::fromProtobuf(proto).getTime();
        EXPECT_EQ(std::bit_cast<std::uint64_t>(back), std::bit_cast<std::uint64_t>(time));
    }
}

// The messages are proto2, whose parser takes any bytes in a string field.
TEST(WarningSerializerTest, AnIdentifierThatIsNoUtf8ArrivesIntactInBothEvents) {
    const google::protobuf::LogSilencer silencer;
    for (const std::string& identifier :
         {std::string("\xFF"), std::string("a\xC3("), std::string("\xED\xA0\x80"), std::string("a\0\x80", 3)}) {
        const Warning warning(identifier, u"f", {}, u"m", {{u"a", u"b", 3}}, true, 1);
        const auto issued = IssuedWarningEventSerializer::toProtobuf(IssuedWarningEvent(IDType(1, 2), warning));
        EXPECT_EQ(issued.warning().identifier(), identifier);
        EXPECT_EQ(asEvent<IssuedWarningEvent>(
                      readObject("korvel:lang:diagnostic:IssuedWarningEvent", issued.SerializeAsString()))
                      .getWarning(),
                  warning);
        const auto enabled =
            IssuedEnabledWarningEventSerializer::toProtobuf(IssuedEnabledWarningEvent(IDType(1, 2), warning));
        EXPECT_EQ(
            asEvent<IssuedEnabledWarningEvent>(readObject("korvel:lang:diagnostic:IssuedEnabledWarningEvent",
                                                          enabled.SerializeAsString(), transport::FrameType::Control))
                .getWarning(),
            warning);
    }
}

TEST(WarningSerializerTest, RequiredFieldsAreWrittenEvenWhenEmpty) {
    const wire::IssuedWarningEvent proto =
        IssuedWarningEventSerializer::toProtobuf(IssuedWarningEvent(IDType(), Warning("", u"", {}, u"", {}, false, 0)));
    EXPECT_TRUE(proto.IsInitialized());
    EXPECT_EQ(proto.warning().SerializeAsString(),
              std::string("\x0A\x00\x12\x00\x22\x00\x30\x00\x39\0\0\0\0\0\0\0\0", 17));
    const wire::WarningStackFrame frame = WarningConversions::toProtobuf(korvel::lang::StackFrame(u"", u"", 0));
    EXPECT_TRUE(frame.has_file() && frame.has_name() && frame.has_line());
}

TEST(WarningSerializerTest, MissingRequiredFieldsReadAsDefaults) {
    const google::protobuf::LogSilencer silencer;
    const samples::Object issued = readObject("korvel:lang:diagnostic:IssuedWarningEvent", "");
    const samples::Object enabled =
        readObject("korvel:lang:diagnostic:IssuedEnabledWarningEvent", "", transport::FrameType::Control);
    const Warning empty("", u"", {}, u"", {}, false, 0);
    EXPECT_EQ(asEvent<IssuedWarningEvent>(issued).getRequestId(), IDType());
    EXPECT_EQ(asEvent<IssuedWarningEvent>(issued).getWarning(), empty);
    EXPECT_EQ(asEvent<IssuedEnabledWarningEvent>(enabled).getRequestId(), IDType());
    EXPECT_EQ(asEvent<IssuedEnabledWarningEvent>(enabled).getWarning(), empty);
}

TEST(WarningSerializerTest, AnEventIsNotReadByTheOthersSerializer) {
    const Warning warning("i", u"f", {}, u"m", {}, false, 1);
    const std::string issued =
        IssuedWarningEventSerializer::toProtobuf(IssuedWarningEvent(IDType(1, 2), warning)).SerializeAsString();
    const std::string enabled =
        IssuedEnabledWarningEventSerializer::toProtobuf(IssuedEnabledWarningEvent(IDType(1, 2), warning))
            .SerializeAsString();
    EXPECT_THROW(readObject("korvel:lang:diagnostic:IssuedWarningEvent", enabled, transport::FrameType::Control),
                 std::bad_cast);
    EXPECT_THROW(readObject("korvel:lang:diagnostic:IssuedEnabledWarningEvent", issued, transport::FrameType::Object),
                 std::bad_cast);
}

TEST(WarningSerializerTest, TheEnabledEventNestsTheIssuedOnesMessage) {
    const Warning warning("i", u"f", {PrintfArgument(1)}, u"m", {{u"a", u"b", 3}}, true, 1);
    const auto issued = IssuedWarningEventSerializer::toProtobuf(IssuedWarningEvent(IDType(1, 2), warning));
    const auto enabled =
        IssuedEnabledWarningEventSerializer::toProtobuf(IssuedEnabledWarningEvent(IDType(1, 2), warning));
    EXPECT_EQ(enabled.warningevent().SerializeAsString(), issued.SerializeAsString());
}

// ---- Errors to print ------------------------------------------------------------------------------------------------

cmddistributor::RuntimeException exceptionWith(std::vector<cmddistributor::RuntimeException> causes) {
    return {
        krutil::cmddistributor::inRUNTIME_ERROR, u"text", "id", "f", {{u"file", "g", 1.5}}, std::move(causes), false};
}

TEST(PrintableErrorEventTest, EmptyTextStaysEmpty) {
    const wire::PrintableErrorEvent proto =
        PrintableErrorEventSerializer::toProtobuf(PrintableErrorEvent(IDType(1, 2), exceptionWith({}), u""));
    EXPECT_EQ(proto.text(), "");
    const samples::Object back = readObject("krutil:PrintableErrorEvent", proto.SerializeAsString());
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getText(), u"");
}

TEST(PrintableErrorEventTest, WithoutAnyFieldItIsTheEmptyErrorOfNoRequest) {
    const samples::Object back = readObject("krutil:PrintableErrorEvent", "");
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getRequestId(), IDType());
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getText(), u"");
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getException(),
              krutil::protobuf_serializer::fromProtobuf(wire::RuntimeException()));
}

TEST(PrintableErrorEventTest, CausesAndFramesSurviveTheTrip) {
    const auto exception = exceptionWith({exceptionWith({exceptionWith({})}), exceptionWith({})});
    const wire::PrintableErrorEvent proto =
        PrintableErrorEventSerializer::toProtobuf(PrintableErrorEvent(IDType(1, 2), exception, u"t"));
    const samples::Object back = readObject("krutil:PrintableErrorEvent", proto.SerializeAsString());
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getException(), exception);
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getText(), u"t");
    EXPECT_EQ(asEvent<PrintableErrorEvent>(back).getRequestId(), IDType(1, 2));
}

}  // namespace
