#include "foundation/korveldata/Array.hpp"

#include <array>
#include <cmath>
#include <cstring>
#include <limits>
#include <numeric>
#include <thread>
#include <type_traits>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "platform/korveldata/ArrayTestSupport.hpp"

namespace foundation::korveldata {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using vantor::carrier::framing::BufferAllocator;
using vantor::carrier::framing::FrameBuffer;

class ArrayTest : public ArraysReturnTheirBuffers {};

static_assert(std::is_nothrow_default_constructible_v<Array>);
static_assert(std::is_nothrow_move_constructible_v<Array>);
static_assert(std::is_nothrow_move_assignable_v<Array>);
static_assert(std::is_copy_constructible_v<Array> && std::is_copy_assignable_v<Array>);

TEST_F(ArrayTest, DefaultIsZeroByZeroDoublesWithoutABuffer) {
    const Array array;
    EXPECT_EQ(array.elementType(), ElementType::Double);
    EXPECT_THAT(array.dimensions(), ElementsAre(0, 0));
    EXPECT_EQ(array.order(), MemoryOrder::RowMajor);
    EXPECT_EQ(array.numberOfElements(), 0U);
    EXPECT_EQ(array.sizeInBytes(), 0U);
    EXPECT_NE(array.data(), nullptr);
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
}

TEST_F(ArrayTest, CopiesShareTheirElements) {
    const Array array = numbers({2, 3});
    const Array copy = array;
    Array assigned;
    assigned = array;
    EXPECT_EQ(copy.data(), array.data());
    EXPECT_EQ(assigned.data(), array.data());
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore() + 1);
}

TEST_F(ArrayTest, MovingKeepsTheElementsInPlaceAndLeavesADefaultArray) {
    Array array = numbers({2, 3});
    const char* const address = array.data();
    Array moved = std::move(array);
    EXPECT_EQ(moved.data(), address);
    EXPECT_EQ(array, Array());  // NOLINT(bugprone-use-after-move): the state is promised
    Array assigned = numbers({1});
    assigned = std::move(moved);
    EXPECT_EQ(assigned.data(), address);
    EXPECT_THAT(assigned.dimensions(), ElementsAre(2, 3));
    EXPECT_EQ(moved, Array());  // NOLINT(bugprone-use-after-move): the state is promised
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore() + 1);
}

TEST_F(ArrayTest, AssignmentToItselfChangesNothing) {
    Array array = numbers({2, 3, 4, 5, 6});
    const Array expected = array;
    Array& same = array;
    array = same;
    EXPECT_EQ(array, expected);
    array = std::move(same);
    EXPECT_EQ(array, expected);
    EXPECT_EQ(array.data(), expected.data());
}

TEST_F(ArrayTest, SoleOwnerWritesInPlace) {
    Array array = numbers({2, 3});
    const char* const address = array.data();
    EXPECT_EQ(array.mutableData(), address);
    EXPECT_EQ(array.data(), address);
}

TEST_F(ArrayTest, WritingToSharedElementsCopiesThemOnce) {
    Array array = numbers({2, 3});
    const Array copy = array;
    const char* const address = array.data();
    char* const own = array.mutableData();
    EXPECT_NE(own, address);
    EXPECT_EQ(array.data(), own);
    EXPECT_EQ(copy.data(), address);
    EXPECT_EQ(array, copy);
    setElement(array, 0, 99.0);
    EXPECT_EQ(array.data(), own);
    EXPECT_EQ(element<double>(copy, 0), 0.0);
    EXPECT_EQ(element<double>(array, 0), 99.0);
}

TEST_F(ArrayTest, LastOwnerOfOnceSharedElementsWritesInPlace) {
    Array array = numbers({2, 3});
    const char* const address = array.data();
    { const Array copy = array; }
    EXPECT_EQ(array.mutableData(), address);
}

