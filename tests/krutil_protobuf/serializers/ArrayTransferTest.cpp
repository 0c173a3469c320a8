// Arrays as frames: which frames an array becomes, that its elements stay where they are, and what a reader does with
// data IDs that lead nowhere.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <limits>
#include <numeric>
#include <stdexcept>
#include <thread>

#include "ArrayFrameTypes.hpp"
#include "QDADataFrameReader.hpp"
#include "QDADataFrameWriter.hpp"
#include "QDASerializer.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/korveldata/protobuf/SerializationContext.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "krutil_protobuf/serializers/AllocationRecorder.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"

namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ArrayFormatError;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;
using foundation::korveldata::protobuf::KORVEL_Array;
using foundation::korveldata::protobuf::outOfLineThreshold;
using foundation::vantor::carrier::framing::BufferAllocator;
using krutil::protobuf_serializer::QDASerializer;
using krutil::protobuf_serializer::detail::elementTypeOfFrames;
using krutil::protobuf_serializer::detail::frameTypeOfElements;
using krutil::protobuf_serializer::detail::QDADataFrameReader;
using krutil::protobuf_serializer::detail::QDADataFrameWriter;
using testing::HasSubstr;
using transport::DataFrame;
using transport::errorText;
using transport::Frame;
using transport::FrameBuffer;
using transport::FrameContent;
using transport::FrameIndex;
using transport::Frames;
using transport::FrameType;
using transport::Message;
using transport::parsed;
using transport::RecordingStream;
using transport::SerializationContext;
using transport::TaggedFrame;
using transport::ThrowingStream;

using Deleter = std::function<void(char*)>;
using Buffer = std::unique_ptr<char[], Deleter>;

Array doubles(std::uint64_t count) {
    std::vector<double> values(count);
    std::iota(values.begin(), values.end(), 0.0);
    return ArrayFactory().createArray(ElementType::Double, {count}, MemoryOrder::RowMajor, values.data());
}

Array bytes(std::uint64_t count) {
    return ArrayFactory().createArray(ElementType::UInt8, {count});
}

// The frames themselves as a received message, as when both peers are in one process.
std::unique_ptr<Message> handOver(Frames&& frames) {
    Frames placed;
    for (auto& frame : frames) {
        const FrameIndex index = frame->index();
        placed.resize(std::max<std::size_t>(placed.size(), index + 1));
        placed[index] = std::move(frame);
    }
    return std::make_unique<Message>(std::move(placed));
}

std::unique_ptr<Message> messageWith(std::unique_ptr<Frame> frame) {
    Frames frames;
    frames.push_back(std::move(frame));
    return handOver(std::move(frames));
}

// Looks at each frame and leaves it with its writer.
class LeavingStream final : public transport::MessageStream {
  public:
    void append(std::unique_ptr<Frame>& frame) override { seen.push_back(frame->index()); }

    std::vector<FrameIndex> seen;
};

// Notes how many owners it has when it gets a frame: a writer of data frames is one of them.
class OwnerCountingStream final : public RecordingStream, public std::enable_shared_from_this<OwnerCountingStream> {
  public:
    void append(std::unique_ptr<Frame>& frame) override {
        owners.push_back(weak_from_this().use_count());
        RecordingStream::append(frame);
    }

    std::vector<long> owners;
};

// ---- Types of data frames -------------------------------------------------------------------------------------------

TEST(ArrayFrameTypesTest, EveryElementCodeHasItsFrameType) {
    const std::array<int, 23> expected{13, 14, 0,  12, 11, 3,  4,  5,  6,  7,  8, 9,
                                       10, 16, 15, 17, 18, 19, 20, 21, 22, 23, 24};
    for (int code = 1; code <= 23; ++code) {
        EXPECT_EQ(static_cast<int>(frameTypeOfElements(code)), expected[static_cast<std::size_t>(code - 1)]) << code;
    }
}

TEST(ArrayFrameTypesTest, ContainersAndUnknownElementCodesHaveFrameType0) {
    for (const int code :
         {0, 3, 24, 25, 256, 257, -1, std::numeric_limits<int>::min(), std::numeric_limits<int>::max()}) {
        EXPECT_EQ(frameTypeOfElements(code), FrameType::Unspecified) << code;
    }
}

