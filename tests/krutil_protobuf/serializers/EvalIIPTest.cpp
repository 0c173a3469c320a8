// Requests to evaluate code, and the request core inside them.

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include <stdexcept>

#include "EvalIIPSerializer.hpp"
#include "IIPSerializer.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using cmddistributor::CodeType;
using cmddistributor::EvalIIP;
using cmddistributor::IqmStreamID;
using krutil::io::SinkTraits;
using krutil::protobuf_serializer::EvalIIPSerializer;
using krutil::protobuf_serializer::IIPSerializer;
using transport::errorText;
namespace wire = krutil::protobuf;

// untransmitted, hotlinks, formatting, diary, echo, logging
const SinkTraits outTraits(true, true, false, true, false, true);
const SinkTraits errTraits(true, false, true, false, true, false);

EvalIIP request(const std::u16string& cmd, CodeType codeType = CodeType::CodeBlockType,
                IqmStreamID streamID = IqmStreamID::ekIqmJavaStream,
                const boost::shared_ptr<foundation::korveldata::ICustomWorkspace>& workspace = nullptr) {
    return {"x", streamID, workspace, outTraits, errTraits, cmd, codeType};
}

wire::EvalIIP validMessage() {
    return EvalIIPSerializer::toProtobuf(request(u"1"));
}

boost::shared_ptr<const EvalIIP> read(const wire::EvalIIP& proto) {
    return boost::dynamic_pointer_cast<const EvalIIP>(EvalIIPSerializer::fromProtobuf(proto));
}

// How reading the message through the registered serializer is refused.
std::string refusal(const wire::EvalIIP& proto) {
    return errorText<std::logic_error>([&] { transport::readObject("krutil:EvalIIP", proto.SerializeAsString()); });
}

void expectTransmittedTraits(const SinkTraits& traits, const SinkTraits& expected) {
    EXPECT_FALSE(traits.getUntransmitted());
    EXPECT_EQ(traits.getSupportsHotlinks(), expected.getSupportsHotlinks());
    EXPECT_EQ(traits.getNeedsFormattingForDisplay(), expected.getNeedsFormattingForDisplay());
    EXPECT_EQ(traits.getUseDiary(), expected.getUseDiary());
    EXPECT_EQ(traits.getUseEcho(), expected.getUseEcho());
    EXPECT_EQ(traits.getUseLogging(), expected.getUseLogging());
}

// ---- The core -------------------------------------------------------------------------------------------------------

TEST(IIPTest, StreamAndPlugInTypeAndBothTraitsRoundTripWithoutTheUntransmittedFlag) {
    const auto back = IIPSerializer::fromProtobuf(IIPSerializer::toProtobuf(request(u"")));
    EXPECT_EQ(back->getStreamID(), IqmStreamID::ekIqmJavaStream);
    EXPECT_EQ(back->getPluginType(), "x");
    expectTransmittedTraits(back->getOutTraits(), outTraits);
    expectTransmittedTraits(back->getErrTraits(), errTraits);
}

TEST(IIPTest, ARebuiltCoreLiesInOneAllocationWithItsCount) {
    const auto back = IIPSerializer::fromProtobuf(IIPSerializer::toProtobuf(request(u"")));
    EXPECT_FALSE(AllocationRecorder::beginsAt(dynamic_cast<const void*>(back.get())));
}

TEST(IIPTest, EachTraitHasItsOwnField) {
    for (int i = 0; i < 6; ++i) {
        const SinkTraits one(i == 0, i == 1, i == 2, i == 3, i == 4, i == 5);
        const wire::SinkTraits proto = krutil::protobuf_serializer::toProtobuf(one);
        const std::string expected = i == 0 ? "" : std::string{static_cast<char>(i << 3), '\x01'};
        EXPECT_EQ(proto.SerializeAsString(), expected);
        expectTransmittedTraits(krutil::protobuf_serializer::fromProtobuf(proto), one);
    }
}

TEST(IIPTest, AnUnknownStreamNumberFromThePeerIsKept) {
    wire::EvalIIP proto = validMessage();
    proto.mutable_iip()->set_streamid(static_cast<wire::IqmStreamID>(7));
    EXPECT_EQ(static_cast<int>(read(proto)->getStreamID()), 7);
    proto.mutable_iip()->set_streamid(static_cast<wire::IqmStreamID>(-2147483647 - 1));
    EXPECT_EQ(static_cast<int>(read(proto)->getStreamID()), -2147483647 - 1);
}

TEST(IIPTest, AnEmptyPlugInTypeIsWrittenAndRefusedOnReading) {
    const EvalIIP empty("", IqmStreamID::ekIqmCmdWinStream, nullptr, outTraits, errTraits, u"", CodeType::Undefined);
    EXPECT_EQ(refusal(EvalIIPSerializer::toProtobuf(empty)),
              "Required string field protobuf::IIP.pluginType is empty.");
}

