#include "foundation/korveldata/protobuf/SerializationContext.hpp"

#include <cstring>
#include <map>
#include <stdexcept>
#include <typeinfo>
#include <utility>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "platform/korveldata/ArrayTestSupport.hpp"

namespace foundation::korveldata::protobuf {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using vantor::carrier::framing::BufferAllocator;

/// Keeps what is written, as a message stream would, and hands it out again, as a received message would.
class Frames : public DataFrameWriter, public DataFrameReader {
  public:
    struct Frame {
        std::unique_ptr<char[], std::function<void(char*)>> buffer;
        unsigned long size;
        int elementType;
    };

    unsigned long write(std::unique_ptr<char[], std::function<void(char*)>>&& buffer, unsigned long size,
                        int elementType) override {
        if (failing) {
            throw std::runtime_error("the stream is closed");
        }
        frames.emplace(next, Frame{std::move(buffer), size, elementType});
        return next++;
    }

    std::unique_ptr<char[], void (*)(char*)> read(unsigned long dataID) override {
        auto node = frames.extract(dataID);
        if (node.empty()) {
            throw std::bad_cast();
        }
        auto& buffer = node.mapped().buffer;
        const auto* const function = buffer.get_deleter().target<void (*)(char*)>();
        if (function == nullptr) {
            throw std::logic_error("not a plain function");
        }
        return {buffer.release(), *function};
    }

    /// A frame as the transport receives it: exactly `size` bytes, all of them `fill`.
    unsigned long receive(std::size_t size, int fill = 0) {
        auto [buffer, bytes] = BufferAllocator::makeFrameBuffer(size);
        std::memset(buffer.get(), fill, size);
        return write(std::move(buffer), bytes, 0);
    }

    std::map<unsigned long, Frame> frames;
    unsigned long next = 5;
    bool failing = false;
};

class SerializationContextTest : public ArraysReturnTheirBuffers {
  protected:
    void TearDown() override {
        frames.reset();
        ArraysReturnTheirBuffers::TearDown();
    }

    std::unique_ptr<KORVEL_Array> send(const Array& array) {
        return SerializationContext(factory, true, false, frames, nullptr).convertToProtobuf(array);
    }

    std::unique_ptr<KORVEL_Array> sendInline(const Array& array) {
        return SerializationContext(factory, true, false, nullptr, nullptr).convertToProtobuf(array);
    }

    Array receive(std::unique_ptr<KORVEL_Array> message) {
        return SerializationContext(factory, true, false, nullptr, frames).convertFromProtobuf(std::move(message));
    }

    Array receive(const KORVEL_Array& message) { return receive(std::make_unique<KORVEL_Array>(message)); }

    /// 3 x 2 unsigned bytes, inline.
    static KORVEL_Array inlineMessage() {
        KORVEL_Array message;
        message.set_elementtype(7);
        message.add_dimensions(3);
        message.add_dimensions(2);
        message.set_order(KORVEL_Array::COLUMN_MAJOR);
        message.set_inlineelements("abcdef");
        return message;
    }

    /// The same in data frame `dataID`.
    static KORVEL_Array framedMessage(unsigned long dataID) {
        KORVEL_Array message = inlineMessage();
        message.set_dataid(dataID);
        return message;
    }

    static Array bytes(std::size_t count) { return ArrayFactory().createArray(ElementType::UInt8, {count}); }