TEST(ArrayFrameTypesTest, EveryFrameTypeHasItsElementCodeAndNoneLeadsToContainers) {
    const std::array<int, 25> expected{0, 0, 0,  6,  7,  8,  9,  10, 11, 12, 13, 5, 4,
                                       1, 2, 15, 14, 16, 17, 18, 19, 20, 21, 22, 23};
    for (std::size_t type = 0; type < 256; ++type) {
        const int code = elementTypeOfFrames(static_cast<FrameType>(type));
        EXPECT_EQ(code, type < expected.size() ? expected[type] : 0) << type;
        EXPECT_NE(code, 3) << type;
    }
}

// Ends a test that leaves a buffer behind as a failure.
class BuffersReturnTest : public testing::Test {
  protected:
    void TearDown() override { EXPECT_EQ(BufferAllocator::inUse(), before_); }
    std::size_t before() const { return before_; }

  private:
    std::size_t before_ = BufferAllocator::inUse();
};

// ---- The writer -----------------------------------------------------------------------------------------------------

class QDADataFrameWriterTest : public BuffersReturnTest {};

TEST_F(QDADataFrameWriterTest, MovesTheBufferIntoADataFrame) {
    const auto stream = std::make_shared<RecordingStream>();
    QDADataFrameWriter writer(7, 5, stream);
    EXPECT_EQ(writer.getNextFrameIndex(), 5U);
    FrameBuffer buffer = transport::makeBuffer("elements");
    const char* const address = buffer.first.get();
    EXPECT_EQ(writer.write(std::move(buffer.first), buffer.second, 5), 5U);
    EXPECT_EQ(writer.getNextFrameIndex(), 6U);

    ASSERT_EQ(stream->frames.size(), 1U);
    const auto& frame = dynamic_cast<const DataFrame&>(*stream->frames[0]);
    EXPECT_EQ(transport::contentOf(frame), (FrameContent{false, static_cast<FrameType>(11), 7, 5, "", "elements"}));
    EXPECT_EQ(frame.data(), address);
    EXPECT_TRUE(frame.shareable());
}

TEST_F(QDADataFrameWriterTest, TwoBuffersGetIndexes5And6AndTheNextOneIs7) {
    const auto stream = std::make_shared<RecordingStream>();
    QDADataFrameWriter writer(7, 5, stream);
    EXPECT_EQ(writer.write(std::move(transport::makeBuffer("one").first), 3, 6), 5U);
    EXPECT_EQ(writer.write(std::move(transport::makeBuffer("two").first), 3, 7), 6U);
    EXPECT_EQ(writer.getNextFrameIndex(), 7U);
    EXPECT_EQ(stream->frames.at(0)->index(), 5U);
    EXPECT_EQ(stream->frames.at(1)->index(), 6U);
}

TEST_F(QDADataFrameWriterTest, UnknownElementCodesAreWrittenWithFrameType0) {
    const auto stream = std::make_shared<RecordingStream>();
    QDADataFrameWriter writer(7, 1, stream);
    for (const int code : {0, 3, 24}) {
        writer.write(std::move(transport::makeBuffer("x").first), 1, code);
        EXPECT_EQ(stream->frames.back()->type(), FrameType::Unspecified) << code;
    }
}

TEST_F(QDADataFrameWriterTest, AStreamThatThrowsDoesNotUseUpTheIndex) {
    const auto stream = std::make_shared<ThrowingStream>(1);
    QDADataFrameWriter writer(7, 5, stream);
    const auto write = [&] { return writer.write(std::move(transport::makeBuffer("x").first), 1, 6); };
    EXPECT_EQ(write(), 5U);
    EXPECT_EQ(errorText<std::runtime_error>(write), "stream is full");
    EXPECT_EQ(writer.getNextFrameIndex(), 6U);
    EXPECT_EQ(BufferAllocator::inUse(), before() + 1);
    EXPECT_EQ(write(), 6U);
    EXPECT_EQ(stream->frames.back()->index(), 6U);
}

TEST_F(QDADataFrameWriterTest, AFrameThatTheStreamLeavesUsesUpItsIndexAndReturnsItsBuffer) {
    const auto stream = std::make_shared<LeavingStream>();
    QDADataFrameWriter writer(7, 5, stream);
    EXPECT_EQ(writer.write(std::move(transport::makeBuffer("x").first), 1, 6), 5U);
    EXPECT_EQ(BufferAllocator::inUse(), before());
    EXPECT_EQ(writer.getNextFrameIndex(), 6U);
    EXPECT_EQ(stream->seen, (std::vector<FrameIndex>{5}));
}

