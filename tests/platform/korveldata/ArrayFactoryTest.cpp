#include "foundation/korveldata/ArrayFactory.hpp"

#include <complex>
#include <cstdint>
#include <new>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "platform/korveldata/ArrayTestSupport.hpp"

namespace foundation::korveldata {
namespace {

using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using vantor::carrier::framing::BufferAllocator;

using Buffer = std::unique_ptr<char[], void (*)(char*)>;

Buffer bufferOf(std::size_t size) {
    return Buffer(BufferAllocator::allocate(size), &BufferAllocator::release);
}

bool aligned(const Array& array) {
    return reinterpret_cast<std::uintptr_t>(array.data()) % 64 == 0;
}

class ArrayFactoryTest : public ArraysReturnTheirBuffers {
  protected:
    ArrayFactory factory;
};

TEST_F(ArrayFactoryTest, NewArraysOfEveryTypeAreZeroAndAligned) {
    // Dirt to be found again by an allocator that recycles.
    for (int i = 0; i < 8; ++i) {
        const Buffer dirty = bufferOf(16 * 7);
        std::memset(dirty.get(), 0xA5, 16 * 7);
    }
    for (int code = 1; code <= 23; ++code) {
        const auto type = static_cast<ElementType>(code);
        if (type == ElementType::Container) {
            continue;
        }
        const Array array = factory.createArray(type, {7}, MemoryOrder::ColumnMajor);
        EXPECT_EQ(array.elementType(), type);
        EXPECT_EQ(array.order(), MemoryOrder::ColumnMajor);
        EXPECT_EQ(array.sizeInBytes(), 7 * elementSize(type));
        EXPECT_TRUE(aligned(array)) << code;
        EXPECT_THAT(std::string(array.data(), array.sizeInBytes()), Each('\0')) << code;
    }
}

TEST_F(ArrayFactoryTest, GivenElementsAreCopied) {
    std::vector<std::uint32_t> values{1, 2, 3, 0xFFFFFFFF};
    const Array array = factory.createArray(ElementType::UInt32, {2, 2}, MemoryOrder::RowMajor, values.data());
    values[3] = 0;
    EXPECT_EQ(element<std::uint32_t>(array, 3), 0xFFFFFFFF);
    EXPECT_TRUE(aligned(array));
    expectFormatError(
        [&] {
            factory.createArray(ElementType::UInt32, {2, 2}, MemoryOrder::RowMajor, nullptr);
        },
        "Array: 2 x 2 uint32 from a null address");
}

TEST_F(ArrayFactoryTest, ScalarsHaveNoDimensionsAndOneElement) {
    const auto check = [&](auto value, ElementType type) {
        const Array array = factory.createScalar(value);
        EXPECT_EQ(array.elementType(), type);
        EXPECT_THAT(array.dimensions(), IsEmpty());
        EXPECT_EQ(array.numberOfElements(), 1U);
        EXPECT_EQ(array.sizeInBytes(), sizeof value);
        EXPECT_EQ(element<decltype(value)>(array, 0), value);
    };
    check(true, ElementType::Bool);
    check(u'\uFFFF', ElementType::Char16);
    check(1.5F, ElementType::Single);
    check(-1.5, ElementType::Double);
    check(std::int8_t{-128}, ElementType::Int8);
    check(std::uint8_t{255}, ElementType::UInt8);
    check(std::int16_t{-2}, ElementType::Int16);
    check(std::uint16_t{3}, ElementType::UInt16);
    check(std::int32_t{-4}, ElementType::Int32);
    check(std::uint32_t{5}, ElementType::UInt32);
    check(std::int64_t{INT64_MIN}, ElementType::Int64);
    check(std::uint64_t{UINT64_MAX}, ElementType::UInt64);
    check(std::complex<float>(1, 2), ElementType::ComplexSingle);
    check(std::complex<double>(3, 4), ElementType::ComplexDouble);
}

TEST_F(ArrayFactoryTest, TextIsARowOfCodeUnits) {
    const Array text = factory.createText(u"abc");
    EXPECT_EQ(text.elementType(), ElementType::Char16);
    EXPECT_THAT(text.dimensions(), ElementsAre(1, 3));
    EXPECT_EQ(text.toText(), u"abc");
    EXPECT_THAT(factory.createText({}).dimensions(), ElementsAre(1, 0));
    EXPECT_EQ(factory.createText({}).toText(), u"");
}

TEST_F(ArrayFactoryTest, ArraysWithoutElementsTakeNoMemory) {
    const Array array = factory.createArray(ElementType::Double, {0, (1ULL << 63) - 1});
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    EXPECT_EQ(array.sizeInBytes(), 0U);
    EXPECT_THAT(array.dimensions(), ElementsAre(0, (1ULL << 63) - 1));
}

TEST_F(ArrayFactoryTest, MoreThanTheAddressSpaceIsBadAlloc) {
    EXPECT_THROW(factory.createArray(ElementType::Int8, {(1ULL << 63) - 1}), std::bad_alloc);
    expectFormatError([&] { factory.createArray(ElementType::Container, {1}); },
                      "Array: elements of type container (code 3) are not supported");
}

TEST_F(ArrayFactoryTest, BufferBecomesTheElementsInPlaceAndIsWritable) {
    Buffer buffer = bufferOf(12);
    char* const address = buffer.get();
    std::memset(address, 1, 12);
    Array array = factory.fromBuffer(ElementType::Int32, {3}, MemoryOrder::ColumnMajor, std::move(buffer));
    EXPECT_EQ(array.data(), address);
    EXPECT_EQ(array.order(), MemoryOrder::ColumnMajor);
    EXPECT_EQ(element<std::int32_t>(array, 2), 0x01010101);
    EXPECT_EQ(array.mutableData(), address);
    const Array copy = array;
    EXPECT_NE(array.mutableData(), address);
    EXPECT_EQ(copy.data(), address);
}

TEST_F(ArrayFactoryTest, BufferIsReleasedByItsOwnDeleter) {
    static int released = 0;
    released = 0;
    Buffer buffer(BufferAllocator::allocate(8), [](char* address) {
        ++released;
        BufferAllocator::release(address);
    });
    {
        const Array array = factory.fromBuffer(ElementType::Double, {}, MemoryOrder::RowMajor, std::move(buffer));
        EXPECT_EQ(released, 0);
    }
    EXPECT_EQ(released, 1);
}

TEST_F(ArrayFactoryTest, BufferOfAnotherSizeIsRefusedAndReleased) {
    for (const std::size_t size : {0U, 1U, 7999999U, 8000001U}) {
        expectFormatError(
            [&] {
                factory.fromBuffer(ElementType::Double, {1000, 1000}, MemoryOrder::RowMajor, bufferOf(size));
            },
            "Array: 1000 x 1000 double needs 8000000 bytes; the buffer has " + std::to_string(size));
        EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    }
}

TEST_F(ArrayFactoryTest, BufferUnknownToTheAllocatorIsRefused) {
    const std::string text =
        "Array: 1 int8 in a buffer that is not the BufferAllocator's, so that its length is not known";
    expectFormatError(
        [&] {
            factory.fromBuffer(ElementType::Int8, {1}, MemoryOrder::RowMajor,
                               Buffer(new char[1], [](char* address) { delete[] address; }));
        },
        text);
    expectFormatError(
        [&] {
            factory.fromBuffer(ElementType::Int8, {1}, MemoryOrder::RowMajor,
                               Buffer(nullptr, &BufferAllocator::release));
        },
        text);
    const Buffer known = bufferOf(64);
    expectFormatError(
        [&] {
            factory.fromBuffer(ElementType::Int8, {1}, MemoryOrder::RowMajor, Buffer(known.get() + 1, [](char*) {}));
        },
        text);
}

TEST_F(ArrayFactoryTest, EmptyBufferMakesAnArrayWithoutElements) {
    const Array array = factory.fromBuffer(ElementType::Double, {5, 0}, MemoryOrder::RowMajor, bufferOf(0));
    EXPECT_THAT(array.dimensions(), ElementsAre(5, 0));
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
    expectFormatError(
        [&] {
            factory.fromBuffer(ElementType::Double, {5, 0}, MemoryOrder::RowMajor, bufferOf(8));
        },
        "Array: 5 x 0 double needs 0 bytes; the buffer has 8");
}

TEST_F(ArrayFactoryTest, LentBufferIsReadInPlaceAndNotWrittenTo) {
    const Array original = numbers({4});
    auto lent = original.lendBuffer();
    Array received = factory.fromBuffer(ElementType::Double, {4}, MemoryOrder::RowMajor,
                                        Buffer(lent.first.release(), &BufferAllocator::release));
    EXPECT_EQ(received.data(), original.data());
    EXPECT_TRUE(BufferAllocator::isAdopted(received.data()));
    setElement(received, 0, 99.0);
    EXPECT_NE(received.data(), original.data());
    EXPECT_EQ(element<double>(original, 0), 0.0);
    EXPECT_EQ(element<double>(received, 0), 99.0);
    EXPECT_FALSE(BufferAllocator::isAdopted(original.data()));
}

TEST_F(ArrayFactoryTest, BufferLentOnAndOnIsReleasedOnce) {
    Array last = numbers({4});
    const char* const address = last.data();
    for (int i = 0; i < 5; ++i) {
        auto lent = last.lendBuffer();
        last = factory.fromBuffer(ElementType::Double, {4}, MemoryOrder::RowMajor,
                                  Buffer(lent.first.release(), &BufferAllocator::release));
    }
    EXPECT_EQ(last.data(), address);
    EXPECT_EQ(last, numbers({4}));
}

}  // namespace
}  // namespace foundation::korveldata
