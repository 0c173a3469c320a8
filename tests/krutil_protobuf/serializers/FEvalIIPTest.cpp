// Function calls: the order of frames and of checks, and what happens to arrays when a check fails.

#include "FEvalIIPSerializer.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <boost/make_shared.hpp>
#include <boost/variant/get.hpp>
#include <csignal>
#include <cstdio>
#include <stdexcept>

#include "foundation/core/diag/AssertionSwitch.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/serializers/ArraysTest.hpp"
#include "krutil_protobuf/serializers/FatalReport.hpp"

namespace {

using arrays::ArraysTest;
using arrays::dataIDs;
using arrays::indexes;
using arrays::large;
using arrays::small;
using cmddistributor::FEvalIIP;
using cmddistributor::IIP;
using cmddistributor::IqmStreamID;
using foundation::korveldata::Array;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::cmddistributor::EDIDataWrapper;
using krutil::io::SinkTraits;
using krutil::protobuf_serializer::FEvalIIPSerializer;
using krutil::protobuf_serializer::IIPFamily;
using krutil::protobuf_serializer::NestedWriter;
using transport::errorText;
using transport::FrameIndex;
using transport::Message;
using transport::MessageStream;
using transport::parsed;
using transport::Registry;
using transport::SerializationContext;
namespace wire = krutil::protobuf;

constexpr std::size_t million = 1'000'000;

const SinkTraits callOutTraits(false, true, false, true, false, false);
const SinkTraits callErrTraits(false, false, true, false, true, true);

boost::shared_ptr<const IIP> callWith(boost::shared_ptr<FEvalIIP::Data> data, std::uint64_t client = 3,
                                      std::uint64_t server = 4, IqmStreamID streamID = IqmStreamID::ekIqmJavaStream) {
    return boost::make_shared<FEvalIIP>("console", std::string("numpy.dot"), 2, std::move(data), streamID,
                                        callOutTraits, callErrTraits, client, server, true);
}

boost::shared_ptr<const IIP> call(std::vector<Array>&& arguments, std::uint64_t client = 3, std::uint64_t server = 4,
                                  IqmStreamID streamID = IqmStreamID::ekIqmJavaStream) {
    return callWith(FEvalIIP::Data::makeClientSideData(EDIDataWrapper(std::move(arguments))), client, server, streamID);
}

wire::FEvalIIP callProto(const std::vector<std::uint64_t>& dataIDs, std::uint64_t client = 3,
                         std::uint64_t server = 4) {
    wire::FEvalIIP proto;
    proto.mutable_iip()->set_plugintype("console");
    proto.mutable_iip()->set_streamid(wire::ekIqmJavaStream);
    proto.mutable_iip()->mutable_outtraits();
    proto.mutable_iip()->mutable_errtraits();
    proto.set_functionname("numpy.dot");
    proto.set_nlhs(2);
    for (const std::uint64_t id : dataIDs) {
        proto.add_dataids(id);
    }
    proto.set_clientqvmid(client);
    proto.set_serverqvmid(server);
    return proto;
}

class FEvalIIPTest : public ArraysTest {
  protected:
    FrameIndex write(const boost::shared_ptr<const IIP>& request, FrameIndex first) const {
        return writeAs<IIPFamily>("krutil:FEvalIIP", request, first);
    }

    boost::shared_ptr<const FEvalIIP> read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return boost::dynamic_pointer_cast<const FEvalIIP>(readAs<IIPFamily>("krutil:FEvalIIP", message, index));
    }

    // Reads `proto`, which stands behind one array with a data frame; the array's ID is 2.
    boost::shared_ptr<const FEvalIIP> readBehindAnArray(const wire::FEvalIIP& proto) const {
        return read(messageOf(proto, "krutil:FEvalIIP", framesOf({large()})), 3);
    }

    static const std::vector<Array>& argumentsOf(const FEvalIIP& request) {
        return boost::get<EDIDataWrapper>(request.getInputArguments()).arrays();
    }

    wire::FEvalIIP written() const { return parsed<wire::FEvalIIP>(*frames().back()); }
};

TEST_F(FEvalIIPTest, WithoutArgumentsTheCallIsOneFrame) {
    EXPECT_EQ(write(call({}), 5), 6U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{5}));
    EXPECT_EQ(written().dataids_size(), 0);
    EXPECT_TRUE(argumentsOf(*read(received(), 5)).empty());
}

TEST_F(FEvalIIPTest, ADefaultWrapperIsACallWithoutArguments) {
    EXPECT_EQ(write(callWith(FEvalIIP::Data::makeClientSideData(EDIDataWrapper())), 5), 6U);
    EXPECT_EQ(frames().size(), 1U);
    EXPECT_EQ(written().dataids_size(), 0);
}

