// Function calls and their results: the order of frames and of checks, and what happens to arrays when a check fails.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <boost/exception/exception.hpp>
#include <boost/make_shared.hpp>
#include <boost/variant/get.hpp>

#include <csignal>
#include <cstdio>
#include <stdexcept>

#include "FEvalIIPSerializer.hpp"
#include "FEvalResultSerializer.hpp"
#include "NestedArrays.hpp"
#include "foundation/core/diag/AssertionSwitch.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "krutil.protobuf.IIPReply.pb.h"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/serializers/FatalReport.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using cmddistributor::FEvalIIP;
using cmddistributor::FEvalResult;
using cmddistributor::IIP;
using cmddistributor::IIPResult;
using cmddistributor::IqmStreamID;
using cmddistributor::RuntimeException;
using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::msg_svc::exchange::IDType;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::cmddistributor::EDIDataWrapper;
using krutil::cmddistributor::IIPReply;
using krutil::io::SinkTraits;
using krutil::protobuf_serializer::DataID;
using krutil::protobuf_serializer::FEvalIIPSerializer;
using krutil::protobuf_serializer::FEvalResultSerializer;
using krutil::protobuf_serializer::IIPFamily;
using krutil::protobuf_serializer::NestedReader;
using krutil::protobuf_serializer::NestedWriter;
using krutil::protobuf_serializer::readArrays;
using krutil::protobuf_serializer::ReplyFamily;
using krutil::protobuf_serializer::ResultFamily;
using krutil::protobuf_serializer::writeArrays;
using transport::errorText;
using transport::FrameContent;
using transport::FrameIndex;
using transport::FrameType;
using transport::Message;
using transport::MessageStream;
using transport::parsed;
using transport::RecordingStream;
using transport::Registry;
using transport::SerializationContext;
namespace wire = krutil::protobuf;

constexpr std::size_t million = 1'000'000;

Array small(double value) {
    return ArrayFactory().createScalar(value);
}

// Goes out of line.
Array large(std::uint64_t size = 4096) {
    return ArrayFactory().createArray(ElementType::UInt8, {size});
}

template <class Proto>
std::vector<std::uint64_t> dataIDs(const Proto& proto) {
    return {proto.dataids().begin(), proto.dataids().end()};
}

std::vector<FrameIndex> indexes(const transport::Frames& frames) {
    std::vector<FrameIndex> result;
    for (const auto& frame : frames) {
        result.push_back(frame->index());
    }
    return result;
}

// Everything that a transport gives to serializers, and frames of arrays to refer to.
class ArraysTest : public testing::Test {
  protected:
    void TearDown() override {
        stream_->frames.clear();
        EXPECT_EQ(BufferAllocator::inUse(), before_);
    }

    std::size_t before() const { return before_; }
    const transport::Frames& frames() const { return stream_->frames; }
    const std::shared_ptr<const Registry>& registry() const { return registry_; }
    const std::shared_ptr<MessageStream>& stream() const { return anyStream_; }

    // What has been written, as a peer receives it.
    std::unique_ptr<Message> received() const { return transport::makeMessage(transport::contentOf(frames())); }

    // The frames of `arrays` from index 1 on.
    std::vector<FrameContent> framesOf(const std::vector<Array>& arrays) const {
        const auto stream = std::make_shared<RecordingStream>();
        const std::shared_ptr<MessageStream> any = stream;
        NestedWriter nested(7, 1, any, registry_, context_);
        writeArrays(arrays, nested);
        return transport::contentOf(stream->frames);
    }

    // `before`, and behind it a tagged frame of `proto`.
    template <class Proto>
    static std::unique_ptr<Message> messageOf(const Proto& proto, const std::string& tag,
                                              std::vector<FrameContent> before) {
        before.push_back({true, FrameType::Object, 7, before.size() + 1, tag, proto.SerializeAsString()});
        return transport::makeMessage(before);
    }

  private:
    std::size_t before_ = BufferAllocator::inUse();
    std::shared_ptr<const Registry> registry_ = transport::sessionRegistry();
    std::shared_ptr<RecordingStream> stream_ = std::make_shared<RecordingStream>();
    std::shared_ptr<MessageStream> anyStream_ = stream_;
    SerializationContext context_;
};