    ArrayFactory factory;
    std::shared_ptr<Frames> frames = std::make_shared<Frames>();
};

TEST_F(SerializationContextTest, KeepsWhatItIsGivenAndStartsWithEmptyTables) {
    const long before = frames.use_count();
    {
        const SerializationContext context(factory, true, false, frames, frames);
        EXPECT_EQ(&context.factory(), &factory);
        EXPECT_TRUE(context.checkContent());
        EXPECT_FALSE(context.everyBufferOutOfLine());
        EXPECT_EQ(context.writer(), frames);
        EXPECT_EQ(context.reader(), frames);
        EXPECT_EQ(frames.use_count(), before + 2);
        EXPECT_THAT(context.replacedNames(), IsEmpty());
        EXPECT_TRUE(context.classIds().empty());
        EXPECT_THAT(context.classes(), IsEmpty());
        EXPECT_THAT(context.objectIds(), IsEmpty());
    }
    EXPECT_EQ(frames.use_count(), before);
    const SerializationContext other(factory, false, true, nullptr, nullptr);
    EXPECT_FALSE(other.checkContent());
    EXPECT_TRUE(other.everyBufferOutOfLine());
    EXPECT_EQ(other.writer(), nullptr);
    EXPECT_EQ(other.reader(), nullptr);
}

TEST_F(SerializationContextTest, CanBeDestroyedThroughItsBase) {
    const std::weak_ptr<Frames> alive = frames;
    std::unique_ptr<SerializationContextBase> context =
        std::make_unique<SerializationContext>(factory, true, false, std::exchange(frames, nullptr), nullptr);
    EXPECT_FALSE(alive.expired());
    context.reset();
    EXPECT_TRUE(alive.expired());
}

/// Position of a virtual member in its class's table. A pointer to one holds its offset in bytes, plus 1.
template <typename Member>
std::size_t slotOf(Member member) {
    std::size_t offset = 0;
    static_assert(sizeof member >= sizeof offset);
    std::memcpy(&offset, &member, sizeof offset);
    return (offset - 1) / sizeof(void*);
}

TEST(SlotOrderTest, WriteAndReadComeBeforeTheDestructors) {
    EXPECT_EQ(slotOf(&DataFrameWriter::write), 0U);
    EXPECT_EQ(slotOf(&DataFrameReader::read), 0U);
}

TEST_F(SerializationContextTest, CreatedMessageIsEmpty) {
    EXPECT_EQ(createKORVEL_Array()->ByteSizeLong(), 0U);
    EXPECT_EQ(KORVEL_Array::descriptor()->full_name(), "foundation.korveldata.protobuf.KORVEL_Array");
}

TEST_F(SerializationContextTest, SmallArrayTravelsInsideItsMessage) {
    const Array array = factory.createArray(ElementType::UInt8, {3, 2}, MemoryOrder::ColumnMajor, "abcdef");
    EXPECT_EQ(send(array)->SerializeAsString(), inlineMessage().SerializeAsString());
    EXPECT_EQ(send(array)->SerializeAsString(), std::string("\x08\x07\x12\x02\x03\x02\x18\x02\x22\x06"
                                                            "abcdef"));
    EXPECT_THAT(frames->frames, IsEmpty());
}

TEST_F(SerializationContextTest, LargeArrayIsReferredToByItsDataID) {
    const Array array = numbers({1000, 1000});
    const auto message = send(array);
    EXPECT_EQ(message->elements_case(), KORVEL_Array::kDataID);
    EXPECT_EQ(message->dataid(), 5U);
    EXPECT_EQ(message->SerializeAsString(), std::string("\x08\x05\x12\x04\xE8\x07\xE8\x07\x18\x01\x28\x05", 12));
    ASSERT_THAT(frames->frames, SizeIs(1));
    EXPECT_EQ(frames->frames.at(5).size, 8'000'000U);
    EXPECT_EQ(frames->frames.at(5).elementType, 5);
    EXPECT_EQ(send(array)->dataid(), 6U);
}

TEST_F(SerializationContextTest, SizeDecidesWhetherElementsGoOutOfLine) {
    for (const auto& [size, outOfLine] : {std::pair<std::size_t, bool>(0, false),
                                          {1, false},
                                          {outOfLineThreshold - 1, false},
                                          {outOfLineThreshold, true},
                                          {outOfLineThreshold + 1, true}}) {
        frames->frames.clear();
        const Array array = bytes(size);
        auto message = send(array);
        EXPECT_EQ(message->elements_case(), outOfLine ? KORVEL_Array::kDataID : KORVEL_Array::kInlineElements) << size;
        EXPECT_THAT(frames->frames, SizeIs(outOfLine ? 1 : 0)) << size;
        EXPECT_EQ(receive(std::move(message)), array) << size;
        auto whole = sendInline(array);
        EXPECT_EQ(whole->inlineelements().size(), size);
        EXPECT_EQ(receive(std::move(whole)), array) << size;
    }
}

TEST_F(SerializationContextTest, EveryBufferWithBytesGoesOutOfLineWhenAskedTo) {
    SerializationContext context(factory, true, true, frames, nullptr);
    EXPECT_EQ(context.convertToProtobuf(bytes(1))->dataid(), 5U);
    EXPECT_TRUE(context.convertToProtobuf(bytes(0))->has_inlineelements());
    SerializationContext whole(factory, true, true, nullptr, nullptr);
    EXPECT_TRUE(whole.convertToProtobuf(bytes(1))->has_inlineelements());
}

TEST_F(SerializationContextTest, WriterGetsTheArraysOwnMemory) {
    const Array array = bytes(outOfLineThreshold);
    const std::size_t inUse = BufferAllocator::inUse();
    send(array);
    const Frames::Frame& frame = frames->frames.at(5);
    EXPECT_EQ(frame.buffer.get(), array.data());
    // The loan is known to the allocator; no buffer was allocated for it.
    EXPECT_EQ(BufferAllocator::inUse(), inUse + 1);
    EXPECT_TRUE(BufferAllocator::isAdopted(frame.buffer.get()));
    const auto* const function = frame.buffer.get_deleter().target<void (*)(char*)>();
    ASSERT_NE(function, nullptr);
    EXPECT_EQ(*function, &BufferAllocator::release);
}

TEST_F(SerializationContextTest, ReaderGivesTheArrayItsMemory) {
    const unsigned long dataID = frames->receive(6, 'x');
    char* const address = frames->frames.at(dataID).buffer.get();
    const std::size_t inUse = BufferAllocator::inUse();
    Array array = receive(framedMessage(dataID));
    EXPECT_EQ(array.data(), address);
    EXPECT_EQ(BufferAllocator::inUse(), inUse);
    EXPECT_THAT(array.dimensions(), ElementsAre(3, 2));
    EXPECT_EQ(array.order(), MemoryOrder::ColumnMajor);
    EXPECT_EQ(array.elementType(), ElementType::UInt8);
    // Nobody else has it, so it may be written to where it is.
    EXPECT_EQ(array.mutableData(), address);
    const Array copy = array;
    EXPECT_NE(array.mutableData(), address);
}

TEST_F(SerializationContextTest, InlineElementsAreCopiedOnceIntoAlignedMemory) {
    const std::size_t inUse = BufferAllocator::inUse();
    Array array = receive(inlineMessage());
    EXPECT_EQ(std::string(array.data(), 6), "abcdef");
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(array.data()) % 64, 0U);
    EXPECT_EQ(BufferAllocator::inUse(), inUse + 1);
    const char* const address = array.data();
    EXPECT_EQ(array.mutableData(), address);
}

