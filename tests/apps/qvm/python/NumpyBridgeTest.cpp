// Arrays between the host and NumPy, against NumPy's own account of them.
#include "qvm/python/NumpyBridge.hpp"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <numeric>
#include <optional>
#include <thread>
#include <tuple>
#include <vector>

#include "apps/qvm/python/EmbeddedPython.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/korveldata/protobuf/SerializationContext.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "support/CountingBytes.hpp"

namespace qvm_test {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;
using foundation::korveldata::protobuf::outOfLineThreshold;
using foundation::vantor::carrier::framing::BufferAllocator;
using qvm::NotConvertible;
using qvm::ReleaseQueue;

// As the transport would have received it: bytes 0, 1, 2, ... in a buffer of the allocator.
Array received(ElementType type, const std::vector<std::uint64_t>& dimensions,
               MemoryOrder order = MemoryOrder::RowMajor) {
    const std::uint64_t bytes = foundation::korveldata::checkedSizeInBytes(type, dimensions);
    std::unique_ptr<char[], void (*)(char*)> buffer(BufferAllocator::allocate(bytes), &BufferAllocator::release);
    test_support::countUp(buffer.get(), bytes, type == ElementType::Bool ? 2 : 120);
    return ArrayFactory().fromBuffer(type, dimensions, order, std::move(buffer));
}

std::string bytesOf(const Array& array) {
    return {array.data(), array.sizeInBytes()};
}

std::vector<std::uint64_t> dimensionsOf(const Array& array) {
    return {array.dimensions().begin(), array.dimensions().end()};
}

template <class Act>
std::string refusalOf(Act act) {
    try {
        act();
    } catch (const NotConvertible& error) {
        return error.what();
    }
    return "";
}

class NumpyBridgeTest : public PythonTest {
  protected:
    void pass(Array array) { names["a"] = qvm::toPython(std::move(array)); }
    Array result(const std::string& expression) { return qvm::toArray(eval(expression), releases); }
    const void* addressOf(const std::string& expression) {
        return reinterpret_cast<const void*>(eval("(" + expression + ").ctypes.data").cast<std::uintptr_t>());
    }