// ---- Nested arrays --------------------------------------------------------------------------------------------------

class NestedArraysTest : public ArraysTest {
  protected:
    static google::protobuf::RepeatedField<std::uint64_t> ids(std::vector<std::uint64_t> values) {
        return {values.begin(), values.end()};
    }

    std::vector<Array> read(const google::protobuf::RepeatedField<std::uint64_t>& dataIDs,
                            const std::unique_ptr<Message>& message) const {
        const SerializationContext context;
        return readArrays(dataIDs, NestedReader(message, registry(), context));
    }

    std::vector<DataID> writeWith(const std::shared_ptr<const Registry>& registry,
                                  const std::vector<Array>& arrays) const {
        const SerializationContext context;
        NestedWriter nested(7, 1, stream(), registry, context);
        return writeArrays(arrays, nested);
    }
};

TEST_F(NestedArraysTest, DataIDsAreTheTaggedFramesBehindTheDataFrames) {
    EXPECT_EQ(writeWith(registry(), {large(), small(1), large()}), (std::vector<DataID>{2, 3, 5}));
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{1, 2, 3, 4, 5}));
    const auto message = received();
    const std::vector<Array> back = read(ids({2, 3, 5}), message);
    EXPECT_EQ(back, (std::vector<Array>{large(), small(1), large()}));
}

TEST_F(NestedArraysTest, NoDataIDsAreNoArraysWhateverTheMessageHolds) {
    const auto message = std::make_unique<Message>(transport::Frames());
    EXPECT_TRUE(read(ids({}), message).empty());
}

TEST_F(NestedArraysTest, ArraysAreReadInTheOrderOfTheirIDs) {
    const auto message = transport::makeMessage(framesOf({small(1), small(2), small(3)}));
    EXPECT_EQ(read(ids({3, 1, 2}), message), (std::vector<Array>{small(3), small(1), small(2)}));
}

TEST_F(NestedArraysTest, ADataIDOf0IsAnIndexLikeAnyOther) {
    auto given = framesOf({small(1), small(2)});
    given[0].index = 0;
    EXPECT_EQ(read(ids({0, 2}), transport::makeMessage(given)), (std::vector<Array>{small(1), small(2)}));
    EXPECT_EQ(read(ids({2, 0}), transport::makeMessage(given)), (std::vector<Array>{small(2), small(1)}));
}

TEST_F(NestedArraysTest, WithoutASerializerOfArraysWritingIsOutOfRangeEvenWithoutArrays) {
    const auto empty = std::make_shared<Registry>();
    EXPECT_THROW(writeWith(empty, {}), std::out_of_range);
    EXPECT_THROW(writeWith(empty, {small(1)}), std::out_of_range);
}

TEST_F(NestedArraysTest, ASerializerOfAnotherFamilyUnderTheTypeOfArraysIsBadCastEvenWithoutArrays) {
    const auto misplaced = std::make_shared<Registry>();
    misplaced->insert(std::make_shared<transport::MisplacedSerializer<ReplyFamily>>(typeid(Array)));
    EXPECT_THROW(writeWith(misplaced, {}), std::bad_cast);
    EXPECT_THROW(writeWith(misplaced, {small(1)}), std::bad_cast);
}

TEST_F(NestedArraysTest, AFirstTagThatIsUnknownIsOutOfRangeAndOneOfAnotherFamilyIsBadCast) {
    auto given = framesOf({small(1), small(2)});
    given[0].tag = "unknown";
    auto message = transport::makeMessage(given);
    EXPECT_THROW(read(ids({1, 2}), message), std::out_of_range);
    for (const char* tag : {"krutil:EvalIIP", "krutil:IIPResult", "krutil:IIPReply", "krutil:TextBaseEvent"}) {
        given[0].tag = tag;
        message = transport::makeMessage(given);
        EXPECT_THROW(read(ids({1, 2}), message), std::bad_cast) << tag;
        EXPECT_NE(message->frame(1), nullptr) << tag;
    }
}