TEST_F(FEvalIIPTest, ThreeSmallArgumentsGivenIndex10) {
    EXPECT_EQ(write(call({small(1), small(2), small(3)}), 10), 14U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{10, 11, 12, 13}));
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{10, 11, 12}));
    EXPECT_EQ(transport::contentOf(*frames()[0]).tag, "krutil:QDA");
    EXPECT_EQ(transport::contentOf(*frames()[3]).tag, "krutil:FEvalIIP");
    EXPECT_EQ(argumentsOf(*read(received(), 13)), (std::vector<Array>{small(1), small(2), small(3)}));
}

TEST_F(FEvalIIPTest, AnArgumentGivenIndex0) {
    EXPECT_EQ(write(call({small(1)}), 0), 2U);
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{0}));
    EXPECT_EQ(argumentsOf(*read(received(), 1)), (std::vector<Array>{small(1)}));
}

// The arguments are written before the function is looked at.
TEST_F(FEvalIIPTest, AFunctionGivenAsAnArrayThrowsAndItsArgumentsStayInTheStream) {
    const auto request =
        boost::make_shared<const FEvalIIP>("console", std::make_shared<Array>(small(7)), 2,
                                           FEvalIIP::Data::makeClientSideData(EDIDataWrapper({large(), small(1)})),
                                           IqmStreamID::ekIqmJavaStream, callOutTraits, callErrTraits, 3, 4, true);
    EXPECT_THROW(write(request, 1), boost::bad_get);
    ASSERT_EQ(indexes(frames()), (std::vector<FrameIndex>{1, 2, 3}));
    EXPECT_EQ(transport::contentOf(*frames()[1]).tag, "krutil:QDA");
    EXPECT_EQ(transport::contentOf(*frames()[2]).tag, "krutil:QDA");
}

TEST_F(FEvalIIPTest, DataFramesOfArgumentsStandBeforeTheirArrays) {
    EXPECT_EQ(write(call({large(), large(5000)}), 5), 10U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{5, 6, 7, 8, 9}));
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{6, 8}));
    EXPECT_EQ(frames()[0]->size(), 4096U);
    EXPECT_EQ(frames()[2]->size(), 5000U);
    EXPECT_EQ(argumentsOf(*read(received(), 9)), (std::vector<Array>{large(), large(5000)}));
}

TEST_F(FEvalIIPTest, ArgumentsAreLentToTheirFramesAndReceivedInPlace) {
    const Array argument = large();
    write(call({argument}), 1);
    EXPECT_EQ(frames().at(0)->data(), argument.data());
    const auto message = received();
    const char* const address = message->frame(1)->data();
    EXPECT_EQ(argumentsOf(*read(message, 3)).at(0).data(), address);
}

TEST_F(FEvalIIPTest, TheRebuiltRequestTakesFourValuesFromItsCore) {
    write(call({small(1)}), 1);
    const auto back = read(received(), 2);
    ASSERT_NE(back, nullptr);
    EXPECT_EQ(back->getPluginType(), "console");
    EXPECT_EQ(back->getStreamID(), IqmStreamID::ekIqmJavaStream);
    EXPECT_EQ(back->getOutTraits(), callOutTraits);
    EXPECT_EQ(back->getErrTraits(), callErrTraits);
    EXPECT_EQ(back->getFunctionName(), "numpy.dot");
    EXPECT_EQ(back->getNlhs(), 2U);
    EXPECT_EQ(back->getClientQvmID(), 3U);
    EXPECT_EQ(back->getQvmID(), 4U);
    EXPECT_FALSE(back->isLocal());
    EXPECT_TRUE(back->getData()->received());
    EXPECT_EQ(back->getData()->clientQvmID(), 3U);
    EXPECT_EQ(back->getData()->serverQvmID(), 4U);
}

TEST_F(FEvalIIPTest, OtherContentOfTheCoreIsReadAndLeftBehind) {
    wire::FEvalIIP proto = callProto({});
    proto.mutable_iip()->GetReflection()->MutableUnknownFields(proto.mutable_iip())->AddVarint(99, 5);
    const auto back = read(messageOf(proto, "krutil:FEvalIIP", {}), 1);
    EXPECT_EQ(back->getPluginType(), "console");
    write(back, 1);
    EXPECT_EQ(written().SerializeAsString(), callProto({}).SerializeAsString());
}

