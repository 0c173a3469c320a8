// What the tests of the array library share.
#pragma once

#include <cstring>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "foundation/korveldata/Array.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::korveldata {

/// Fails a test that leaves a buffer of the allocator in use.
class ArraysReturnTheirBuffers : public ::testing::Test {
  protected:
    void TearDown() override { EXPECT_EQ(vantor::carrier::framing::BufferAllocator::inUse(), inUseBefore_); }
    std::size_t inUseBefore() const { return inUseBefore_; }

  private:
    std::size_t inUseBefore_ = vantor::carrier::framing::BufferAllocator::inUse();
};

/// Element at position `i` in memory.
template <typename T>
T element(const Array& array, std::size_t i) {
    T value;
    std::memcpy(&value, array.data() + i * sizeof(T), sizeof(T));
    return value;
}

template <typename T>
void setElement(Array& array, std::size_t i, const T& value) {
    std::memcpy(array.mutableData() + i * sizeof(T), &value, sizeof(T));
}

/// Doubles 0, 1, 2, ... in memory order.
inline Array numbers(const std::vector<std::uint64_t>& dimensions, MemoryOrder order = MemoryOrder::RowMajor) {
    Array array = ArrayFactory().createArray(ElementType::Double, dimensions, order);
    for (std::size_t i = 0; i < array.numberOfElements(); ++i) {
        setElement(array, i, static_cast<double>(i));
    }
    return array;
}

template <typename Action>
void expectFormatError(const Action& action, const std::string& text) {
    try {
        action();
        ADD_FAILURE() << "no exception; expected: " << text;
    } catch (const ArrayFormatError& error) {
        EXPECT_EQ(error.what(), text);
    }
}

}  // namespace foundation::korveldata