TEST_F(NestedArraysTest, OnlyTheFirstTagSelectsTheSerializer) {
    auto given = framesOf({small(1), small(2), small(3)});
    given[1].tag = "unknown";
    given[2].tag = "krutil:EvalIIP";
    const auto message = transport::makeMessage(given);
    EXPECT_EQ(read(ids({1, 2, 3}), message), (std::vector<Array>{small(1), small(2), small(3)}));
}

TEST_F(NestedArraysTest, ADataIDWithoutATaggedFrameIsBadCastAtAnyPosition) {
    const auto given = framesOf({large(), small(2)});  // Data frame 1, arrays 2 and 3.
    for (const FrameIndex bad : {FrameIndex{0}, FrameIndex{1}, FrameIndex{4}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        EXPECT_THROW(read(ids({bad}), transport::makeMessage(given)), std::bad_cast) << bad;
        EXPECT_THROW(read(ids({2, bad}), transport::makeMessage(given)), std::bad_cast) << bad;
        EXPECT_EQ(BufferAllocator::inUse(), before());
    }
    EXPECT_THROW(read(ids({3, 3}), transport::makeMessage(given)), std::bad_cast);
}

TEST_F(NestedArraysTest, AMillionDataIDsAreOneBadCastAndNoMemoryInProportion) {
    const auto given = framesOf({small(1)});
    for (const std::uint64_t id : {std::uint64_t{1}, std::uint64_t{99}}) {
        google::protobuf::RepeatedField<std::uint64_t> claimed;
        claimed.Resize(million, id);
        const auto message = transport::makeMessage(given);
        AllocationRecorder recorder;
        EXPECT_THROW(read(claimed, message), std::bad_cast);
        recorder.stop();
        EXPECT_LT(recorder.bytes(), 16384U);
        EXPECT_LT(recorder.allocations(), 100U);
    }
}

// ---- Calls ----------------------------------------------------------------------------------------------------------

const SinkTraits outTraits(false, true, false, true, false, false);
const SinkTraits errTraits(false, false, true, false, true, true);

boost::shared_ptr<const IIP> callWith(boost::shared_ptr<FEvalIIP::Data> data, std::uint64_t client = 3,
                                      std::uint64_t server = 4, IqmStreamID streamID = IqmStreamID::ekIqmJavaStream) {
    return boost::make_shared<FEvalIIP>("console", std::string("numpy.dot"), 2, std::move(data), streamID, outTraits,
                                        errTraits, client, server, true);
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
        return serializer().serialize(request, 7, first, stream(), registry(), SerializationContext());
    }

    boost::shared_ptr<const FEvalIIP> read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return boost::dynamic_pointer_cast<const FEvalIIP>(
            serializer().deserialize(index, message, registry(), SerializationContext()));
    }

    // Reads `proto`, which stands behind one array with a data frame; the array's ID is 2.
    boost::shared_ptr<const FEvalIIP> readBehindAnArray(const wire::FEvalIIP& proto) const {
        return read(messageOf(proto, "krutil:FEvalIIP", framesOf({large()})), 3);
    }

    static const std::vector<Array>& argumentsOf(const FEvalIIP& request) {
        return boost::get<EDIDataWrapper>(request.getInputArguments()).arrays();
    }

    wire::FEvalIIP written() const { return parsed<wire::FEvalIIP>(*frames().back()); }

  private:
    const IIPFamily& serializer() const { return transport::serializer<IIPFamily>(*registry(), "krutil:FEvalIIP"); }
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
                                           IqmStreamID::ekIqmJavaStream, outTraits, errTraits, 3, 4, true);
    EXPECT_THROW(write(request, 1), boost::bad_get);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{1, 2, 3}));
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
    EXPECT_EQ(back->getOutTraits(), outTraits);
    EXPECT_EQ(back->getErrTraits(), errTraits);
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
    EXPECT_THROW(serializer->serialize(call({}), 7, 1, stream(), bare, SerializationContext()), std::out_of_range);
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
    std::signal(SIGABRT, tellWhetherMemoryRanOut);
    const AllocationRecorder recorder(0);
    exhausted = &recorder;
    FEvalIIPSerializer::toProtobuf(*request, nested);
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

// ---- Results --------------------------------------------------------------------------------------------------------