TEST_F(QDADataFrameWriterTest, AnyDeleterTravelsWithItsBufferAndRunsOnce) {
    const auto stream = std::make_shared<RecordingStream>();
    QDADataFrameWriter writer(7, 5, stream);
    std::array<char, 4> elements{};
    std::vector<char*> deleted;
    writer.write({elements.data(), [&deleted](char* address) { deleted.push_back(address); }}, 4, 6);
    EXPECT_EQ(stream->frames.at(0)->data(), elements.data());
    EXPECT_TRUE(deleted.empty());
    stream->frames.clear();
    EXPECT_EQ(deleted, (std::vector<char*>{elements.data()}));
}

// ---- The reader -----------------------------------------------------------------------------------------------------

class QDADataFrameReaderTest : public BuffersReturnTest {};

TEST_F(QDADataFrameReaderTest, MovesTheBufferOutOfTheFrameAndUnwrapsItsDeleter) {
    const auto message = transport::makeMessage({{false, static_cast<FrameType>(11), 7, 2, "", "elements"}});
    const char* const address = message->frame(2)->data();
    const auto buffer = QDADataFrameReader(*message).read(2);
    EXPECT_EQ(buffer.get(), address);
    EXPECT_EQ(buffer.get_deleter(), &BufferAllocator::release);
    EXPECT_EQ(BufferAllocator::sizeOf(buffer.get()), 8U);
    EXPECT_EQ(message->frame(2), nullptr);
}

TEST_F(QDADataFrameReaderTest, ABufferThatAWriterOfThisProcessWrappedIsUnwrapped) {
    const auto stream = std::make_shared<RecordingStream>();
    FrameBuffer written = transport::makeBuffer("elements");
    const char* const address = written.first.get();
    QDADataFrameWriter(7, 1, stream).write(std::move(written.first), written.second, 6);
    const auto message = handOver(std::move(stream->frames));
    const auto buffer = QDADataFrameReader(*message).read(1);
    EXPECT_EQ(buffer.get(), address);
    EXPECT_EQ(buffer.get_deleter(), &BufferAllocator::release);
}

TEST_F(QDADataFrameReaderTest, ReadingADataIDTwiceIsBadCast) {
    const auto message = transport::makeMessage({{false, static_cast<FrameType>(6), 7, 1, "", "x"}});
    QDADataFrameReader reader(*message);
    EXPECT_NE(reader.read(1), nullptr);
    EXPECT_THROW(reader.read(1), std::bad_cast);
    EXPECT_THROW(QDADataFrameReader(*message).read(1), std::bad_cast);
}

TEST_F(QDADataFrameReaderTest, ADataIDThatNamesNothingIsBadCastAndTheMessageDoesNotGrow) {
    const auto message = transport::makeMessage({{false, static_cast<FrameType>(6), 7, 1, "", "x"}});
    QDADataFrameReader reader(*message);
    for (const FrameIndex index :
         {FrameIndex{0}, FrameIndex{2}, FrameIndex{1} << 32, FrameIndex{1} << 63, ~FrameIndex{0}}) {
        EXPECT_THROW(reader.read(index), std::bad_cast) << index;
    }
    EXPECT_EQ(message->size(), 2U);
    EXPECT_NE(message->frame(1), nullptr);
}

TEST_F(QDADataFrameReaderTest, ATaggedFrameIsBadCastAndStaysWhateverItsType) {
    for (const int type : {29, 11, 0}) {
        const auto message = transport::makeMessage("krutil:QDA", "x", static_cast<FrameType>(type));
        EXPECT_THROW(QDADataFrameReader(*message).read(1), std::bad_cast) << type;
        EXPECT_NE(message->frame(1), nullptr) << type;
    }
}

TEST_F(QDADataFrameReaderTest, TheTypeOfADataFrameDoesNotMatter) {
    for (const int type : {0, 3, 27, 29, 255}) {
        const auto message = transport::makeMessage({{false, static_cast<FrameType>(type), 7, 1, "", "x"}});
        EXPECT_NE(QDADataFrameReader(*message).read(1), nullptr) << type;
    }
}