TEST_F(FEvalIIPTest, ArraysAreReadBeforeTheFieldsAreChecked) {
    // Nothing but a data ID that leads nowhere.
    wire::FEvalIIP proto;
    proto.add_dataids(9);
    EXPECT_THROW(readBehindAnArray(proto), std::bad_cast);
    auto frames = framesOf({small(1)});
    frames[0].tag = "unknown";
    proto.set_dataids(0, 1);
    EXPECT_THROW(read(messageOf(proto, "krutil:FEvalIIP", frames), 2), std::out_of_range);
}

TEST_F(FEvalIIPTest, FieldsAreCheckedInTheOrderCoreClientServer) {
    const auto text = [this](const wire::FEvalIIP& proto) {
        return errorText<std::logic_error>([&] { readBehindAnArray(proto); });
    };
    wire::FEvalIIP proto;
    proto.add_dataids(2);
    EXPECT_EQ(text(proto), "Required field missing: protobuf::FEvalIIP.iip");
    proto.mutable_iip();
    EXPECT_EQ(text(proto), "Required string field protobuf::IIP.pluginType is empty.");
    proto.mutable_iip()->set_plugintype("x");
    EXPECT_EQ(text(proto), "Required field protobuf::IIP.outTraits is missing.");
    proto.mutable_iip()->mutable_outtraits();
    EXPECT_EQ(text(proto), "Required field protobuf::IIP.errTraits is missing.");
    proto.mutable_iip()->mutable_errtraits();
    EXPECT_EQ(text(proto), "Invalid krutil::protobuf::FEvalIIP.clientQvmID field value of 0");
    proto.set_serverqvmid(1);
    EXPECT_EQ(text(proto), "Invalid krutil::protobuf::FEvalIIP.clientQvmID field value of 0");
    proto.set_serverqvmid(0);
    proto.set_clientqvmid(1);
    EXPECT_EQ(text(proto), "Invalid krutil::protobuf::FEvalIIP.serverQvmID field value of 0");
    proto.set_serverqvmid(1);
    EXPECT_EQ(text(proto), "no exception");
}

TEST_F(FEvalIIPTest, ArraysThatWereReadAreReleasedWhenALaterCheckFails) {
    wire::FEvalIIP noCore = callProto({2});
    noCore.clear_iip();
    for (const wire::FEvalIIP& proto : {noCore, callProto({2}, 0, 4), callProto({2}, 3, 0)}) {
        const auto message = messageOf(proto, "krutil:FEvalIIP", framesOf({large()}));
        EXPECT_THROW(read(message, 3), std::logic_error);
        EXPECT_EQ(message->frame(1), nullptr);
        EXPECT_EQ(message->frame(2), nullptr);
        // The message lives on, the buffers that were in it do not.
        EXPECT_EQ(BufferAllocator::inUse(), before());
    }
    const auto message = messageOf(callProto({2, 2}), "krutil:FEvalIIP", framesOf({large()}));
    EXPECT_THROW(read(message, 3), std::bad_cast);
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(FEvalIIPTest, ACallThatRefersToItselfIsBadCast) {
    EXPECT_THROW(read(messageOf(callProto({1}), "krutil:FEvalIIP", {}), 1), std::bad_cast);
    EXPECT_THROW(readBehindAnArray(callProto({2, 3})), std::bad_cast);
}

TEST_F(FEvalIIPTest, AMillionDataIDsInASmallMessageAreBadCast) {
    wire::FEvalIIP proto = callProto({});
    proto.mutable_dataids()->Resize(million, 1);
    const auto message = messageOf(proto, "krutil:FEvalIIP", framesOf({small(1)}));
    ASSERT_LT(message->frame(2)->size(), million + 200);
    AllocationRecorder recorder;
    EXPECT_THROW(read(message, 2), std::bad_cast);
    recorder.stop();
    // The numbers themselves, as the parser keeps them, and nothing for the arrays that they claim.
    EXPECT_LE(recorder.largest(), 2 * million * sizeof(std::uint64_t) + 1024);
}

TEST_F(FEvalIIPTest, WithoutASerializerOfArraysACallWithoutArgumentsIsOutOfRange) {
    const auto bare = std::make_shared<Registry>();
    const auto serializer = std::make_shared<FEvalIIPSerializer>();
    bare->insert(serializer);
    EXPECT_THROW(serializer->serialize(call({}), 7, 1, stream_, bare, SerializationContext()), std::out_of_range);
    EXPECT_TRUE(frames().empty());
}

TEST_F(FEvalIIPTest, IdentifiersOf0AreSentWhileAssertionsAreOff) {
    ASSERT_FALSE(foundation::core::diag::enableAssertions(false));
    EXPECT_EQ(write(call({small(1)}, 0, 0), 1), 3U);
    EXPECT_EQ(written().clientqvmid(), 0U);
    EXPECT_EQ(written().serverqvmid(), 0U);
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{1}));
}