const IDType requestID(5, 6);

RuntimeException exceptionWith(int status) {
    return {static_cast<krutil::cmddistributor::inExecutionStatus>(status), u"text", "id", "function", {}, {}, false};
}

std::unique_ptr<IIPResult> outputs(std::vector<Array>&& arrays) {
    return std::make_unique<FEvalResult>(requestID, std::move(arrays));
}

wire::FEvalResult resultProto(const std::vector<std::uint64_t>& dataIDs) {
    wire::FEvalResult proto;
    proto.mutable_iipresult()->mutable_id()->set_lo(6);
    for (const std::uint64_t id : dataIDs) {
        proto.add_dataids(id);
    }
    return proto;
}

class FEvalResultTest : public ArraysTest {
  protected:
    FrameIndex write(const std::unique_ptr<IIPResult>& result, FrameIndex first) const {
        return serializer().serialize(result, 7, first, stream(), registry(), SerializationContext());
    }

    std::unique_ptr<IIPResult> read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return serializer().deserialize(index, message, registry(), SerializationContext());
    }

    static const std::vector<Array>& arraysOf(const IIPResult& result) {
        return boost::get<std::vector<Array>>(dynamic_cast<const FEvalResult&>(result).getResults());
    }

    wire::FEvalResult written() const { return parsed<wire::FEvalResult>(*frames().back()); }

  private:
    const ResultFamily& serializer() const {
        return transport::serializer<ResultFamily>(*registry(), "krutil:FEvalResult");
    }
};

TEST_F(FEvalResultTest, WithoutOutputsTheResultIsOneFrame) {
    EXPECT_EQ(write(outputs({}), 5), 6U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{5}));
    EXPECT_EQ(written().dataids_size(), 0);
    const auto back = read(received(), 5);
    EXPECT_EQ(back->id, requestID);
    EXPECT_TRUE(arraysOf(*back).empty());
}

TEST_F(FEvalResultTest, TwoSmallOutputsGivenIndex3) {
    EXPECT_EQ(write(outputs({small(1), small(2)}), 3), 6U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{3, 4, 5}));
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{3, 4}));
    EXPECT_EQ(arraysOf(*read(received(), 5)), (std::vector<Array>{small(1), small(2)}));
}

TEST_F(FEvalResultTest, AnOutputGivenIndex0) {
    EXPECT_EQ(write(outputs({small(1)}), 0), 2U);
    EXPECT_EQ(dataIDs(written()), (std::vector<std::uint64_t>{0}));
    EXPECT_EQ(arraysOf(*read(received(), 1)), (std::vector<Array>{small(1)}));
}

TEST_F(FEvalResultTest, OutputsAreLentToTheirFramesAndReceivedInPlace) {
    const Array output = large();
    write(outputs({output}), 1);
    EXPECT_EQ(frames().at(0)->data(), output.data());
    const auto message = received();
    const char* const address = message->frame(1)->data();
    EXPECT_EQ(arraysOf(*read(message, 3)).at(0).data(), address);
}

TEST_F(FEvalResultTest, InsideAReplyTheResultIDIsTheResultsOwnFrame) {
    const auto& replies = transport::serializer<ReplyFamily>(*registry(), "krutil:IIPReply");
    EXPECT_EQ(replies.serialize(boost::make_shared<IIPReply>(IDType(1, 2), outputs({small(1), small(2)})), 7, 3,
                                stream(), registry(), SerializationContext()),
              7U);
    EXPECT_EQ(indexes(frames()), (std::vector<FrameIndex>{3, 4, 5, 6}));
    EXPECT_EQ(parsed<wire::IIPReply>(*frames().back()).resultid(), 5U);
    const auto back = boost::dynamic_pointer_cast<const IIPReply>(
        replies.deserialize(6, received(), registry(), SerializationContext()));
    EXPECT_EQ(back->getID(), IDType(1, 2));
    EXPECT_EQ(back->getResult()->id, requestID);
    EXPECT_EQ(arraysOf(*back->getResult()), (std::vector<Array>{small(1), small(2)}));
}