TEST_F(QDADataFrameReaderTest, EmptyBuffersWithAPlainFunctionAreAccepted) {
    const auto empty = transport::makeMessage({{false, FrameType::Unspecified, 7, 1, "", ""}});
    const auto buffer = QDADataFrameReader(*empty).read(1);
    EXPECT_NE(buffer, nullptr);
    EXPECT_EQ(BufferAllocator::sizeOf(buffer.get()), 0U);

    const auto none = messageWith(std::make_unique<DataFrame>(
        FrameType::Unspecified, 7, FrameBuffer(Buffer(nullptr, Deleter(&BufferAllocator::release)), 0), true, 1));
    EXPECT_EQ(QDADataFrameReader(*none).read(1), nullptr);
    EXPECT_EQ(none->frame(1), nullptr);
}

const Message* watched = nullptr;

void tellWhereTheFrameIs(int /*signal*/) {
    constexpr std::array<char, 11> gone{'f', 'r', 'a', 'm', 'e', ' ', 'g', 'o', 'n', 'e', '\n'};
    if (watched->frame(1) != nullptr || ::write(STDERR_FILENO, gone.data(), gone.size()) < 0) {
        std::_Exit(1);
    }
}

template <class Action>
void watch(const Message& message, const Action& action) {
    watched = &message;
    std::signal(SIGABRT, tellWhereTheFrameIs);
    action();
}

std::array<char, 4096> foreignElements{};

std::unique_ptr<Frame> foreignFrame(const Deleter& deleter) {
    return std::make_unique<DataFrame>(static_cast<FrameType>(4), 7,
                                       FrameBuffer(Buffer(foreignElements.data(), deleter), foreignElements.size()),
                                       true, 1);
}

void readBufferWith(const Deleter& deleter) {
    const auto message = messageWith(foreignFrame(deleter));
    watch(*message, [&] { QDADataFrameReader(*message).read(1); });
}

void readNothingWith(const Deleter& deleter) {
    const auto message = messageWith(
        std::make_unique<DataFrame>(FrameType::Unspecified, 7, FrameBuffer(Buffer(nullptr, deleter), 0), true, 1));
    watch(*message, [&] { QDADataFrameReader(*message).read(1); });
}

void readArrayWith(const Deleter& deleter) {
    KORVEL_Array proto;
    proto.set_elementtype(7);
    proto.add_dimensions(foreignElements.size());
    proto.set_order(KORVEL_Array::ROW_MAJOR);
    proto.set_dataid(1);
    Frames frames;
    frames.push_back(foreignFrame(deleter));
    frames.push_back(transport::makeFrame({true, FrameType::Object, 7, 2, "krutil:QDA", proto.SerializeAsString()}));
    const auto message = handOver(std::move(frames));
    watch(*message, [&] { QDASerializer({}).deserialize(2, message, nullptr, SerializationContext()); });
}

void noexceptFunction(char* /*buffer*/) noexcept {}

using QDADataFrameReaderDeathTest = QDADataFrameReaderTest;

TEST_F(QDADataFrameReaderDeathTest, ADeleterThatIsNoPlainFunctionEndsTheProcessAfterTheFrameWasTakenOut) {
    testing::FLAGS_gtest_death_test_style = "threadsafe";
    const std::string report =
        "fatal: The deleter of a data frame is not a plain function (QDADataFrameReader:34, "
        "virtual std::unique_ptr<char [], void (*)(char*)> "
        "krutil::protobuf_serializer::detail::QDADataFrameReader::read(unsigned long))\nframe gone\n";
    const auto expected = HasSubstr(report);
    const auto killed = testing::KilledBySignal(SIGABRT);
    EXPECT_EXIT(readBufferWith(std::default_delete<char[]>()), killed, expected);
    EXPECT_EXIT(readBufferWith([](char* /*buffer*/) {}), killed, expected);
    EXPECT_EXIT(readBufferWith(&noexceptFunction), killed, expected);
    EXPECT_EXIT(readBufferWith(&std::free), killed, expected);
    EXPECT_EXIT(readBufferWith(Deleter()), killed, expected);
    EXPECT_EXIT(readArrayWith(Deleter()), killed, expected);
    EXPECT_EXIT(readNothingWith(Deleter()), killed, expected);
}

// ---- The serializer -------------------------------------------------------------------------------------------------

class QDASerializerTest : public BuffersReturnTest {
  protected:
    FrameIndex write(const Array& array, FrameIndex first) const { return writeTo(stream_, array, first); }