TEST_F(FEvalIIPTest, IdentifiersThatAreSetPassTheAssertions) {
    const bool enabled = foundation::core::diag::enableAssertions(true);
    EXPECT_EQ(write(call({}, 1, ~std::uint64_t{0}), 1), 2U);
    foundation::core::diag::enableAssertions(enabled);
    EXPECT_EQ(written().clientqvmid(), 1U);
    EXPECT_EQ(written().serverqvmid(), ~std::uint64_t{0});
}

// ---- Calls that end the process -------------------------------------------------------------------------------------

void writeAloud(const boost::shared_ptr<const IIP>& request, bool assertions = false) {
    foundation::core::diag::enableAssertions(assertions);
    fatal::writeAloud("krutil:FEvalIIP", request);
}

std::string reportOf(const std::string& message, int line) {
    return "fatal: " + message + " (FEvalIIPSerializer:" + std::to_string(line) +
           ", virtual foundation::vantor::carrier::framing::FrameIndex "
           "krutil::protobuf_serializer::FEvalIIPSerializer::serialize("
           "const boost::shared_ptr<const cmddistributor::IIP>&, foundation::vantor::carrier::framing::StreamID, "
           "foundation::vantor::carrier::framing::FrameIndex, "
           "const std::shared_ptr<foundation::msg_svc::transport::layers::message::MessageStream>&, "
           "const std::shared_ptr<const foundation::msg_svc::transport::layers::serialization::Registry>&, "
           "const foundation::msg_svc::transport::layers::serialization::SerializationContext&) const)\n";
}

using FEvalIIPDeathTest = fatal::FatalTest;

TEST_F(FEvalIIPDeathTest, ArgumentsInAnotherFormBeforeAnyFrame) {
    const auto text = [] {
        return callWith(FEvalIIP::Data::makeClientSideData(std::vector<std::u16string>{u"1", u"2"}), 0, 0);
    };
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud(text(), true),
                                  reportOf("FEvalIIPSerializer only supports KORVEL Data Arrays", 63));
}

TEST_F(FEvalIIPDeathTest, ArgumentsThatCannotBeHad) {
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeAloud(callWith(nullptr)),
                                  reportOf("FEvalIIPSerializer: Unexpected exception", 66));
}

const AllocationRecorder* exhausted = nullptr;

void tellWhetherMemoryRanOut(int /*signal*/) {
    const std::string_view text = exhausted->failed() ? "out of memory\n" : "memory left\n";
    if (::write(STDERR_FILENO, text.data(), text.size()) < 0) {
        std::_Exit(1);
    }
}

void extractWithoutMemory() {
    const auto registry = std::static_pointer_cast<const Registry>(transport::sessionRegistry());
    const std::shared_ptr<MessageStream> stream = std::make_shared<fatal::TellingStream>();
    const SerializationContext context;
    NestedWriter nested(7, 1, stream, registry, context);
    const auto request = boost::dynamic_pointer_cast<const FEvalIIP>(callWith(nullptr));
    krutil::protobuf::FEvalIIP proto;
    std::signal(SIGABRT, tellWhetherMemoryRanOut);
    const AllocationRecorder recorder(0);
    exhausted = &recorder;
    FEvalIIPSerializer::fill(*request, proto, nested);
}

TEST_F(FEvalIIPDeathTest, ArgumentsThatCannotBeHadForLackOfMemory) {
    EXPECT_FATAL(extractWithoutMemory(), reportOf("FEvalIIPSerializer: Unexpected exception", 66) + "out of memory\n");
}

TEST_F(FEvalIIPDeathTest, AFailedAssertionOnAnIdentifierComesAfterTheArrays) {
    const std::string arrays = "appended 1\nappended 2\nappended 3\n";
    const std::string client = arrays + reportOf("fevaliip->getClientQvmID()", 80);
    const std::string server = arrays + reportOf("fevaliip->getQvmID()", 82);
    EXPECT_FATAL(writeAloud(call({large(), small(1)}, 0, 4), true), client);
    EXPECT_FATAL(writeAloud(call({large(), small(1)}, 0, 0), true), client);
    EXPECT_FATAL(writeAloud(call({large(), small(1)}, 3, 0), true), server);
}

TEST_F(FEvalIIPDeathTest, AnUnknownStreamComesAfterTheArraysAndBeforeTheAssertions) {
    EXPECT_FATAL(writeAloud(call({small(1)}, 0, 0, static_cast<IqmStreamID>(7)), true),
                 "appended 1\n" + fatal::streamIDOut);
}

}  // namespace