TEST_F(SerializationContextTest, ArrayHandedOverInsideOneProcessStaysAsItWas) {
    const Array sent = numbers({1000}, MemoryOrder::ColumnMajor);
    Array received = receive(send(sent));
    EXPECT_EQ(received, sent);
    EXPECT_EQ(received.data(), sent.data());
    setElement(received, 0, -1.0);
    EXPECT_EQ(element<double>(sent, 0), 0.0);
    EXPECT_EQ(element<double>(received, 0), -1.0);
}

TEST_F(SerializationContextTest, ArrayHandedOverOutlivesItsSender) {
    Array received;
    {
        const Array sent = numbers({1000});
        received = receive(send(sent));
    }
    EXPECT_EQ(received, numbers({1000}));
    EXPECT_EQ(receive(send(received)), received);
}

TEST_F(SerializationContextTest, WritingAfterSendingDoesNotReachTheFrame) {
    Array array = numbers({1000});
    auto message = send(array);
    setElement(array, 0, 99.0);
    EXPECT_EQ(receive(std::move(message)), numbers({1000}));
}

TEST_F(SerializationContextTest, EveryTypeAndOrderComesBackInlineAndInFrames) {
    for (int code = 1; code <= 23; ++code) {
        const auto type = static_cast<ElementType>(code);
        if (type == ElementType::Container) {
            continue;
        }
        for (const MemoryOrder order : {MemoryOrder::RowMajor, MemoryOrder::ColumnMajor}) {
            for (const std::vector<std::uint64_t>& dimensions :
                 {std::vector<std::uint64_t>{}, {0}, {5}, {3, 4}, {2, 3, 4}, {64, 128}, {7, 0, 9}}) {
                Array array = factory.createArray(type, dimensions, order);
                for (std::size_t i = 0; i < array.sizeInBytes(); ++i) {
                    setElement(array, i, static_cast<char>(type == ElementType::Bool ? i % 2 : i * 37));
                }
                const Array framed = receive(send(array));
                EXPECT_EQ(framed, array) << code;
                EXPECT_EQ(framed.order(), order);
                const Array whole = receive(sendInline(array));
                EXPECT_EQ(whole, array) << code;
                EXPECT_EQ(whole.order(), order);
            }
        }
    }
}