    FrameIndex writeTo(const std::shared_ptr<transport::MessageStream>& stream, const Array& array,
                       FrameIndex first) const {
        return serializer_.serialize(array, 7, first, stream, registry_, SerializationContext());
    }

    Array read(const std::unique_ptr<Message>& message, FrameIndex index) const {
        return serializer_.deserialize(index, message, registry_, SerializationContext());
    }

    // Reads a description of 512 doubles in data frame `dataID`, which stands at index 2 behind `elements` at 1.
    Array readWithDataID(FrameIndex dataID, bool tagged = false) const {
        const FrameContent elements{tagged, static_cast<FrameType>(11), 7,
                                    1,      tagged ? "krutil:QDA" : "", std::string(4096, '\0')};
        return read(transport::makeMessage({elements, description(dataID, 2)}), 2);
    }

    static FrameContent description(FrameIndex dataID, FrameIndex index) {
        KORVEL_Array proto;
        proto.set_elementtype(5);
        proto.add_dimensions(512);
        proto.set_order(KORVEL_Array::ROW_MAJOR);
        proto.set_dataid(dataID);
        return {true, FrameType::Object, 7, index, "krutil:QDA", proto.SerializeAsString()};
    }

    Frames& frames() const { return stream_->frames; }

    void TearDown() override {
        frames().clear();
        BuffersReturnTest::TearDown();
    }

  private:
    QDASerializer serializer_{{}};
    std::shared_ptr<const transport::Registry> registry_;
    std::shared_ptr<RecordingStream> stream_ = std::make_shared<RecordingStream>();
};

TEST_F(QDASerializerTest, AnArrayWithoutAnOutOfLineBufferIsOneFrame) {
    for (const Array& array : {Array(), doubles(3), bytes(outOfLineThreshold - 1), ArrayFactory().createScalar(1.5)}) {
        frames().clear();
        EXPECT_EQ(write(array, 5), 6U);
        ASSERT_EQ(frames().size(), 1U);
        const auto& frame = dynamic_cast<const TaggedFrame&>(*frames()[0]);
        EXPECT_EQ(frame.index(), 5U);
        EXPECT_EQ(frame.tag(), "krutil:QDA");
        EXPECT_EQ(frame.type(), FrameType::Object);
        EXPECT_EQ(parsed<KORVEL_Array>(frame).elements_case(), KORVEL_Array::kInlineElements);
        EXPECT_EQ(read(handOver(std::move(frames())), 5), array);
    }
}

TEST_F(QDASerializerTest, AnOutOfLineBufferStandsBeforeTheTaggedFrame) {
    EXPECT_EQ(write(bytes(outOfLineThreshold), 5), 7U);
    ASSERT_EQ(frames().size(), 2U);
    const auto& data = dynamic_cast<const DataFrame&>(*frames()[0]);
    EXPECT_EQ(data.index(), 5U);
    EXPECT_EQ(data.streamID(), 7U);
    EXPECT_EQ(data.size(), outOfLineThreshold);
    EXPECT_EQ(static_cast<int>(data.type()), 4);
    const auto& tagged = dynamic_cast<const TaggedFrame&>(*frames()[1]);
    EXPECT_EQ(tagged.index(), 6U);
    EXPECT_EQ(tagged.streamID(), 7U);
    EXPECT_EQ(parsed<KORVEL_Array>(tagged).dataid(), 5U);
}

TEST_F(QDASerializerTest, ADataFrameOfIndex0IsFoundLikeAnyOther) {
    const Array array = bytes(outOfLineThreshold);
    EXPECT_EQ(write(array, 0), 2U);
    EXPECT_EQ(parsed<KORVEL_Array>(*frames().at(1)).dataid(), 0U);
    EXPECT_EQ(read(handOver(std::move(frames())), 1), array);
}

TEST_F(QDASerializerTest, OutOfLineBuffersOfEveryElementTypeHaveTheirFrameType) {
    for (int code = 1; code <= 23; ++code) {
        if (code == 3) {
            continue;
        }
        frames().clear();
        const Array array = ArrayFactory().createArray(static_cast<ElementType>(code), {outOfLineThreshold});
        EXPECT_EQ(write(array, 1), 3U) << code;
        EXPECT_EQ(frames().at(0)->type(), frameTypeOfElements(code)) << code;
        EXPECT_EQ(read(handOver(std::move(frames())), 2), array) << code;
    }
}

