// Arrays as a person writes them.

#include "krutil/arrays/ArgumentLiteral.hpp"

#include <gtest/gtest.h>

#include <cmath>
#include <complex>
#include <cstring>
#include <limits>
#include <vector>

#include "apps/krutil/arrays/MadeArray.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;
using Complex = std::complex<double>;

struct Good {
    const char* text;
    Array expected;
};

class ArgumentLiteralTest : public ::testing::TestWithParam<Good> {};

TEST_P(ArgumentLiteralTest, IsReadAs) {
    EXPECT_EQ(parseLiteral(GetParam().text), GetParam().expected);
}

constexpr double infinity = std::numeric_limits<double>::infinity();
const bool trueAndFalse[] = {true, false};

INSTANTIATE_TEST_SUITE_P(
    Table, ArgumentLiteralTest,
    ::testing::Values(
        Good{"7", make<std::int64_t>({}, {7})}, Good{"-7", make<std::int64_t>({}, {-7})},
        Good{"+7", make<std::int64_t>({}, {7})}, Good{" 7 ", make<std::int64_t>({}, {7})},
        Good{"007", make<std::int64_t>({}, {7})},
        Good{"9223372036854775807", make<std::int64_t>({}, {std::numeric_limits<std::int64_t>::max()})},
        Good{"-9223372036854775808", make<std::int64_t>({}, {std::numeric_limits<std::int64_t>::min()})},
        Good{"3.5", make<double>({}, {3.5})}, Good{"-3.5e-1", make<double>({}, {-0.35})},
        Good{"1.", make<double>({}, {1.0})}, Good{"-.5", make<double>({}, {-0.5})},
        Good{"1e3", make<double>({}, {1000.0})}, Good{"1E+3", make<double>({}, {1000.0})},
        Good{"-0.0", make<double>({}, {-0.0})}, Good{"inf", make<double>({}, {infinity})},
        Good{"-inf", make<double>({}, {-infinity})}, Good{"2j", make<Complex>({}, {Complex(0, 2)})},
        Good{"1+2j", make<Complex>({}, {Complex(1, 2)})}, Good{"-1.5-2e1J", make<Complex>({}, {Complex(-1.5, -20)})},
        Good{"true", ArrayFactory().createScalar(true)}, Good{"false", ArrayFactory().createScalar(false)},
        Good{"\"text\"", ArrayFactory().createText(u"text")}, Good{"\"\"", ArrayFactory().createText(u"")},
        Good{"\"\xC3\xA4 \\u20ac \\n\\\"\\ud83d\\ude00\"", ArrayFactory().createText(u"ä € \n\"😀")},
        Good{"\"a.npy\"", ArrayFactory().createText(u"a.npy")}, Good{"[1,2,3]", make<std::int64_t>({3}, {1, 2, 3})},
        Good{"[ 1 , -2 ,\n3 ]", make<std::int64_t>({3}, {1, -2, 3})}, Good{"[1, 2.0, 3]", make<double>({3}, {1, 2, 3})},
        Good{"[1, 2.5, 3j]", make<Complex>({3}, {1.0, 2.5, Complex(0, 3)})},
        Good{"[[1,2],[3,4]]", make<std::int64_t>({2, 2}, {1, 2, 3, 4})},
        Good{"[[[1],[2]],[[3],[4]],[[5],[6]]]", make<std::int64_t>({3, 2, 1}, {1, 2, 3, 4, 5, 6})},
        Good{"[true,false]", ArrayFactory().createArray(ElementType::Bool, {2}, MemoryOrder::RowMajor, trueAndFalse)},
        Good{"[]", make<double>({0}, {})}, Good{"[[],[]]", make<double>({2, 0}, {})},
        Good{"[[[]]]", make<double>({1, 1, 0}, {})}));

TEST(ArgumentLiteralNanTest, NanIsADouble) {
    const Array array = parseLiteral("[nan, -nan]");
    EXPECT_EQ(array.elementType(), ElementType::Double);
    std::vector<double> values(2);
    std::memcpy(values.data(), array.data(), array.sizeInBytes());
    EXPECT_TRUE(std::isnan(values[0]) && std::isnan(values[1]));
}

struct Bad {
    const char* text;
    std::size_t offset;
    const char* sentence;
};