TEST_F(SerializationContextTest, FailureOfTheWriterPassesThroughAndReturnsTheLoan) {
    Array array = bytes(outOfLineThreshold);
    const char* const address = array.data();
    frames->failing = true;
    try {
        send(array);
        ADD_FAILURE();
    } catch (const std::runtime_error& error) {
        EXPECT_STREQ(error.what(), "the stream is closed");
    }
    EXPECT_EQ(array.mutableData(), address);
}

TEST_F(SerializationContextTest, ElementsThatNoMessageCanHoldAreRefusedBeforeTheyAreCopied) {
    // Only the address matters: none of these bytes is looked at.
    static const char byte = 0;
    const Array array =
        Array::overMemory(ElementType::Int8, {1ULL << 31}, MemoryOrder::RowMajor, &byte, std::shared_ptr<const void>());
    try {
        sendInline(array);
        ADD_FAILURE();
    } catch (const std::length_error& error) {
        EXPECT_STREQ(error.what(), "Unsupported Protobuf buffer size.");
    }
    send(array);
    EXPECT_EQ(frames->frames.at(5).size, 1ULL << 31);
}

// A session's limit for the message of an array is 64 MiB unless it is told otherwise.
TEST_F(SerializationContextTest, DescriptionOfALongRowTakes15Bytes) {
    constexpr std::uint64_t size = 64ULL << 20;
    const Array array = factory.createArray(ElementType::Int8, {size - 15});
    EXPECT_EQ(sendInline(array)->ByteSizeLong(), size);
}

TEST_F(SerializationContextTest, DataIDWithoutAReaderIsRefused) {
    SerializationContext context(factory, true, false, nullptr, nullptr);
    expectFormatError([&] { context.convertFromProtobuf(std::make_unique<KORVEL_Array>(framedMessage(5))); },
                      "KORVEL_Array: the elements are in data frame 5, but data frames are off (zero copy is disabled "
                      "in this process)");
}

TEST_F(SerializationContextTest, FrameThatIsMissingOrReadBeforeIsTheReadersError) {
    EXPECT_THROW(receive(framedMessage(5)), std::bad_cast);
    const unsigned long dataID = frames->receive(6);
    receive(framedMessage(dataID));
    EXPECT_THROW(receive(framedMessage(dataID)), std::bad_cast);
}

TEST_F(SerializationContextTest, FrameOneByteShortOrLongIsRefusedAndReleased) {
    for (const std::size_t size : {0U, 5U, 7U}) {
        const unsigned long dataID = frames->receive(size);
        expectFormatError([&] { receive(framedMessage(dataID)); },
                          "Array: 3 x 2 uint8 needs 6 bytes; the buffer has " + std::to_string(size));
        EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    }
}