TEST_F(QDASerializerTest, SendingSharesTheElementsWithTheFrame) {
    const Array array = doubles(1000);
    write(array, 1);
    EXPECT_EQ(frames().at(0)->data(), array.data());
}

TEST_F(QDASerializerTest, ReceivedFrameMemoryBecomesTheArraysOwn) {
    const Array array = doubles(1000);
    write(array, 1);
    const auto message = transport::makeMessage(transport::contentOf(frames()));
    const char* const received = message->frame(1)->data();
    EXPECT_NE(received, array.data());
    const Array back = read(message, 2);
    EXPECT_EQ(back.data(), received);
    EXPECT_EQ(back, array);
    EXPECT_TRUE(back.writableInPlace());
    EXPECT_EQ(message->frame(1), nullptr);
    EXPECT_EQ(message->frame(2), nullptr);
}

TEST_F(QDASerializerTest, FramesHandedOverInsideTheProcessReadBackAsTheSameMemory) {
    const Array array = doubles(1000);
    write(array, 1);
    const Array back = read(handOver(std::move(frames())), 2);
    EXPECT_EQ(back.data(), array.data());
    EXPECT_EQ(back, array);
    EXPECT_FALSE(back.writableInPlace());
}

TEST_F(QDASerializerTest, SendingAllocatesOneBufferForTheDescriptionAndNoneForElements) {
    const Array array = doubles(1U << 20);
    const std::size_t inUse = BufferAllocator::inUse();
    AllocationRecorder recorder;
    write(array, 1);
    recorder.stop();
    EXPECT_EQ(recorder.arrays(), 1U);
    EXPECT_EQ(recorder.lastArray(), frames().at(1)->size());
    EXPECT_LT(recorder.largest(), 1024U);
    // The loan of the elements, and nothing beside it.
    EXPECT_EQ(BufferAllocator::inUse(), inUse + 1);
    EXPECT_TRUE(BufferAllocator::isAdopted(array.data()));
}

TEST_F(QDASerializerTest, ReceivingAllocatesNothingForElements) {
    write(doubles(1U << 20), 1);
    const auto message = handOver(std::move(frames()));
    const std::size_t inUse = BufferAllocator::inUse();
    AllocationRecorder recorder;
    const Array back = read(message, 2);
    recorder.stop();
    EXPECT_EQ(recorder.arrays(), 0U);
    EXPECT_LT(recorder.largest(), 1024U);
    EXPECT_EQ(BufferAllocator::inUse(), inUse);
    EXPECT_EQ(back.numberOfElements(), 1U << 20);
}

TEST_F(QDASerializerTest, TheWriterIsGoneBeforeTheTaggedFrameIsWritten) {
    const auto stream = std::make_shared<OwnerCountingStream>();
    writeTo(stream, doubles(1000), 1);
    ASSERT_EQ(stream->owners.size(), 2U);
    EXPECT_EQ(stream->owners[0], stream->owners[1] + 1);
}