TEST_F(FEvalResultTest, OutputsOfARefusedReplyAreReleased) {
    auto given = framesOf({large()});
    given.push_back({true, FrameType::Object, 7, 3, "krutil:FEvalResult", resultProto({2}).SerializeAsString()});
    wire::IIPReply reply;
    reply.set_resultid(3);
    const auto message = messageOf(reply, "krutil:IIPReply", given);
    EXPECT_EQ(errorText<std::logic_error>([&] {
                  transport::serializer<ReplyFamily>(*registry(), "krutil:IIPReply")
                      .deserialize(4, message, registry(), SerializationContext());
              }),
              "Required field is missing: protobuf::IIPReply.id");
    EXPECT_EQ(message->frame(1), nullptr);
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(FEvalResultTest, AnExceptionIsSentAndNotReadBack) {
    const std::unique_ptr<IIPResult> failed =
        std::make_unique<FEvalResult>(requestID, FEvalResult::Results(std::vector<Array>{small(1)}), exceptionWith(2));
    write(failed, 1);
    EXPECT_EQ(written().iipresult().exception().status(), 2);
    EXPECT_EQ(written().iipresult().exception().msgid(), "id");
    const auto back = read(received(), 2);
    EXPECT_FALSE(back->getException().has_value());
    EXPECT_EQ(arraysOf(*back), (std::vector<Array>{small(1)}));
}

TEST_F(FEvalResultTest, TheRecordIsCheckedBeforeAnArrayIsRead) {
    wire::FEvalResult proto;
    proto.add_dataids(2);
    proto.add_dataids(9);
    const auto text = [&] {
        const auto message = messageOf(proto, "krutil:FEvalResult", framesOf({large()}));
        const std::string error = errorText<std::logic_error>([&] { read(message, 3); });
        EXPECT_NE(message->frame(1), nullptr);
        EXPECT_NE(message->frame(2), nullptr);
        EXPECT_EQ(message->frame(3), nullptr);
        return error;
    };
    EXPECT_EQ(text(), "Required field is missing: protobuf::FEvalResult.iipResult");
    proto.mutable_iipresult()->mutable_exception();
    EXPECT_EQ(text(), "Required field is missing: protobuf::IIPResult.id");
    proto.mutable_iipresult()->mutable_id();
    const auto message = messageOf(proto, "krutil:FEvalResult", framesOf({large()}));
    EXPECT_THROW(read(message, 3), std::bad_cast);
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(FEvalResultTest, AnEmptyMessageLacksItsRecord) {
    EXPECT_EQ(errorText<std::logic_error>([&] { read(transport::makeMessage("krutil:FEvalResult", ""), 1); }),
              "Required field is missing: protobuf::FEvalResult.iipResult");
}

TEST_F(FEvalResultTest, TheFirstTagSelectsTheSerializerOfAllOutputs) {
    auto given = framesOf({small(1), small(2)});
    given[1].tag = "unknown";
    const auto back = read(messageOf(resultProto({1, 2}), "krutil:FEvalResult", given), 3);
    EXPECT_EQ(arraysOf(*back), (std::vector<Array>{small(1), small(2)}));
    EXPECT_THROW(read(messageOf(resultProto({2, 1}), "krutil:FEvalResult", given), 3), std::out_of_range);
    given[1].tag = "krutil:IIPResult";
    EXPECT_THROW(read(messageOf(resultProto({2, 1}), "krutil:FEvalResult", given), 3), std::bad_cast);
}

TEST_F(FEvalResultTest, OutputsInAnotherFormAreBoostsWrappedBadGetAndNothingIsWritten) {
    for (int form = 0; form < 3; ++form) {
        FEvalResult::Results results;
        if (form == 1) {
            results = std::vector<std::u16string>{u"1"};
        } else if (form == 2) {
            results = EDIDataWrapper(std::vector<Array>{small(1)});
        }
        const std::unique_ptr<IIPResult> result =
            std::make_unique<FEvalResult>(requestID, std::move(results), boost::none);
        bool caught = false;
        try {
            write(result, 1);
        } catch (const boost::bad_get& error) {
            caught = true;
            EXPECT_NE(dynamic_cast<const boost::exception*>(&error), nullptr);
            EXPECT_NE(typeid(error), typeid(boost::bad_get));
        }
        EXPECT_TRUE(caught) << form;
        EXPECT_TRUE(frames().empty()) << form;
    }
}

TEST_F(FEvalResultTest, WithoutACallableTheArraysAreLeftOutAndNothingComesBack) {
    const wire::FEvalResult proto =
        FEvalResultSerializer::toProtobuf(FEvalResult(requestID, {small(1)}), FEvalResultSerializer::WriteArrays());
    EXPECT_EQ(proto.iipresult().id().lo(), 6U);
    EXPECT_EQ(proto.dataids_size(), 0);
    // Nor is the form of the outputs looked at.
    const FEvalResult nothing(requestID, FEvalResult::Results(), boost::none);
    EXPECT_TRUE(FEvalResultSerializer::toProtobuf(nothing, FEvalResultSerializer::WriteArrays()).has_iipresult());

    EXPECT_EQ(FEvalResultSerializer::fromProtobuf(resultProto({1}), FEvalResultSerializer::ReadArrays()), nullptr);
    EXPECT_EQ(errorText<std::logic_error>([] {
                  FEvalResultSerializer::fromProtobuf(wire::FEvalResult(), FEvalResultSerializer::ReadArrays());
              }),
              "Required field is missing: protobuf::FEvalResult.iipResult");
}

TEST_F(FEvalResultTest, TheCallablesGetTheArraysAndTheIDsInOrder) {
    std::vector<Array> given;
    const FEvalResultSerializer::WriteArrays writer = [&given](const std::vector<Array>& arrays) {
        given = arrays;
        return std::vector<DataID>{8, 3};
    };
    const wire::FEvalResult proto =
        FEvalResultSerializer::toProtobuf(FEvalResult(requestID, {small(1), small(2)}), writer);
    EXPECT_EQ(given, (std::vector<Array>{small(1), small(2)}));
    EXPECT_EQ(dataIDs(proto), (std::vector<std::uint64_t>{8, 3}));

    std::vector<std::uint64_t> asked;
    const FEvalResultSerializer::ReadArrays reader = [&asked](const auto& ids) {
        asked.assign(ids.begin(), ids.end());
        return std::vector<Array>{small(4)};
    };
    const auto result = FEvalResultSerializer::fromProtobuf(proto, reader);
    EXPECT_EQ(asked, (std::vector<std::uint64_t>{8, 3}));
    EXPECT_EQ(arraysOf(*result), (std::vector<Array>{small(4)}));
}

using FEvalResultDeathTest = FEvalIIPDeathTest;

void readResult(const wire::FEvalResult& proto) {
    transport::readObject("krutil:FEvalResult", proto.SerializeAsString());
}

TEST_F(FEvalResultDeathTest, ABadStatusInAnExceptionThatIsDroppedAnyway) {
    wire::FEvalResult proto = resultProto({});
    proto.mutable_iipresult()->mutable_exception()->set_status(static_cast<wire::ExecutionStatus>(6));
    EXPECT_FATAL(readResult(proto), fatal::statusIn);
    // Also in a cause, also before the missing identifier is noticed, and also before an array is looked for.
    proto.mutable_iipresult()->clear_id();
    proto.mutable_iipresult()->mutable_exception()->set_status(wire::inRUNTIME_ERROR);
    proto.mutable_iipresult()->mutable_exception()->add_causes()->set_status(static_cast<wire::ExecutionStatus>(-1));
    proto.add_dataids(9);
    EXPECT_FATAL(readResult(proto), fatal::statusIn);
}

void writeResultAloud(FEvalResult::Results&& results) {
    fatal::writeAloud("krutil:FEvalResult", std::unique_ptr<IIPResult>(std::make_unique<FEvalResult>(
                                                requestID, std::move(results), exceptionWith(6))));
}

TEST_F(FEvalResultDeathTest, ABadStatusToWriteBeforeAnyFrameAndBeforeTheFormOfTheOutputs) {
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeResultAloud(std::vector<Array>{small(1)}), fatal::statusOut);
    EXPECT_FATAL_BEFORE_ANY_FRAME(writeResultAloud(FEvalResult::Results()), fatal::statusOut);
}

}  // namespace