TEST_F(SerializationContextTest, MillionDoublesInAFrameOfEightBytesAreRefused) {
    KORVEL_Array message = framedMessage(frames->receive(8));
    message.set_elementtype(5);
    message.set_dimensions(0, 1000);
    message.set_dimensions(1, 1000);
    expectFormatError([&] { receive(message); }, "Array: 1000 x 1000 double needs 8000000 bytes; the buffer has 8");
}

TEST_F(SerializationContextTest, BufferThatTheAllocatorDoesNotKnowIsRefused) {
    static void (*const release)(char*) = [](char* buffer) { delete[] buffer; };
    frames->write({new char[6], release}, 6, 7);
    expectFormatError(
        [&] { receive(framedMessage(5)); },
        "Array: 3 x 2 uint8 in a buffer that is not the BufferAllocator's, so that its length is not known");
    frames->write({nullptr, release}, 6, 7);
    expectFormatError(
        [&] { receive(framedMessage(6)); },
        "Array: 3 x 2 uint8 in a buffer that is not the BufferAllocator's, so that its length is not known");
}

TEST_F(SerializationContextTest, InlineBytesOneShortOrLongAreRefused) {
    for (const std::size_t size : {0U, 5U, 7U}) {
        KORVEL_Array message = inlineMessage();
        message.set_inlineelements(std::string(size, 'x'));
        expectFormatError([&] { receive(message); },
                          "KORVEL_Array: 3 x 2 uint8 needs 6 bytes; the message has " + std::to_string(size));
    }
}

TEST_F(SerializationContextTest, HostileDimensionsAreRefusedWithoutReadingTheFrame) {
    const auto refuse = [&](const std::vector<std::uint64_t>& dimensions, const std::string& text) {
        KORVEL_Array message = framedMessage(frames->receive(0));
        message.clear_dimensions();
        message.mutable_dimensions()->Add(dimensions.begin(), dimensions.end());
        expectFormatError([&] { receive(message); }, text);
        EXPECT_THAT(frames->frames, SizeIs(1));
        frames->frames.clear();
        message.set_inlineelements("");
        expectFormatError([&] { receive(message); }, text);
    };
    const std::uint64_t half = 1ULL << 32;
    refuse({half, half}, "Array: 4294967296 x 4294967296 uint8 is more than 9223372036854775807 bytes");
    refuse({half, half, half, half},
           "Array: 4294967296 x 4294967296 x 4294967296 x 4294967296 uint8 is more than "
           "9223372036854775807 bytes");
    refuse({static_cast<std::uint64_t>(-1)},
           "Array: a dimension of 18446744073709551615; at most 9223372036854775807 is supported");
    refuse({0, static_cast<std::uint64_t>(-1)},
           "Array: a dimension of 18446744073709551615; at most 9223372036854775807 is supported");
    refuse(std::vector<std::uint64_t>(33, 1), "Array: 33 dimensions; at most 32 are supported");
    refuse(std::vector<std::uint64_t>(1'000'000, 0), "Array: 1000000 dimensions; at most 32 are supported");
}

TEST_F(SerializationContextTest, AbsurdClaimsTakeNoMemory) {
    KORVEL_Array message = inlineMessage();
    message.set_dimensions(0, (1ULL << 62) / 2);
    expectFormatError([&] { receive(message); },
                      "KORVEL_Array: 2305843009213693952 x 2 uint8 needs 4611686018427387904 bytes; the message has 6");
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
}

TEST_F(SerializationContextTest, ZeroDimensionMakesAnEmptyArrayWhateverTheOthersSay) {
    KORVEL_Array message = inlineMessage();
    message.set_dimensions(0, 0);
    message.set_dimensions(1, (1ULL << 63) - 1);
    message.add_dimensions((1ULL << 63) - 1);
    message.set_inlineelements("");
    EXPECT_EQ(receive(message).sizeInBytes(), 0U);
    message.set_dataid(frames->receive(0));
    EXPECT_EQ(receive(message).numberOfElements(), 0U);
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    message.set_inlineelements("x");
    EXPECT_THROW(receive(message), ArrayFormatError);
}