TEST_F(QDASerializerTest, AStreamThatRefusesTheDataFrameGetsNothingElse) {
    const auto stream = std::make_shared<ThrowingStream>(0);
    EXPECT_EQ(errorText<std::runtime_error>([&] { writeTo(stream, doubles(1000), 1); }), "stream is full");
    EXPECT_TRUE(stream->frames.empty());
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(QDASerializerTest, AStreamThatRefusesTheTaggedFrameKeepsTheDataFrame) {
    const auto stream = std::make_shared<ThrowingStream>(1);
    EXPECT_EQ(errorText<std::runtime_error>([&] { writeTo(stream, doubles(1000), 1); }), "stream is full");
    EXPECT_EQ(stream->frames.size(), 1U);
}

TEST_F(QDASerializerTest, AStreamThatLeavesItsFramesIsCountedAsOneThatTakesThem) {
    const auto stream = std::make_shared<LeavingStream>();
    EXPECT_EQ(writeTo(stream, doubles(1000), 5), 7U);
    EXPECT_EQ(stream->seen, (std::vector<FrameIndex>{5, 6}));
    EXPECT_EQ(BufferAllocator::inUse(), before());
}

TEST_F(QDASerializerTest, ADataIDThatNamesNoDataFrameIsBadCast) {
    EXPECT_EQ(readWithDataID(1).numberOfElements(), 512U);
    // Itself, index 0, past the end.
    for (const FrameIndex dataID : {FrameIndex{2}, FrameIndex{0}, FrameIndex{3}, FrameIndex{1} << 32, ~FrameIndex{0}}) {
        EXPECT_THROW(readWithDataID(dataID), std::bad_cast) << dataID;
    }
    EXPECT_THROW(readWithDataID(1, true), std::bad_cast);
}

TEST_F(QDASerializerTest, TwoArraysWithOneDataIDReadOnce) {
    const FrameContent elements{false, static_cast<FrameType>(11), 7, 1, "", std::string(4096, '\0')};
    const auto message = transport::makeMessage({elements, description(1, 2), description(1, 3)});
    const Array first = read(message, 2);
    EXPECT_THROW(read(message, 3), std::bad_cast);
    EXPECT_EQ(first.numberOfElements(), 512U);
}

TEST_F(QDASerializerTest, ADataFrameInPlaceOfTheDescriptionIsBadCastAndStays) {
    const auto message = transport::makeMessage({{false, FrameType::Object, 7, 1, "", "x"}});
    EXPECT_THROW(read(message, 1), std::bad_cast);
    EXPECT_NE(message->frame(1), nullptr);
}

TEST_F(QDASerializerTest, FewerOrMoreBytesThanAnnouncedAreRefusedAndReleased) {
    for (const std::size_t size : {std::size_t{8}, std::size_t{4095}, std::size_t{4097}, std::size_t{0}}) {
        const auto message = transport::makeMessage(
            {{false, static_cast<FrameType>(11), 7, 1, "", std::string(size, '\0')}, description(1, 2)});
        EXPECT_EQ(errorText<ArrayFormatError>([&] { read(message, 2); }),
                  "Array: 512 double needs 4096 bytes; the buffer has " + std::to_string(size));
        EXPECT_EQ(BufferAllocator::inUse(), before());
    }
}

TEST_F(QDASerializerTest, TruthValuesThatAreNeither0Nor1AreRefusedInlineAndOutOfLine) {
    KORVEL_Array proto;
    proto.set_elementtype(1);
    proto.add_dimensions(3);
    proto.set_order(KORVEL_Array::ROW_MAJOR);
    const std::string good("\0\1\1", 3);
    const std::string bad("\0\2\1", 3);
    const auto readElements = [&](const std::string& elements, bool inside) {
        if (inside) {
            proto.set_inlineelements(elements);
        } else {
            proto.set_dataid(1);
        }
        return read(transport::makeMessage({{false, static_cast<FrameType>(13), 7, 1, "", elements},
                                            {true, FrameType::Object, 7, 2, "krutil:QDA", proto.SerializeAsString()}}),
                    2);
    };
    for (const bool inside : {true, false}) {
        EXPECT_EQ(readElements(good, inside).sizeInBytes(), 3U);
        EXPECT_EQ(errorText<ArrayFormatError>([&] { readElements(bad, inside); }),
                  "KORVEL_Array: 3 bool with a byte that is neither 0 nor 1");
        EXPECT_EQ(BufferAllocator::inUse(), before());
    }
}

TEST_F(QDASerializerTest, TheSettledFeaturesAreCopiedAndNotConsulted) {
    std::unordered_map<std::string, std::string> features{{"ZEROCOPY", "disable"}, {"other", "value"}};
    const auto expected = features;
    const QDASerializer serializer(features);
    features.clear();
    EXPECT_EQ(serializer.features(), expected);
    EXPECT_EQ(
        serializer.serialize(doubles(1000), 7, 1, std::make_shared<RecordingStream>(), nullptr, SerializationContext()),
        3U);
}

TEST_F(QDASerializerTest, OneObjectServesSeveralThreads) {
    const Array array = doubles(1000);
    std::array<int, 4> equal{};
    std::vector<std::thread> threads;
    for (int& mine : equal) {
        threads.emplace_back([this, &array, &mine] {
            for (int round = 0; round < 50; ++round) {
                const auto stream = std::make_shared<RecordingStream>();
                writeTo(stream, array, 1);
                mine += read(transport::makeMessage(transport::contentOf(stream->frames)), 2) == array ? 1 : 0;
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(equal, (std::array<int, 4>{50, 50, 50, 50}));
}

}  // namespace