class BadArgumentLiteralTest : public ::testing::TestWithParam<Bad> {};

TEST_P(BadArgumentLiteralTest, PointsAtThePlace) {
    try {
        parseLiteral(GetParam().text);
        FAIL() << GetParam().text << " was accepted";
    } catch (const LiteralError& error) {
        EXPECT_STREQ(error.what(), GetParam().sentence);
        EXPECT_EQ(error.offset(), GetParam().offset);
    }
}

constexpr const char* anything =
    "expected a number, true, false, a list in [ ], a text in \" \" (the shell needs quotes around those: '\"text\"') "
    "or a .npy file, got ";

const std::string endOfIt = std::string(anything) + "the end of it";
const std::string gotHello = std::string(anything) + "'hello'";
const std::string gotStar = std::string(anything) + "'*'";
const std::string gotUmlaut = std::string(anything) + "'ä'";
const std::string gotPoint = std::string(anything) + "'.'";

INSTANTIATE_TEST_SUITE_P(
    Table, BadArgumentLiteralTest,
    ::testing::Values(
        Bad{"", 0, endOfIt.c_str()}, Bad{"-", 1, endOfIt.c_str()}, Bad{"hello", 0, gotHello.c_str()},
        Bad{"*", 0, gotStar.c_str()}, Bad{"ä", 0, gotUmlaut.c_str()}, Bad{"..5", 0, gotPoint.c_str()},
        Bad{"'text'", 0, "expected a text in double quotes, got '''"},
        Bad{"7 8", 2, "expected the end of the literal, got '8'"},
        Bad{"infinity", 3, "expected the end of the literal, got 'inity'"},
        Bad{"1,2", 1, "expected the end of the literal, got ','"},
        Bad{"0x10", 1, "expected the end of the literal, got 'x10'"},
        Bad{"1+2", 3, "expected j after the imaginary part, got the end of it"},
        Bad{"9223372036854775808", 0,
            "expected an integer of 64 bits, got '9223372036854775808'; with a point or an exponent it is a double"},
        Bad{"[1, -9223372036854775809]", 4,
            "expected an integer of 64 bits, got '-9223372036854775809'; with a point or an exponent it is a double"},
        Bad{"1e999", 0, "expected a number in the range of a double, got '1e999'"},
        Bad{"[1,2", 4, "expected ',' or ']', got the end of it"}, Bad{"[1 2]", 3, "expected ',' or ']', got '2'"},
        Bad{"[1,]", 3, "expected a number, true, false or a list, got ']'"},
        Bad{"[1,x]", 3, "expected a number, true, false or a list, got 'x'"},
        Bad{"[1,2]]", 5, "expected the end of the literal, got ']'"},
        Bad{"[\"a\"]", 1, "expected a number; lists cannot hold text, got '\"'"},
        Bad{"[[1,2],[3]]", 7, "expected a list of 2 like the ones before it, got 1"},
        Bad{"[[],[1]]", 4, "expected a list of 0 like the ones before it, got 1"},
        Bad{"[1,[2]]", 3, "expected a number like the elements before it, got '['"},
        Bad{"[[1],2]", 5, "expected a list like the elements before it, got '2'"},
        Bad{"[1,true]", 3, "expected a number like the elements before it, got 'true'"},
        Bad{"[true,1]", 6, "expected true or false like the elements before it, got '1'"},
        Bad{"\"text", 5, "expected a text in double quotes, with the escapes of JSON"},
        Bad{"\"a\" 1", 4, "expected a text in double quotes, with the escapes of JSON"},
        Bad{"\"\\x\"", 2, "expected a text in double quotes, with the escapes of JSON"},
        Bad{"\"\\ud800\"", 7, "expected a text in double quotes, with the escapes of JSON"}));

TEST(ArgumentLiteralDepthTest, MoreListsInOneAnotherThanAnArrayHasDimensionsAreRefused) {
    EXPECT_EQ(parseLiteral(std::string(32, '[') + "1" + std::string(32, ']')).dimensions().size(), 32U);
    try {
        parseLiteral(std::string(100'000, '['));
        FAIL();
    } catch (const LiteralError& error) {
        EXPECT_STREQ(error.what(), "expected at most 32 lists in one another");
        EXPECT_EQ(error.offset(), 32U);
    }
}

}  // namespace
}  // namespace krutil_client