TEST_F(ArrayTest, OwnersOnDifferentThreadsWriteToElementsOfTheirOwn) {
    const Array original = numbers({1000});
    std::array<Array, 4> copies;
    copies.fill(original);
    std::vector<std::thread> threads;
    for (std::size_t i = 0; i < copies.size(); ++i) {
        threads.emplace_back([&copies, i] {
            Array mine = std::move(copies[i]);
            setElement(mine, 7, static_cast<double>(i));
            copies[i] = std::move(mine);
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(element<double>(original, 7), 7.0);
    for (std::size_t i = 0; i < copies.size(); ++i) {
        EXPECT_EQ(element<double>(copies[i], 7), static_cast<double>(i));
        EXPECT_EQ(element<double>(copies[i], 8), 8.0);
    }
}

// Under the thread sanitizer this fails when the count of owners does not order their accesses.
TEST_F(ArrayTest, SoleOwnerWritesAfterAReaderOnAnotherThreadLetGo) {
    for (int i = 0; i < 200; ++i) {
        Array array = numbers({64});
        double read = 0;
        std::thread reader([copy = array, &read]() mutable {
            read = element<double>(copy, 63);
            copy = Array();
        });
        setElement(array, 63, -1.0);
        reader.join();
        EXPECT_EQ(read, 63.0);
        EXPECT_EQ(element<double>(array, 63), -1.0);
    }
}

TEST_F(ArrayTest, MemoryOfAnotherOwnerIsNotCopiedAndReleasedWithTheLastShare) {
    auto owner = std::make_shared<std::vector<double>>(std::vector<double>{1, 2, 3, 4, 5, 6});
    const std::weak_ptr<void> alive = owner;
    const void* const address = owner->data();
    {
        const Array array = Array::overMemory(ElementType::Double, {2, 3}, MemoryOrder::ColumnMajor, address,
                                              std::exchange(owner, nullptr));
        const Array copy = array;
        EXPECT_EQ(static_cast<const void*>(copy.data()), address);
        EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
        EXPECT_FALSE(alive.expired());
    }
    EXPECT_TRUE(alive.expired());
}

TEST_F(ArrayTest, MemoryOfAnotherOwnerIsNeverWrittenTo) {
    const auto owner = std::make_shared<const std::array<std::int32_t, 2>>(std::array<std::int32_t, 2>{1, 2});
    Array array = Array::overMemory(ElementType::Int32, {2}, MemoryOrder::RowMajor, owner->data(), owner);
    EXPECT_EQ(owner.use_count(), 2);
    setElement(array, 0, std::int32_t{9});
    EXPECT_EQ((*owner)[0], 1);
    EXPECT_EQ(element<std::int32_t>(array, 0), 9);
    EXPECT_EQ(element<std::int32_t>(array, 1), 2);
    EXPECT_EQ(owner.use_count(), 1);
}

TEST_F(ArrayTest, NullAddressIsOnlyForArraysWithoutElements) {
    const Array empty = Array::overMemory(ElementType::Int8, {3, 0}, MemoryOrder::RowMajor, nullptr, nullptr);
    EXPECT_THAT(empty.dimensions(), ElementsAre(3, 0));
    expectFormatError([] { Array::overMemory(ElementType::Int8, {3}, MemoryOrder::RowMajor, nullptr, nullptr); },
                      "Array: 3 int8 over a null address");
}

TEST_F(ArrayTest, LentBufferIsTheArraysOwnMemoryWithAPlainFunctionAsDeleter) {
    const Array array = numbers({2, 3});
    const FrameBuffer lent = array.lendBuffer();
    EXPECT_EQ(lent.first.get(), array.data());
    EXPECT_EQ(lent.second, 48U);
    EXPECT_EQ(BufferAllocator::sizeOf(lent.first.get()), 48U);
    const auto* const function = lent.first.get_deleter().target<void (*)(char*)>();
    ASSERT_NE(function, nullptr);
    EXPECT_EQ(*function, &BufferAllocator::release);
}

TEST_F(ArrayTest, LentBufferOutlivesItsArray) {
    FrameBuffer lent;
    {
        const Array array = numbers({2, 3});
        lent = array.lendBuffer();
    }
    double last = 0;
    std::memcpy(&last, lent.first.get() + 40, sizeof last);
    EXPECT_EQ(last, 5.0);
    EXPECT_GT(BufferAllocator::inUse(), inUseBefore());
    lent.first.reset();
    EXPECT_EQ(BufferAllocator::inUse(), inUseBefore());
}

TEST_F(ArrayTest, LentBufferOfMemoryOfAnotherOwnerHoldsThatOwner) {
    auto owner = std::make_shared<std::vector<double>>(4, 1.5);
    const std::weak_ptr<void> alive = owner;
    FrameBuffer lent =
        Array::overMemory(ElementType::Double, {4}, MemoryOrder::RowMajor, owner->data(), owner).lendBuffer();
    EXPECT_EQ(lent.first.get(), reinterpret_cast<const char*>(owner->data()));
    owner.reset();
    EXPECT_FALSE(alive.expired());
    lent.first.reset();
    EXPECT_TRUE(alive.expired());
}

TEST_F(ArrayTest, WritingWhileElementsAreLentCopies) {
    Array array = numbers({2, 3});
    FrameBuffer lent = array.lendBuffer();
    setElement(array, 0, 99.0);
    double first = -1;
    std::memcpy(&first, lent.first.get(), sizeof first);
    EXPECT_EQ(first, 0.0);
    lent.first.reset();
    const char* const address = array.data();
    EXPECT_EQ(array.mutableData(), address);
}

TEST_F(ArrayTest, SeveralLoansOfOneArrayEndInAnyOrder) {
    const Array array = numbers({2, 3});
    FrameBuffer first = array.lendBuffer();
    FrameBuffer second = array.lendBuffer();
    EXPECT_EQ(first.first.get(), second.first.get());
    first.first.reset();
    EXPECT_EQ(element<double>(array, 5), 5.0);
    second.first.reset();
    EXPECT_EQ(element<double>(array, 5), 5.0);
}

TEST_F(ArrayTest, ArrayWithoutElementsLendsAnEmptyBufferWithTheSameDeleter) {
    const FrameBuffer lent = Array().lendBuffer();
    EXPECT_NE(lent.first.get(), nullptr);
    EXPECT_EQ(lent.second, 0U);
    EXPECT_EQ(BufferAllocator::sizeOf(lent.first.get()), 0U);
    ASSERT_NE(lent.first.get_deleter().target<void (*)(char*)>(), nullptr);
}

TEST_F(ArrayTest, EqualityLooksAtTypeDimensionsAndElements) {
    EXPECT_EQ(numbers({2, 3}), numbers({2, 3}));
    EXPECT_NE(numbers({2, 3}), numbers({3, 2}));
    EXPECT_NE(numbers({6}), numbers({1, 6}));
    Array changed = numbers({2, 3});
    setElement(changed, 5, -1.0);
    EXPECT_NE(numbers({2, 3}), changed);
    const ArrayFactory factory;
    EXPECT_NE(factory.createArray(ElementType::Int64, {2}), factory.createArray(ElementType::UInt64, {2}));
    EXPECT_EQ(factory.createArray(ElementType::Int64, {0, 2}), factory.createArray(ElementType::Int64, {0, 2}));
    EXPECT_NE(factory.createArray(ElementType::Int64, {0, 2}), factory.createArray(ElementType::Int64, {2, 0}));
}

TEST_F(ArrayTest, EqualityDoesNotLookAtTheMemoryOrder) {
    const ArrayFactory factory;
    const std::array<std::int16_t, 6> rows{1, 2, 3, 4, 5, 6};
    const std::array<std::int16_t, 6> columns{1, 4, 2, 5, 3, 6};
    const Array rowMajor = factory.createArray(ElementType::Int16, {2, 3}, MemoryOrder::RowMajor, rows.data());
    const Array columnMajor = factory.createArray(ElementType::Int16, {2, 3}, MemoryOrder::ColumnMajor, columns.data());
    EXPECT_EQ(rowMajor, columnMajor);
    EXPECT_EQ(columnMajor, rowMajor);
    EXPECT_NE(rowMajor, factory.createArray(ElementType::Int16, {2, 3}, MemoryOrder::ColumnMajor, rows.data()));
}

TEST_F(ArrayTest, EqualityAcrossOrdersWalksEveryDimension) {
    const ArrayFactory factory;
    const std::vector<std::uint64_t> dimensions{2, 3, 1, 4};
    Array rowMajor = factory.createArray(ElementType::UInt8, dimensions, MemoryOrder::RowMajor);
    Array columnMajor = factory.createArray(ElementType::UInt8, dimensions, MemoryOrder::ColumnMajor);
    std::uint8_t value = 0;
    for (std::size_t i = 0; i < 2; ++i) {
        for (std::size_t j = 0; j < 3; ++j) {
            for (std::size_t k = 0; k < 4; ++k) {
                setElement(rowMajor, (i * 3 + j) * 4 + k, value);
                setElement(columnMajor, i + 2 * (j + 3 * k), value);
                ++value;
            }
        }
    }
    EXPECT_EQ(rowMajor, columnMajor);
    setElement(columnMajor, 23, std::uint8_t{0});
    EXPECT_NE(rowMajor, columnMajor);
}

TEST_F(ArrayTest, VectorsOfEitherOrderAreEqual) {
    const ArrayFactory factory;
    const std::array<float, 3> values{1, 2, 3};
    EXPECT_EQ(factory.createArray(ElementType::Single, {1, 3, 1}, MemoryOrder::RowMajor, values.data()),
              factory.createArray(ElementType::Single, {1, 3, 1}, MemoryOrder::ColumnMajor, values.data()));
}

TEST_F(ArrayTest, ElementsAreEqualByTheirBytes) {
    const ArrayFactory factory;
    const double nan = std::numeric_limits<double>::quiet_NaN();
    EXPECT_EQ(factory.createScalar(nan), factory.createScalar(nan));
    EXPECT_NE(factory.createScalar(0.0), factory.createScalar(-0.0));
}

TEST_F(ArrayTest, TextKeepsEveryCodeUnit) {
    const std::u16string text{u"a\u00e9\0\U0001F600", 5};
    EXPECT_EQ(ArrayFactory().createText(text).toText(), text);
    expectFormatError([] { (void)Array().toText(); }, "Array: text asked of 0 x 0 double");
}

TEST_F(ArrayTest, SizesAreThoseOfTheElementTypes) {
    const std::array<std::size_t, 25> sizes{0, 1, 2,  0, 4, 8, 1, 1, 2, 2,  4,  4, 8,
                                            8, 8, 16, 2, 2, 4, 4, 8, 8, 16, 16, 0};
    for (std::size_t code = 0; code < sizes.size(); ++code) {
        EXPECT_EQ(elementSize(static_cast<ElementType>(code)), sizes[code]) << code;
    }
    EXPECT_EQ(elementSize(static_cast<ElementType>(-1)), 0U);
    EXPECT_EQ(elementSize(static_cast<ElementType>(std::numeric_limits<int>::min())), 0U);
    EXPECT_EQ(elementTypeName(static_cast<ElementType>(-1)), "unknown");
    EXPECT_EQ(elementTypeName(ElementType::ComplexUInt64), "complex uint64");
}

TEST_F(ArrayTest, SizeInBytesIsCheckedForOverflow) {
    const auto size = [](ElementType type, std::vector<std::uint64_t> dimensions) {
        return checkedSizeInBytes(type, dimensions);
    };
    EXPECT_EQ(size(ElementType::Double, {}), 8U);
    EXPECT_EQ(size(ElementType::Double, {3, 4}), 96U);
    EXPECT_EQ(size(ElementType::Int8, {(1ULL << 63) - 1}), (1ULL << 63) - 1);
    EXPECT_EQ(size(ElementType::Double, {(1ULL << 63) - 1, (1ULL << 63) - 1, 0}), 0U);
    EXPECT_EQ(size(ElementType::Double, {0, (1ULL << 63) - 1, (1ULL << 63) - 1}), 0U);
    expectFormatError([&] { size(ElementType::Int16, {1ULL << 62}); },
                      "Array: 4611686018427387904 int16 is more than 9223372036854775807 bytes");
    // The product of these is 0 in 64 bits, and 8 with one more.
    expectFormatError(
        [&] {
            size(ElementType::Int8, {1ULL << 32, 1ULL << 32});
        },
        "Array: 4294967296 x 4294967296 int8 is more than 9223372036854775807 bytes");
    expectFormatError(
        [&] {
            size(ElementType::Int8, {274177, 67280421310721});
        },
        "Array: 274177 x 67280421310721 int8 is more than 9223372036854775807 bytes");
    expectFormatError(
        [&] {
            size(ElementType::Int8, {0, 1ULL << 63});
        },
        "Array: a dimension of 9223372036854775808; at most 9223372036854775807 is supported");
    expectFormatError([&] { size(ElementType::Container, {1}); },
                      "Array: elements of type container (code 3) are not supported");
    expectFormatError([&] { size(static_cast<ElementType>(-7), {1}); },
                      "Array: elements of type unknown (code -7) are not supported");
    EXPECT_EQ(size(ElementType::Int8, std::vector<std::uint64_t>(32, 1)), 1U);
    expectFormatError([&] { size(ElementType::Int8, std::vector<std::uint64_t>(33, 1)); },
                      "Array: 33 dimensions; at most 32 are supported");
}

}  // namespace
}  // namespace foundation::korveldata
