// Arrays for a person to read.

#include "krutil/arrays/ArrayText.hpp"

#include <gtest/gtest.h>

#include <complex>
#include <cstdint>
#include <limits>
#include <numeric>
#include <vector>

#include "apps/krutil/arrays/MadeArray.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

Array counted(const std::vector<std::uint64_t>& dimensions, MemoryOrder order = MemoryOrder::RowMajor) {
    std::vector<std::int32_t> elements(
        std::accumulate(dimensions.begin(), dimensions.end(), std::uint64_t{1}, std::multiplies<>()));
    std::iota(elements.begin(), elements.end(), 0);
    return make(dimensions, elements, order);
}

TEST(ArrayTextTest, AScalarIsOneLine) {
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::int64_t{42})), "int64: 42\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(true)), "bool: true\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::uint8_t{200})), "uint8: 200\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::int8_t{-3})), "int8: -3\n");
}

TEST(ArrayTextTest, AScalarHasAllItsDigits) {
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(0.1 + 0.2)), "double: 0.30000000000000004\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(0.1F)), "single: 0.1\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(1e300)), "double: 1e+300\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(-std::numeric_limits<double>::infinity())), "double: -inf\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(-std::numeric_limits<double>::quiet_NaN())), "double: nan\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::numeric_limits<std::uint64_t>::max())),
              "uint64: 18446744073709551615\n");
}

TEST(ArrayTextTest, ComplexNumbers) {
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::complex<double>(1, 2.5))), "complex double: 1+2.5j\n");
    EXPECT_EQ(arrayText(ArrayFactory().createScalar(std::complex<float>(-1, -0.0F))), "complex single: -1-0j\n");
    const std::int16_t parts[] = {1, -2, 3, 4};
    EXPECT_EQ(arrayText(ArrayFactory().createArray(ElementType::ComplexInt16, {2}, MemoryOrder::RowMajor, parts)),
              "complex int16, 2 elements:\n[1-2j, 3+4j]\n");
}

TEST(ArrayTextTest, TextIsShownAsText) {
    EXPECT_EQ(arrayText(ArrayFactory().createText(u"hello € 😀")), "text of 10 characters: hello € 😀\n");
    EXPECT_EQ(arrayText(ArrayFactory().createText(u"a")), "text of 1 character: a\n");
    EXPECT_EQ(arrayText(ArrayFactory().createText(u"")), "text of 0 characters: \n");
    EXPECT_EQ(arrayText(ArrayFactory().createText(u"one\ntwo")), "text of 7 characters:\none\ntwo\n");
    EXPECT_EQ(arrayText(make<char16_t>({3}, {u'a', u'b', u'c'})), "text of 3 characters: abc\n");
    EXPECT_EQ(arrayText(make<char16_t>({}, {u'a'})), "text of 1 character: a\n");
}

TEST(ArrayTextTest, TextOfSeveralRowsIsShownByCharacter) {
    EXPECT_EQ(arrayText(make<char16_t>({2, 2}, {u'a', u'€', u'\'', u'\n'})), R"(UTF-16 code unit, 2 x 2:
[[ 'a',  '€'],
 ['\'', '\n']]
)");
}

TEST(ArrayTextTest, ColumnsAreAligned) {
    EXPECT_EQ(arrayText(make<double>({2, 3}, {1, 2, 3, 4, 5.5, -6e-7})), R"(double, 2 x 3:
[[     1,      2,      3],
 [     4,    5.5, -6e-07]]
)");
}

TEST(ArrayTextTest, ArraysShowEightDigits) {
    EXPECT_EQ(arrayText(make<double>({2}, {0.1 + 0.2, 1.0 / 3})), "double, 2 elements:\n[       0.3, 0.33333333]\n");
}

TEST(ArrayTextTest, BothMemoryOrdersShowTheSameIndexes) {
    EXPECT_EQ(arrayText(make<std::int32_t>({2, 3}, {1, 2, 3, 4, 5, 6})), "int32, 2 x 3:\n[[1, 2, 3],\n [4, 5, 6]]\n");
    EXPECT_EQ(arrayText(make<std::int32_t>({2, 3}, {1, 4, 2, 5, 3, 6}, MemoryOrder::ColumnMajor)),
              "int32, 2 x 3:\n[[1, 2, 3],\n [4, 5, 6]]\n");
}

TEST(ArrayTextTest, BlocksOfHigherDimensionsAreApart) {
    EXPECT_EQ(arrayText(counted({2, 2, 2})), R"(int32, 2 x 2 x 2:
[[[0, 1],
  [2, 3]],

 [[4, 5],
  [6, 7]]]
)");
}

TEST(ArrayTextTest, AnEmptyArrayHasNoValues) {
    EXPECT_EQ(arrayText(Array()), "double, 0 x 0:\n[]\n");
    EXPECT_EQ(arrayText(ArrayFactory().createArray(ElementType::Bool, {0})), "bool, 0 elements:\n[]\n");
    EXPECT_EQ(arrayText(make<float>({std::uint64_t{1} << 62U, 0}, {})), "single, 4611686018427387904 x 0:\n[]\n");
}

TEST(ArrayTextTest, LongRowsAreWrapped) {
    EXPECT_EQ(arrayText(counted({30})),
              "int32, 30 elements:\n"
              "[ 0,  1,  2,  3,  4,  5,  6,  7,  8,  9, 10, 11, 12, 13, 14, 15, 16, 17, 18, 19,\n"
              " 20, 21, 22, 23, 24, 25, 26, 27, 28, 29]\n");
}

TEST(ArrayTextTest, ALargeArrayIsSummarised) {
    EXPECT_EQ(arrayText(counted({1001})), "int32, 1001 elements:\n[   0,    1,    2, ...,  998,  999, 1000]\n");
    EXPECT_EQ(arrayText(counted({1000, 4})), R"(int32, 1000 x 4:
[[   0,    1,    2,    3],
 [   4,    5,    6,    7],
 [   8,    9,   10,   11],
 ...,
 [3988, 3989, 3990, 3991],
 [3992, 3993, 3994, 3995],
 [3996, 3997, 3998, 3999]]
)");
    EXPECT_EQ(arrayText(counted({100, 100}, MemoryOrder::ColumnMajor)), R"(int32, 100 x 100:
[[   0,  100,  200, ..., 9700, 9800, 9900],
 [   1,  101,  201, ..., 9701, 9801, 9901],
 [   2,  102,  202, ..., 9702, 9802, 9902],
 ...,
 [  97,  197,  297, ..., 9797, 9897, 9997],
 [  98,  198,  298, ..., 9798, 9898, 9998],
 [  99,  199,  299, ..., 9799, 9899, 9999]]
)");
}

TEST(ArrayTextTest, AnArrayOfManyDimensionsStaysShort) {
    const Array many = counted(std::vector<std::uint64_t>(20, 2));
    EXPECT_EQ(arrayText(many), arrayHeading(many) + ":\n[...]\n");
    EXPECT_LT(arrayText(counted(std::vector<std::uint64_t>(6, 5))).size(), 2000U);
}

}  // namespace
}  // namespace krutil_client