TEST_F(SerializationContextTest, UnknownElementTypesAreRefused) {
    for (const auto& [code, name] : {std::pair<int, std::string>(0, "unknown"),
                                     {3, "container"},
                                     {24, "unknown"},
                                     {-1, "unknown"},
                                     {INT32_MIN, "unknown"},
                                     {INT32_MAX, "unknown"}}) {
        KORVEL_Array message = inlineMessage();
        message.set_elementtype(code);
        expectFormatError([&] { receive(message); },
                          "Array: elements of type " + name + " (code " + std::to_string(code) + ") are not supported");
    }
}

TEST_F(SerializationContextTest, UnknownMemoryOrdersAreRefused) {
    for (const int order : {0, 3, -1}) {
        KORVEL_Array message = inlineMessage();
        message.set_order(static_cast<KORVEL_Array::MemoryOrder>(order));
        expectFormatError([&] { receive(message); }, "KORVEL_Array: memory order " + std::to_string(order) +
                                                         "; expected 1 (row-major) or 2 (column-major)");
    }
}

TEST_F(SerializationContextTest, MessageWithoutElementsIsRefused) {
    KORVEL_Array message = inlineMessage();
    message.clear_elements();
    expectFormatError([&] { receive(message); },
                      "KORVEL_Array: 3 x 2 uint8 without elements: neither bytes nor a data ID");
    expectFormatError([&] { receive(createKORVEL_Array()); },
                      "Array: elements of type unknown (code 0) are not supported");
    EXPECT_THROW(receive(std::unique_ptr<KORVEL_Array>()), std::invalid_argument);
}

// What a failed parse leaves behind is the parser's affair; whatever it is, it makes no array that lacks bytes.
TEST_F(SerializationContextTest, TruncatedMessageIsRefusedOrMakesACompleteArray) {
    const std::string whole = inlineMessage().SerializeAsString();
    std::size_t refused = 0;
    for (std::size_t length = 0; length < whole.size(); ++length) {
        auto message = createKORVEL_Array();
        EXPECT_FALSE(message->ParseFromArray(whole.data(), static_cast<int>(length)) && message->has_inlineelements());
        try {
            const Array array = receive(std::move(message));
            EXPECT_EQ(BufferAllocator::sizeOf(array.data()).value_or(0), array.sizeInBytes()) << length;
        } catch (const ArrayFormatError&) {
            ++refused;
        }
    }
    EXPECT_GT(refused, 0U);
}

TEST_F(SerializationContextTest, BytesThatAreNoBoolAreRefusedWhenContentIsChecked) {
    KORVEL_Array message = inlineMessage();
    message.set_elementtype(1);
    message.set_inlineelements(std::string("\0\0\0\0\0\2", 6));
    expectFormatError([&] { receive(message); }, "KORVEL_Array: 3 x 2 bool with a byte that is neither 0 nor 1");
    message.set_dataid(frames->receive(6, 0xFF));
    expectFormatError([&] { receive(message); }, "KORVEL_Array: 3 x 2 bool with a byte that is neither 0 nor 1");
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    SerializationContext trusting(factory, false, false, nullptr, frames);
    message.set_dataid(frames->receive(6, 0xFF));
    EXPECT_EQ(trusting.convertFromProtobuf(std::make_unique<KORVEL_Array>(message)).sizeInBytes(), 6U);
}

TEST_F(SerializationContextTest, CodeUnitsAreNotLookedAt) {
    const std::u16string loneSurrogates(outOfLineThreshold, u'\xD800');
    EXPECT_EQ(receive(send(factory.createText(loneSurrogates))).toText(), loneSurrogates);
}

TEST_F(SerializationContextTest, LaterFieldsOfAnUnknownSenderAreIgnored) {
    KORVEL_Array message;
    ASSERT_TRUE(message.ParseFromString(inlineMessage().SerializeAsString() + "\x98\x06\x01"));
    EXPECT_EQ(std::string(receive(message).data(), 6), "abcdef");
}

}  // namespace
}  // namespace foundation::korveldata::protobuf