    ReleaseQueue releases;
};

struct Type {
    ElementType element;
    const char* dtype;
};

constexpr Type types[] = {
    {ElementType::Bool, "bool"},
    {ElementType::Single, "float32"},
    {ElementType::Double, "float64"},
    {ElementType::Int8, "int8"},
    {ElementType::UInt8, "uint8"},
    {ElementType::Int16, "int16"},
    {ElementType::UInt16, "uint16"},
    {ElementType::Int32, "int32"},
    {ElementType::UInt32, "uint32"},
    {ElementType::Int64, "int64"},
    {ElementType::UInt64, "uint64"},
    {ElementType::ComplexSingle, "complex64"},
    {ElementType::ComplexDouble, "complex128"},
};

TEST_F(NumpyBridgeTest, ArgumentOfEveryTypeIsANumpyArrayOfTheSameMemory) {
    for (const Type& type : types) {
        SCOPED_TRACE(type.dtype);
        Array array = received(type.element, {2, 3});
        const void* const memory = array.data();
        const std::string bytes = bytesOf(array);
        pass(std::move(array));
        EXPECT_EQ(show("type(a)"), "<class 'numpy.ndarray'>");
        EXPECT_EQ(show("a.dtype"), type.dtype);
        EXPECT_EQ(show("a.shape"), "(2, 3)");
        EXPECT_EQ(addressOf("a"), memory);
        EXPECT_EQ(eval("a.tobytes()").cast<std::string>(), bytes);
        EXPECT_EQ(show("a.flags.c_contiguous, a.flags.aligned, a.flags.writeable, a.flags.owndata, a.ctypes.data % 64"),
                  "(True, True, True, False, 0)");
    }
}

TEST_F(NumpyBridgeTest, ColumnMajorArgumentKeepsItsOrderThroughStrides) {
    Array array = received(ElementType::Int16, {2, 3, 4}, MemoryOrder::ColumnMajor);
    const void* const memory = array.data();
    const std::string bytes = bytesOf(array);
    pass(std::move(array));
    EXPECT_EQ(addressOf("a"), memory);
    EXPECT_EQ(show("a.shape, a.strides, a.flags.f_contiguous"), "((2, 3, 4), (2, 4, 12), True)");
    EXPECT_EQ(eval("a.tobytes(order='F')").cast<std::string>(), bytes);
}

TEST_F(NumpyBridgeTest, FunctionMayWriteToAnArgument) {
    Array array = received(ElementType::Double, {1000});
    const auto* const memory = reinterpret_cast<const double*>(array.data());
    pass(std::move(array));
    run("a[:] = numpy.arange(1000)");
    EXPECT_EQ(memory[0], 0.0);
    EXPECT_EQ(memory[999], 999.0);
}

TEST_F(NumpyBridgeTest, ArgumentWhoseMemoryIsSharedIsReadOnly) {
    const Array mine = received(ElementType::Double, {10});
    pass(mine);
    EXPECT_EQ(addressOf("a"), mine.data());
    EXPECT_EQ(errorOf([&] { run("a[0] = 1"); }), "ValueError: assignment destination is read-only");
    EXPECT_EQ(errorOf([&] { run("a.setflags(write=True)"); }),
              "ValueError: cannot set WRITEABLE flag to True of this array");
}

TEST_F(NumpyBridgeTest, ArgumentInMemoryOfAnotherOwnerIsReadOnly) {
    // Frames that are handed over inside one process.
    const Array mine = received(ElementType::Double, {10});
    auto lent = mine.lendBuffer();
    std::unique_ptr<char[], void (*)(char*)> buffer(lent.first.release(), &BufferAllocator::release);
    pass(ArrayFactory().fromBuffer(ElementType::Double, {10}, MemoryOrder::RowMajor, std::move(buffer)));
    EXPECT_EQ(addressOf("a"), mine.data());
    EXPECT_EQ(show("a.flags.writeable"), "False");
}

TEST_F(NumpyBridgeTest, ScalarIsAnArrayWithoutDimensions) {
    pass(ArrayFactory().createScalar(2.5));
    EXPECT_EQ(show("a.shape, a.ndim, float(a), a.flags.writeable"), "((), 0, 2.5, True)");
}

TEST_F(NumpyBridgeTest, EmptyArgumentsKeepTheirShape) {
    for (const MemoryOrder order : {MemoryOrder::RowMajor, MemoryOrder::ColumnMajor}) {
        pass(received(ElementType::Double, {0}, order));
        EXPECT_EQ(show("a.shape, a.size"), "((0,), 0)");
        pass(received(ElementType::Double, {3, 0, 2}, order));
        EXPECT_EQ(show("a.shape, a.sum()"), "((3, 0, 2), 0.0)");
    }
}

TEST_F(NumpyBridgeTest, EmptyArgumentBeyondWhatNumpyCanDescribeIsItsError) {
    const std::uint64_t large = std::uint64_t{1} << 62;
    EXPECT_EQ(
        errorOf([&] {
            pass(received(ElementType::Double, {large, 0, large}));
        }),
        "ValueError: array is too big; `arr.size * arr.dtype.itemsize` is larger than the maximum possible size.");
}

TEST_F(NumpyBridgeTest, ThirtyTwoDimensionsCross) {
    pass(received(ElementType::Int8, std::vector<std::uint64_t>(32, 1)));
    EXPECT_EQ(show("a.ndim"), "32");
    EXPECT_EQ(dimensionsOf(result("a")), std::vector<std::uint64_t>(32, 1));
}

TEST_F(NumpyBridgeTest, SizesAroundTheThresholdComeBackAsTheyWent) {
    for (const std::size_t bytes : {std::size_t{0}, std::size_t{1}, outOfLineThreshold - 1, outOfLineThreshold,
                                    outOfLineThreshold + 1, std::size_t{64} << 20}) {
        Array array = received(ElementType::UInt8, {bytes});
        const Array expected =
            ArrayFactory().createArray(ElementType::UInt8, {bytes}, MemoryOrder::RowMajor, array.data());
        pass(std::move(array));
        EXPECT_EQ(result("a"), expected) << bytes;
    }
}

TEST_F(NumpyBridgeTest, TextIsAStr) {
    const auto passText = [&](std::u16string_view text) { pass(ArrayFactory().createText(text)); };
    passText(u"Grüße, 世界 \U0001F600");
    EXPECT_EQ(eval("a").cast<std::u16string>(), u"Grüße, 世界 \U0001F600");
    passText(u"");
    EXPECT_EQ(show("repr(a)"), "''");
    passText(std::u16string_view(u"a\0b", 3));
    EXPECT_EQ(show("ascii(a)"), "'a\\x00b'");
    passText(u"\xFEFFx");
    EXPECT_EQ(show("ascii(a)"), "'\\ufeffx'");
    const char16_t unpaired[] = {u'a', 0xD800, u'b', 0xDC00};
    passText({unpaired, 4});
    EXPECT_EQ(show("ascii(a)"), "'a\\ufffdb\\ufffd'");
    const char16_t cut[] = {u'a', 0xD83D};
    passText({cut, 2});
    EXPECT_EQ(show("ascii(a)"), "'a\\ufffd'");
    pass(ArrayFactory().createArray(ElementType::Char16, {3, 1}, MemoryOrder::ColumnMajor, u"abc"));
    EXPECT_EQ(show("a"), "abc");
    pass(ArrayFactory().createArray(ElementType::Char16, {}, MemoryOrder::RowMajor, u"x"));
    EXPECT_EQ(show("a"), "x");
}

TEST_F(NumpyBridgeTest, TextInSeveralRowsIsRefused) {
    EXPECT_EQ(refusalOf([&] {
                  pass(received(ElementType::Char16, {2, 3}));
              }),
              "is text in several rows; only a single row of UTF-16 code units can be passed, as a str");
}

TEST_F(NumpyBridgeTest, ComplexIntegersAreRefused) {
    const std::vector<std::string> parts{"int8", "uint8", "int16", "uint16", "int32", "uint32", "int64", "uint64"};
    for (std::size_t i = 0; i < parts.size(); ++i) {
        const auto element = static_cast<ElementType>(static_cast<int>(ElementType::ComplexInt8) + static_cast<int>(i));
        EXPECT_EQ(refusalOf([&] { pass(received(element, {2})); }),
                  "has elements of type complex " + parts[i] + ", which NumPy does not have");
    }
}

TEST_F(NumpyBridgeTest, ArgumentIsReleasedWithItsLastView) {
    const std::size_t before = BufferAllocator::inUse();
    pass(received(ElementType::Double, {1000}));
    run("part = a[10:20]; del a");
    EXPECT_EQ(BufferAllocator::inUse(), before + 1);
    run("del part");
    EXPECT_EQ(BufferAllocator::inUse(), before);
}

TEST_F(NumpyBridgeTest, RefusedArgumentIsReleased) {
    const std::size_t before = BufferAllocator::inUse();
    EXPECT_NE(refusalOf([&] { pass(received(ElementType::ComplexInt64, {100})); }), "");
    EXPECT_NE(refusalOf([&] { pass(received(ElementType::Char16, {10, 10})); }), "");
    EXPECT_EQ(BufferAllocator::inUse(), before);
}

TEST_F(NumpyBridgeTest, ResultOfEveryTypeIsNumpysOwnMemory) {
    for (const Type& type : types) {
        SCOPED_TRACE(type.dtype);
        run(std::string("r = (numpy.arange(6) % 2).astype('") + type.dtype + "').reshape(2, 3)");
        const Array array = result("r");
        EXPECT_EQ(array.elementType(), type.element);
        EXPECT_EQ(array.order(), MemoryOrder::RowMajor);
        EXPECT_EQ(dimensionsOf(array), (std::vector<std::uint64_t>{2, 3}));
        EXPECT_EQ(array.data(), addressOf("r"));
        EXPECT_EQ(bytesOf(array), eval("r.tobytes()").cast<std::string>());
    }
}

TEST_F(NumpyBridgeTest, IntegerTypesOfTheSameSizeAreOne) {
    EXPECT_EQ(result("numpy.zeros(3, numpy.longlong)").elementType(), ElementType::Int64);
    EXPECT_EQ(result("numpy.zeros(3, numpy.int_)").elementType(), ElementType::Int64);
    EXPECT_EQ(result("numpy.zeros(3, numpy.ulonglong)").elementType(), ElementType::UInt64);
}

TEST_F(NumpyBridgeTest, ContiguousResultsAreNotCopied) {
    const std::vector<std::tuple<std::string, MemoryOrder>> rows{
        {"numpy.arange(12.0).reshape(3, 4)", MemoryOrder::RowMajor},
        {"numpy.asfortranarray(numpy.arange(12.0).reshape(3, 4))", MemoryOrder::ColumnMajor},
        {"numpy.arange(24.0).reshape(2, 3, 4).T", MemoryOrder::ColumnMajor},
        {"numpy.arange(100.0)[10:20]", MemoryOrder::RowMajor},
        {"numpy.arange(12.0).reshape(3, 4)[1:]", MemoryOrder::RowMajor},
        {"numpy.arange(12.0).reshape(1, 12).T", MemoryOrder::RowMajor},
        {"numpy.array(2.5)", MemoryOrder::RowMajor},
        {"numpy.broadcast_to(numpy.float64(1), (1, 1))", MemoryOrder::RowMajor},
        {"numpy.frombuffer(b'12345678', 'u1')", MemoryOrder::RowMajor},
        {"numpy.matrix([[1, 2], [3, 4]])", MemoryOrder::RowMajor},
        {"numpy.recarray(3, dtype=[('x', 'f8')]).x", MemoryOrder::RowMajor},
    };
    for (const auto& [expression, order] : rows) {
        SCOPED_TRACE(expression);
        names["r"] = eval(expression);
        const Array array = result("r");
        EXPECT_EQ(array.order(), order);
        EXPECT_EQ(array.data(), addressOf("r"));
        EXPECT_EQ(dimensionsOf(array).size(), eval("r.ndim").cast<std::size_t>());
        const std::string code = order == MemoryOrder::RowMajor ? "C" : "F";
        EXPECT_EQ(bytesOf(array), eval("r.tobytes(order='" + code + "')").cast<std::string>());
    }
}

TEST_F(NumpyBridgeTest, OtherResultsAreCopiedOnce) {
    for (const std::string expression : {
             "numpy.arange(20)[::2]",
             "numpy.arange(20)[::-1]",
             "numpy.arange(24.0).reshape(2, 3, 4)[:, ::2, :]",
             "numpy.arange(24.0).reshape(2, 3, 4).transpose(1, 0, 2)",
             "numpy.broadcast_to(numpy.arange(3), (4, 3))",
             "numpy.arange(10, dtype='>f8')",
             "numpy.array(7, dtype='>u4')",
             "numpy.arange(3, dtype='>c16')",
             "numpy.frombuffer(b'x' + bytes(range(16)), 'u1')[1:].view('f8')",
             "numpy.ndarray((), '>f8', b'\\x3f\\xf0\\0\\0\\0\\0\\0\\0')",
         }) {
        SCOPED_TRACE(expression);
        names["r"] = eval(expression);
        const Array array = result("r");
        EXPECT_EQ(array.order(), MemoryOrder::RowMajor);
        EXPECT_NE(array.data(), addressOf("r"));
        EXPECT_EQ(bytesOf(array), eval("r.astype(r.dtype.newbyteorder('=')).tobytes()").cast<std::string>());
        EXPECT_EQ(dimensionsOf(array).size(), eval("r.ndim").cast<std::size_t>());
    }
}

TEST_F(NumpyBridgeTest, CopyKeepsTheOrderOfContiguousMemory) {
    const Array array = result("numpy.arange(12, dtype='>i2').reshape(3, 4).T");
    EXPECT_EQ(array.order(), MemoryOrder::ColumnMajor);
    EXPECT_EQ(dimensionsOf(array), (std::vector<std::uint64_t>{4, 3}));
    EXPECT_EQ(bytesOf(array), eval("numpy.arange(12, dtype='<i2').tobytes()").cast<std::string>());
}

TEST_F(NumpyBridgeTest, EmptyResultsKeepTheirShape) {
    EXPECT_EQ(dimensionsOf(result("numpy.zeros((3, 0, 2))")), (std::vector<std::uint64_t>{3, 0, 2}));
    EXPECT_EQ(dimensionsOf(result("numpy.zeros((0, 4))[::2]")), (std::vector<std::uint64_t>{0, 4}));
    EXPECT_EQ(dimensionsOf(result("[]")), (std::vector<std::uint64_t>{0}));
}

TEST_F(NumpyBridgeTest, BoolsAreZeroOrOne) {
    names["r"] = eval("numpy.array([0, 1, 2, 255], 'u1').view(bool)");
    EXPECT_EQ(bytesOf(result("r")), std::string("\0\1\1\1", 4));
    EXPECT_EQ(eval("r.tobytes()").cast<std::string>(), std::string("\0\1\2\xFF", 4));
    EXPECT_EQ(result("numpy.bool_(True)"), ArrayFactory().createScalar(true));
}

TEST_F(NumpyBridgeTest, NumbersAndTextsAreArrays) {
    const ArrayFactory factory;
    EXPECT_EQ(result("True"), factory.createScalar(true));
    EXPECT_EQ(result("False"), factory.createScalar(false));
    EXPECT_EQ(result("-3"), factory.createScalar(std::int64_t{-3}));
    EXPECT_EQ(result("2**64 - 1"), factory.createScalar(~std::uint64_t{0}));
    EXPECT_EQ(result("2.5"), factory.createScalar(2.5));
    EXPECT_EQ(result("1+2j"), factory.createScalar(std::complex<double>(1, 2)));
    EXPECT_EQ(result("numpy.float32(1.5)"), factory.createScalar(1.5F));
    EXPECT_EQ(result("numpy.float64(1.5)"), factory.createScalar(1.5));
    EXPECT_EQ(result("[1, 2.5]"),
              factory.createArray(ElementType::Double, {2}, MemoryOrder::RowMajor, std::vector<double>{1, 2.5}.data()));
    EXPECT_EQ(dimensionsOf(result("[[1, 2, 3], (4, 5, 6)]")), (std::vector<std::uint64_t>{2, 3}));
    EXPECT_EQ(result("range(2)"), factory.createArray(ElementType::Int64, {2}, MemoryOrder::RowMajor,
                                                      std::vector<std::int64_t>{0, 1}.data()));
    EXPECT_EQ(result("bytearray(b'ab')"), factory.createArray(ElementType::UInt8, {2}, MemoryOrder::RowMajor, "ab"));
    EXPECT_EQ(result("'a\\0b\\U0001F600'"), factory.createText(std::u16string_view(u"a\0b\U0001F600", 5)));
    EXPECT_EQ(result("''"), factory.createText(u""));
    EXPECT_EQ(result("'\\ud800'"), factory.createText(u"\xFFFD"));
    EXPECT_EQ(result("numpy.str_('text')"), factory.createText(u"text"));
    EXPECT_EQ(result("numpy.array('text')"), factory.createText(u"text"));
}

TEST_F(NumpyBridgeTest, WhatHasNoCounterpartIsRefusedWithItsDtype) {
    const std::string supported =
        ", which cannot be sent; what can is bool, 8- to 64-bit integers, float32, float64, complex64, complex128, and "
        "text as a single str";
    const std::vector<std::pair<std::string, std::string>> rows{
        {"numpy.zeros(3, 'f2')", "float16" + supported + "; convert it first, for example with astype('float32')"},
        {"numpy.zeros(3, numpy.longdouble)",
         "float128" + supported + "; convert it first, for example with astype('float64')"},
        {"numpy.zeros(3, numpy.clongdouble)",
         "complex256" + supported + "; convert it first, for example with astype('complex128')"},
        {"numpy.zeros(3, 'M8[s]')", "datetime64[s]" + supported},
        {"numpy.zeros(3, 'm8[ms]')", "timedelta64[ms]" + supported},
        {"numpy.array(['ab', 'cde'])", "<U3" + supported},
        {"['ab', 'cde']", "<U3" + supported},
        {"b'bytes'", "|S5" + supported},
        {"numpy.zeros(2, [('x', 'f8')])", "[('x', '<f8')]" + supported},
        {"object()", "object" + supported},
        {"{'a': 1}", "object" + supported},
        {"[None, 1]", "object" + supported},
        {"[2**70]", "object" + supported},
    };
    for (const auto& [expression, expected] : rows) {
        EXPECT_EQ(refusalOf([&, &each = expression] { result(each); }), "has dtype " + expected) << expression;
    }
    EXPECT_EQ(refusalOf([&] { result("2**64"); }), "is an int that does not fit into 64 bits");
    EXPECT_EQ(refusalOf([&] { result("-2**63 - 1"); }), "is an int that does not fit into 64 bits");
    EXPECT_EQ(refusalOf([&] { result("None"); }), "is None, which is no array");
    for (const std::string masked : {"numpy.ma.array([1, 2], mask=[0, 1])", "numpy.ma.masked"}) {
        EXPECT_EQ(refusalOf([&] { result(masked); }),
                  "is a masked array, whose mask would be lost; return its filled(...) or its data and mask");
    }
}

TEST_F(NumpyBridgeTest, RaggedListIsNumpysError) {
    EXPECT_EQ(errorOf([&] { result("[[1, 2], [3]]"); }).substr(0, 55),
              "ValueError: setting an array element with a sequence. T");
}

TEST_F(NumpyBridgeTest, ResultLivesWhileItsBufferIsOnItsWay) {
    run("import weakref\nr = numpy.full(1000, 7.0); watch = weakref.ref(r)");
    Array array = result("r");
    run("del r");
    auto frame = array.lendBuffer();
    EXPECT_EQ(frame.first.get(), array.data());
    array = Array();
    releases.drain();
    EXPECT_EQ(show("watch() is None"), "False");
    EXPECT_EQ(reinterpret_cast<const double*>(frame.first.get())[999], 7.0);
    // The last byte was written by another thread, while this one runs code.
    std::thread([&frame] { frame.first.reset(); }).join();
    EXPECT_EQ(show("watch() is None"), "False");
    releases.drain();
    EXPECT_EQ(show("watch() is None"), "True");
}

TEST_F(NumpyBridgeTest, ArgumentThatIsReturnedIsSentFromItsOwnMemory) {
    const std::size_t before = BufferAllocator::inUse();
    Array array = received(ElementType::Double, {1000});
    const void* const memory = array.data();
    pass(std::move(array));
    {
        const Array whole = result("a");
        const Array again = result("a");
        const Array part = result("a[:500]");
        run("del a");
        EXPECT_EQ(whole.data(), memory);
        EXPECT_EQ(again.data(), memory);
        EXPECT_EQ(part.data(), memory);
        auto first = whole.lendBuffer();
        auto second = again.lendBuffer();
        auto third = part.lendBuffer();
        EXPECT_EQ(third.second, 4000U);
        // Frames go in any order, and what is left stays readable.
        first.first.reset();
        releases.drain();
        EXPECT_EQ(std::memcmp(second.first.get(), third.first.get(), 4000), 0);
    }
    releases.drain();
    EXPECT_EQ(BufferAllocator::inUse(), before);
}

TEST_F(NumpyBridgeTest, ReadOnlyResultsAreFine) {
    run("r = numpy.arange(5); r.setflags(write=False)");
    EXPECT_EQ(result("r").data(), addressOf("r"));
}

}  // namespace
}  // namespace qvm_test