TEST(IIPTest, AnEmptyPlugInTypeIsReportedBeforeAbsentTraits) {
    wire::EvalIIP proto;
    proto.mutable_iip();
    EXPECT_EQ(refusal(proto), "Required string field protobuf::IIP.pluginType is empty.");
}

TEST(IIPTest, AbsentOutputTraitsAreReportedBeforeAbsentErrorTraits) {
    wire::EvalIIP proto;
    proto.mutable_iip()->set_plugintype("x");
    EXPECT_EQ(refusal(proto), "Required field protobuf::IIP.outTraits is missing.");
}

TEST(IIPTest, AbsentErrorTraitsAreReported) {
    wire::EvalIIP proto;
    proto.mutable_iip()->set_plugintype("x");
    proto.mutable_iip()->mutable_outtraits();
    EXPECT_EQ(refusal(proto), "Required field protobuf::IIP.errTraits is missing.");
}

TEST(IIPTest, PresenceOfTraitsCountsNotTheirContent) {
    wire::EvalIIP proto;
    proto.mutable_iip()->set_plugintype("x");
    proto.mutable_iip()->mutable_outtraits();
    proto.mutable_iip()->mutable_errtraits();
    EXPECT_EQ(read(proto)->getErrTraits(), SinkTraits());
}

TEST(IIPTest, AllFalseTraitsAreWrittenAsPresent) {
    const EvalIIP plain("x", IqmStreamID::ekIqmCmdWinStream, nullptr, {}, {}, u"", CodeType::CodeBlockType);
    EXPECT_EQ(EvalIIPSerializer::toProtobuf(plain).SerializeAsString(),
              std::string("\x0A\x07\x12\x01x\x1A\x00\x22\x00", 9));
}

// ---- Eval requests --------------------------------------------------------------------------------------------------

TEST(EvalIIPTest, AnUndefinedCodeTypeWithEmptyTextRoundTrips) {
    const auto back = read(EvalIIPSerializer::toProtobuf(request(u"", CodeType::Undefined)));
    EXPECT_EQ(back->getCodeType(), CodeType::Undefined);
    EXPECT_EQ(back->getCommand(), u"");
}

TEST(EvalIIPTest, GreekLettersSurviveTheRoundTrip) {
    const std::u16string greek = u"\u03B1\u03B2\u03B3 = '\u03A9'";
    const wire::EvalIIP proto = EvalIIPSerializer::toProtobuf(request(greek));
    EXPECT_EQ(proto.cmd(), "\xCE\xB1\xCE\xB2\xCE\xB3 = '\xCE\xA9'");
    EXPECT_EQ(read(proto)->getCommand(), greek);
}

TEST(EvalIIPTest, AnUnknownCodeTypeIsRefusedWithItsNumber) {
    wire::EvalIIP proto = validMessage();
    proto.set_codetype(static_cast<wire::CodeType>(4));
    EXPECT_EQ(refusal(proto), "Invalid enum krutil::protobuf::CodeType field value = 4");
    proto.set_codetype(static_cast<wire::CodeType>(-1));
    EXPECT_EQ(refusal(proto), "Invalid enum krutil::protobuf::CodeType field value = -1");
    proto.set_codetype(static_cast<wire::CodeType>(9));
    EXPECT_EQ(refusal(proto), "Invalid enum krutil::protobuf::CodeType field value = 9");
}

TEST(EvalIIPTest, AnAbsentCoreIsReportedBeforeAnUnknownCodeType) {
    wire::EvalIIP proto;
    proto.set_codetype(static_cast<wire::CodeType>(9));
    EXPECT_EQ(refusal(proto), "Required field missing: protobuf::EvalIIP.iip");
}

TEST(EvalIIPTest, AFaultyCoreIsReportedBeforeAnUnknownCodeType) {
    wire::EvalIIP proto = validMessage();
    proto.mutable_iip()->clear_errtraits();
    proto.set_codetype(static_cast<wire::CodeType>(9));
    EXPECT_EQ(refusal(proto), "Required field protobuf::IIP.errTraits is missing.");
}

TEST(EvalIIPTest, AReceivedWorkspaceIsIgnored) {
    wire::EvalIIP proto = validMessage();
    proto.mutable_wsholder()->set_clientexchangename("client");
    proto.mutable_wsholder()->add_varnames("v");
    EXPECT_EQ(read(proto)->getWorkspace(), nullptr);
}

TEST(EvalIIPTest, AWorkspaceIsNeverWritten) {
    const auto workspace = boost::make_shared<foundation::korveldata::ICustomWorkspace>();
    const auto proto =
        EvalIIPSerializer::toProtobuf(request(u"1", CodeType::CodeBlockType, IqmStreamID::ekIqmJavaStream, workspace));
    EXPECT_FALSE(proto.has_wsholder());
}

}  // namespace
