// Values that end the process: what the report says, to the letter. Logs and people match message, file, line and
// function, so they do not follow the source.

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include <climits>

#include "DebugLoopEventSerializer.hpp"
#include "EvalIIPSerializer.hpp"
#include "IIPCancelReplySerializer.hpp"
#include "IIPEnqueueMessageSerializer.hpp"
#include "IIPResultSerializer.hpp"
#include "IIPSerializer.hpp"
#include "PrintableErrorEventSerializer.hpp"
#include "RuntimeExceptionConversions.hpp"
#include "StreamTypeSerializer.hpp"
#include "TextBaseEventSerializer.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/io/TextBaseEvent.hpp"
#include "krutil_protobuf/serializers/FatalReport.hpp"

namespace {

using fatal::statusIn;
using fatal::statusOut;
using fatal::streamIDOut;
using fatal::writeAloud;
using krutil::protobuf_serializer::DebugLoopEventSerializer;
using krutil::protobuf_serializer::EvalIIPSerializer;
using krutil::protobuf_serializer::fromProtobuf;
using krutil::protobuf_serializer::IIPCancelReplySerializer;
using krutil::protobuf_serializer::IIPEnqueueMessageSerializer;
using krutil::protobuf_serializer::IIPSerializer;
using krutil::protobuf_serializer::StreamTypeSerializer;
using krutil::protobuf_serializer::toProtobuf;
using transport::readObject;
namespace modes = krutil::cmddistributor::WhenToDequeue;
namespace wire = krutil::protobuf;

const std::string streamTypeOut =
    "fatal: Unsupported krutil::io::StreamTypeEnum value (StreamTypeSerializer:28, static krutil::protobuf::StreamType "
    "krutil::protobuf_serializer::StreamTypeSerializer::toProtobuf(krutil::io::StreamTypeEnum))\n";
const std::string streamTypeIn =
    "fatal: Unsupported krutil::protobuf::StreamType value (StreamTypeSerializer:44, static krutil::io::StreamTypeEnum "
    "krutil::protobuf_serializer::StreamTypeSerializer::fromProtobuf(krutil::protobuf::StreamType))\n";
const std::string streamIDIn =
    "fatal: Unsupported cmddistributor::IqmStreamID value (IIPSerializer:71, static cmddistributor::IqmStreamID "
    "krutil::protobuf_serializer::IIPSerializer::fromProtobuf(krutil::protobuf::IqmStreamID))\n";
const std::string codeTypeOut =
    "fatal: Unsupported cmddistributor::CodeType value (EvalIIPSerializer:105, static krutil::protobuf::CodeType "
    "krutil::protobuf_serializer::EvalIIPSerializer::toProtobuf(cmddistributor::CodeType))\n";
const std::string dequeueModeOut =
    "fatal: Unsupported cmddistributor::WhenToDequeue::WhenToDequeue value (IIPEnqueueMessageSerializer:120, "
    "static krutil::protobuf::WhenToDequeue krutil::protobuf_serializer::IIPEnqueueMessageSerializer::toProtobuf("
    "krutil::cmddistributor::WhenToDequeue::WhenToDequeue))\n";
const std::string loopStateOut =
    "fatal: Unsupported cmddistributor::DebugLoopEvent::State value (DebugLoopEventSerializer:73, "
    "static krutil::protobuf::DebugLoopEvent_State "
    "krutil::protobuf_serializer::DebugLoopEventSerializer::toProtobuf(cmddistributor::DebugLoopEvent::State))\n";
const std::string loopOut =
    "fatal: Unsupported krutil::prompt::InputRequester value (DebugLoopEventSerializer:101, "
    "static krutil::protobuf::InputRequester "
    "krutil::protobuf_serializer::DebugLoopEventSerializer::toProtobuf(krutil::prompt::InputRequester))\n";
const std::string cancelStatusOut =
    "fatal: Unsupported ::cmddistributor::IIPCancelReply::CancelStatus value (IIPCancelReplySerializer:71, "
    "static krutil::protobuf::CancelStatus krutil::protobuf_serializer::IIPCancelReplySerializer::toProtobuf("
    "cmddistributor::IIPCancelReply::CancelStatus))\n";
const std::string cancelStatusIn =
    "fatal: Unsupported krutil::protobuf::CancelStatus value (IIPCancelReplySerializer:97, "
    "static cmddistributor::IIPCancelReply::CancelStatus "
    "krutil::protobuf_serializer::IIPCancelReplySerializer::fromProtobuf(krutil::protobuf::CancelStatus))\n";

using FatalReportDeathTest = fatal::FatalTest;

// ---- The conversions ------------------------------------------------------------------------------------------------

TEST_F(FatalReportDeathTest, StreamTypes) {
    for (const int number : {3, -1, INT_MIN}) {
        EXPECT_FATAL(StreamTypeSerializer::toProtobuf(static_cast<krutil::io::StreamTypeEnum>(number)), streamTypeOut);
        EXPECT_FATAL(StreamTypeSerializer::fromProtobuf(static_cast<wire::StreamType>(number)), streamTypeIn);
    }
}

TEST_F(FatalReportDeathTest, StreamIdentifiers) {
    for (const int number : {7, -3, 1, 999, INT_MIN}) {
        EXPECT_FATAL(IIPSerializer::toProtobuf(static_cast<cmddistributor::IqmStreamID>(number)), streamIDOut);
        EXPECT_FATAL(IIPSerializer::fromProtobuf(static_cast<wire::IqmStreamID>(number)), streamIDIn);
    }
}

TEST_F(FatalReportDeathTest, CodeTypesOfThisProcess) {
    for (const int number : {4, -1, INT_MIN}) {
        EXPECT_FATAL(EvalIIPSerializer::toProtobuf(static_cast<cmddistributor::CodeType>(number)), codeTypeOut);
    }
}

TEST_F(FatalReportDeathTest, DequeueModesOfThisProcess) {
    for (const int number : {8, -1, INT_MIN}) {
        EXPECT_FATAL(IIPEnqueueMessageSerializer::toProtobuf(static_cast<modes::WhenToDequeue>(number)),
                     dequeueModeOut);
    }
}

TEST_F(FatalReportDeathTest, ExecutionStatuses) {
    for (const int number : {6, -1, INT_MIN}) {
        EXPECT_FATAL(toProtobuf(static_cast<krutil::cmddistributor::inExecutionStatus>(number)), statusOut);
        EXPECT_FATAL(fromProtobuf(static_cast<wire::ExecutionStatus>(number)), statusIn);
    }
}

TEST_F(FatalReportDeathTest, LoopStatesAndLoopsOfThisProcess) {
    for (const int number : {0, 3, -1}) {
        EXPECT_FATAL(DebugLoopEventSerializer::toProtobuf(static_cast<cmddistributor::DebugLoopEvent::State>(number)),
                     loopStateOut);
    }
    for (const int number : {-2, 12, INT_MIN}) {
        EXPECT_FATAL(DebugLoopEventSerializer::toProtobuf(static_cast<krutil::prompt::InputRequester>(number)),
                     loopOut);
    }
}

TEST_F(FatalReportDeathTest, TheStateOfALoopIsWrittenBeforeTheLoop) {
    const cmddistributor::DebugLoopEvent event(foundation::msg_svc::exchange::IDType(),
                                               static_cast<cmddistributor::DebugLoopEvent::State>(3),
                                               static_cast<krutil::prompt::InputRequester>(12));
    EXPECT_FATAL(DebugLoopEventSerializer::toProtobuf(event), loopStateOut);
}

TEST_F(FatalReportDeathTest, CheckedCancelStatuses) {
    using cmddistributor::IIPCancelReply;
    for (const int number : {4, 7, -1}) {
        EXPECT_FATAL(IIPCancelReplySerializer::toProtobuf(static_cast<IIPCancelReply::CancelStatus>(number)),
                     cancelStatusOut);
        EXPECT_FATAL(IIPCancelReplySerializer::fromProtobuf(static_cast<wire::CancelStatus>(number)), cancelStatusIn);
    }
}

// ---- Through the serializers ----------------------------------------------------------------------------------------

boost::shared_ptr<const cmddistributor::IIP> request(int streamID, int codeType) {
    return boost::make_shared<cmddistributor::EvalIIP>("x", static_cast<cmddistributor::IqmStreamID>(streamID), nullptr,
                                                       krutil::io::SinkTraits(), krutil::io::SinkTraits(), u"",
                                                       static_cast<cmddistributor::CodeType>(codeType));
}

TEST_F(FatalReportDeathTest, AReceivedTextOnAnUnknownStream) {
    for (const int number : {3, -1}) {
        wire::TextBaseEvent proto;
        proto.set_stream(static_cast<wire::StreamType>(number));
        EXPECT_FATAL(readObject("krutil:TextBaseEvent", proto.SerializeAsString()), streamTypeIn);
        EXPECT_FATAL(readObject("krutil:SinkTextEvent", proto.SerializeAsString()), streamTypeIn);
    }
}

TEST_F(FatalReportDeathTest, ATextToWriteOnAnUnknownStreamBeforeAnyFrame) {
    const samples::Object event =
        boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent>(boost::make_shared<krutil::io::TextBaseEvent>(
            foundation::msg_svc::exchange::IDType(), static_cast<krutil::io::StreamTypeEnum>(3), u""));
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:TextBaseEvent", event), streamTypeOut);
}

TEST_F(FatalReportDeathTest, ARequestReceivedWithAnUnknownStreamIsFatalWhenItIsWrittenAgain) {
    wire::EvalIIP proto;
    proto.mutable_iip()->set_streamid(static_cast<wire::IqmStreamID>(7));
    proto.mutable_iip()->set_plugintype("x");
    proto.mutable_iip()->mutable_outtraits();
    proto.mutable_iip()->mutable_errtraits();
    const samples::Object received = readObject("krutil:EvalIIP", proto.SerializeAsString());
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:EvalIIP", received), streamIDOut);
}

TEST_F(FatalReportDeathTest, TheStreamOfARequestIsLookedAtBeforeItsCodeType) {
    EXPECT_FATAL(writeAloud("krutil:EvalIIP", request(7, 4)), streamIDOut);
    EXPECT_FATAL(writeAloud("krutil:EvalIIP", request(0, 4)), codeTypeOut);
}

TEST_F(FatalReportDeathTest, AnUnknownDequeueModeBeforeTheRequestIsWritten) {
    const auto message = [](const boost::shared_ptr<const cmddistributor::IIP>& iip) {
        return samples::Object(boost::shared_ptr<const foundation::msg_svc::exchange::Message>(
            boost::make_shared<cmddistributor::IIPEnqueueMessage>(
                iip, foundation::msg_svc::exchange::IDType(), 0, boost::none, nullptr,
                static_cast<modes::WhenToDequeue>(8), u"", capabilities::CapabilityList(), nullptr, false)));
    };
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:IIPEnqueueMessage", message(request(0, 0))), dequeueModeOut);
    // Also before the request is looked at: neither its bad stream nor its absence is what is reported.
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:IIPEnqueueMessage", message(request(7, 0))), dequeueModeOut);
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:IIPEnqueueMessage", message(nullptr)), dequeueModeOut);
}

TEST_F(FatalReportDeathTest, AnUnknownStatusInAReceivedResultEvenWithoutAnIdentifier) {
    wire::IIPResult proto;
    proto.mutable_exception()->set_status(static_cast<wire::ExecutionStatus>(6));
    EXPECT_FATAL(readObject("krutil:IIPResult", proto.SerializeAsString()), statusIn);
    proto.mutable_id();
    EXPECT_FATAL(readObject("krutil:IIPResult", proto.SerializeAsString()), statusIn);
}

TEST_F(FatalReportDeathTest, AnUnknownStatusInAReceivedErrorToPrint) {
    wire::PrintableErrorEvent proto;
    proto.mutable_except()->set_status(static_cast<wire::ExecutionStatus>(6));
    EXPECT_FATAL(readObject("krutil:PrintableErrorEvent", proto.SerializeAsString()), statusIn);
}

TEST_F(FatalReportDeathTest, AnUnknownStatusInACauseOfACause) {
    wire::IIPResult proto;
    proto.mutable_id();
    proto.mutable_exception()->add_causes()->add_causes()->set_status(static_cast<wire::ExecutionStatus>(-1));
    EXPECT_FATAL(readObject("krutil:IIPResult", proto.SerializeAsString()), statusIn);
}

TEST_F(FatalReportDeathTest, AnUnknownStatusInAReplysResultBeforeAnyFrame) {
    using cmddistributor::RuntimeException;
    const auto bad = [](std::vector<RuntimeException> causes, int status) {
        return RuntimeException(static_cast<krutil::cmddistributor::inExecutionStatus>(status), u"", "", "", {},
                                std::move(causes), false);
    };
    const auto reply = [](const RuntimeException& exception) {
        return samples::Object(boost::shared_ptr<const foundation::msg_svc::exchange::Reply>(
            boost::make_shared<krutil::cmddistributor::IIPReply>(
                foundation::msg_svc::exchange::IDType(),
                std::make_unique<cmddistributor::IIPResult>(foundation::msg_svc::exchange::IDType(), exception))));
    };
    for (const RuntimeException& exception : {bad({}, 6), bad({bad({}, -1)}, 2)}) {
        EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud("krutil:IIPReply", reply(exception)), statusOut);
    }
}

}  // namespace
