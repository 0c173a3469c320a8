// .npy files, exchanged with NumPy.

#include "krutil/arrays/NpyFile.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <complex>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <vector>

#include "apps/krutil/arrays/MadeArray.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/base/ExitCode.hpp"
#include "support/TemporaryDirectory.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;
using ::testing::HasSubstr;

class NpyFileTest : public ::testing::Test {
  protected:
    std::string file(const std::string& name) const { return directory_.file(name); }

    std::string write(const std::string& name, const std::string& bytes) const {
        std::ofstream(file(name), std::ios::binary) << bytes;
        return file(name);
    }

    static std::string read(const std::string& path) {
        std::ostringstream bytes;
        bytes << std::ifstream(path, std::ios::binary).rdbuf();
        return bytes.str();
    }

    // Runs a program of NumPy in the test's directory, with `np` imported.
    void numpy(const std::string& program) const {
        write("program.py", "import os, sys\nimport numpy as np\nos.chdir(os.path.dirname(sys.argv[0]))\n" + program);
        const std::string command = "/usr/bin/python3 " + file("program.py");
        ASSERT_EQ(std::system(command.c_str()), 0) << program;
    }

    // The sentence that the reading of a file with these bytes fails with, without the file's name.
    std::string refusal(const std::string& bytes) const {
        const std::string path = write("bad.npy", bytes);
        try {
            readNpy(path);
        } catch (const Failure& failure) {
            EXPECT_EQ(failure.code(), ExitCode::Usage);
            const std::string begin = "cannot read '" + path + "': ";
            EXPECT_EQ(std::string(failure.what()).substr(0, begin.size()), begin);
            return std::string(failure.what()).substr(begin.size());
        }
        return "accepted";
    }

    static void store(const std::string& path, const Array& array) { NpyOutput(path).write(array); }

    std::size_t filesInDirectory() const {
        return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator(directory_.path()), {}));
    }

    const test_support::TemporaryDirectory directory_;
};

// A file of format 1.0 with this header text and content.
std::string npy(const std::string& header, const std::string& content = {}, char major = '\1', char minor = '\0') {
    std::string bytes("\x93NUMPY", 6);
    bytes += {major, minor, static_cast<char>(header.size() & 0xFFU), static_cast<char>(header.size() >> 8U)};
    if (major != '\1') {
        bytes += std::string(2, '\0');
    }
    return bytes + header + content;
}

std::string headerOf(const std::string& descr, const std::string& shape) {
    return "{'descr': '" + descr + "', 'fortran_order': False, 'shape': " + shape + ", }\n";
}

const std::vector<std::pair<const char*, ElementType>> types{{"bool", ElementType::Bool},
                                                             {"int8", ElementType::Int8},
                                                             {"uint8", ElementType::UInt8},
                                                             {"int16", ElementType::Int16},
                                                             {"uint16", ElementType::UInt16},
                                                             {"int32", ElementType::Int32},
                                                             {"uint32", ElementType::UInt32},
                                                             {"int64", ElementType::Int64},
                                                             {"uint64", ElementType::UInt64},
                                                             {"float32", ElementType::Single},
                                                             {"float64", ElementType::Double},
                                                             {"complex64", ElementType::ComplexSingle},
                                                             {"complex128", ElementType::ComplexDouble}};

// The array that a test's file of this type holds: 2 x 3, the numbers 1 to 6 (0 and 1 in turn as bool), and twice as
// much as the imaginary part, with the sign changed.
Array numbers(ElementType type, MemoryOrder order) {
    Array array = ArrayFactory().createArray(type, {2, 3}, order);
    char* bytes = array.mutableData();
    const std::size_t size = elementSize(type);
    for (std::size_t i = 0; i < 6; ++i) {
        const std::size_t place = order == MemoryOrder::RowMajor ? i : i / 3 + i % 3 * 2;
        const auto number = static_cast<double>(type == ElementType::Bool ? (i + 1) % 2 : i + 1);
        const auto put = [&](auto value) { std::memcpy(bytes + place * size, &value, size); };
        switch (type) {
            case ElementType::Single:
                put(static_cast<float>(number));
                break;
            case ElementType::Double:
                put(number);
                break;
            case ElementType::ComplexSingle:
                put(std::complex<float>(static_cast<float>(number), static_cast<float>(-2 * number)));
                break;
            case ElementType::ComplexDouble:
                put(std::complex<double>(number, -2 * number));
                break;
            default:
                put(static_cast<std::uint64_t>(number));
        }
    }
    return array;
}

constexpr const char* makeNumbers = R"(
def numbers(dtype):
    n = np.arange(1, 7).reshape(2, 3)
    if dtype == 'bool': n = n % 2
    return (n - 2j * n if dtype.startswith('complex') else n).astype(dtype)
types = 'bool int8 uint8 int16 uint16 int32 uint32 int64 uint64 float32 float64 complex64 complex128'.split()
)";

TEST_F(NpyFileTest, AllTypesAndOrdersOfNumPyAreReadWithoutACopy) {
    numpy(std::string(makeNumbers) + R"(
for t in types:
    np.save(t + '-C.npy', numbers(t))
    np.save(t + '-F.npy', np.asfortranarray(numbers(t)))
)");
    for (const auto& [name, type] : types) {
        for (const auto order : {MemoryOrder::RowMajor, MemoryOrder::ColumnMajor}) {
            const Array array = readNpy(file(name + std::string(order == MemoryOrder::RowMajor ? "-C.npy" : "-F.npy")));
            EXPECT_EQ(array, numbers(type, order)) << name;
            EXPECT_EQ(array.order(), order) << name;
            // NumPy aligns elements to 64 bytes of the file, and mappings begin with a page.
            EXPECT_EQ(reinterpret_cast<std::uintptr_t>(array.data()) % 64, 0U) << name;
            EXPECT_FALSE(array.writableInPlace()) << name;
        }
    }
}

TEST_F(NpyFileTest, NumPyReadsAllTypesAndOrders) {
    for (const auto& [name, type] : types) {
        store(file(name + std::string("-C.npy")), numbers(type, MemoryOrder::RowMajor));
        store(file(name + std::string("-F.npy")), numbers(type, MemoryOrder::ColumnMajor));
    }
    numpy(std::string(makeNumbers) + R"(
for t in types:
    for order in 'CF':
        a = np.load(t + '-' + order + '.npy')
        assert a.dtype == np.dtype(t), (t, a.dtype)
        assert a.flags[order + '_CONTIGUOUS'], (t, order)
        assert np.array_equal(a, numbers(t)), (t, a)
)");
}

TEST_F(NpyFileTest, BigEndianFilesAreSwapped) {
    numpy(std::string(makeNumbers) + R"(
for t in types:
    np.save(t + '-C.npy', numbers(t).astype(np.dtype(t).newbyteorder('>')))
    np.save(t + '-F.npy', np.asfortranarray(numbers(t).astype(np.dtype(t).newbyteorder('>'))))
)");
    for (const auto& [name, type] : types) {
        EXPECT_EQ(readNpy(file(name + std::string("-C.npy"))), numbers(type, MemoryOrder::RowMajor)) << name;
        EXPECT_EQ(readNpy(file(name + std::string("-F.npy"))), numbers(type, MemoryOrder::ColumnMajor)) << name;
    }
}

TEST_F(NpyFileTest, ScalarsEmptyArraysAndManyDimensions) {
    numpy(R"(
np.save('scalar.npy', np.float64(2.5))
np.save('vector.npy', np.arange(3.0))
np.save('empty.npy', np.zeros((0,)))
np.save('flat.npy', np.zeros((3, 0, 2), dtype='int8'))
np.save('deep.npy', np.ones((1,) * 31 + (2,), dtype='int16'))
)");
    EXPECT_EQ(readNpy(file("scalar.npy")), ArrayFactory().createScalar(2.5));
    EXPECT_EQ(readNpy(file("vector.npy")), make<double>({3}, {0, 1, 2}));
    EXPECT_EQ(readNpy(file("empty.npy")), make<double>({0}, {}));
    EXPECT_EQ(readNpy(file("flat.npy")), make<std::int8_t>({3, 0, 2}, {}));
    std::vector<std::uint64_t> deep(32, 1);
    deep.back() = 2;
    EXPECT_EQ(readNpy(file("deep.npy")), make<std::int16_t>(deep, {1, 1}));
    store(file("scalar-back.npy"), ArrayFactory().createScalar(2.5));
    store(file("vector-back.npy"), make<double>({3}, {0, 1, 2}));
    store(file("empty-back.npy"), make<double>({0}, {}));
    store(file("flat-back.npy"), make<std::int8_t>({3, 0, 2}, {}));
    store(file("deep-back.npy"), make<std::int16_t>(deep, {1, 1}));
    numpy(R"(
for name in 'scalar vector empty flat deep'.split():
    a, b = np.load(name + '.npy'), np.load(name + '-back.npy')
    assert a.shape == b.shape and a.dtype == b.dtype and np.array_equal(a, b), name
)");
}

TEST_F(NpyFileTest, AllVersionsOfTheFormat) {
    numpy(R"(
for version in (1, 0), (2, 0), (3, 0):
    with open('v%d.npy' % version[0], 'wb') as f:
        np.lib.format.write_array(f, np.arange(3.0), version=version)
)");
    for (const char* name : {"v1.npy", "v2.npy", "v3.npy"}) {
        EXPECT_EQ(readNpy(file(name)), make<double>({3}, {0, 1, 2})) << name;
    }
}

TEST_F(NpyFileTest, Texts) {
    numpy(R"(
np.save('text.npy', np.array('hello \u20ac \U0001F600'))
np.save('big.npy', np.array('hello \u20ac \U0001F600').astype('>U20'))
np.save('empty.npy', np.array(''))
np.save('several.npy', np.array(['a', 'b']))
)");
    EXPECT_EQ(readNpy(file("text.npy")), ArrayFactory().createText(u"hello € 😀"));
    EXPECT_EQ(readNpy(file("big.npy")), ArrayFactory().createText(u"hello € 😀"));
    EXPECT_EQ(readNpy(file("empty.npy")), ArrayFactory().createText(u""));
    EXPECT_THAT(refusal(read(file("several.npy"))),
                "it holds an array of texts; only a single text, of shape (), can be sent");
    store(file("text-back.npy"), ArrayFactory().createText(u"hello € 😀"));
    store(file("empty-back.npy"), ArrayFactory().createText(u""));
    numpy(R"(
assert np.load('text-back.npy') == 'hello \u20ac \U0001F600' and np.load('text-back.npy').shape == ()
assert np.load('empty-back.npy') == ''
)");
}

TEST_F(NpyFileTest, TheElementsLieInAReadOnlyMappingOfTheFile) {
    numpy("np.save('large.npy', np.arange(100000.0))");
    const Array array = readNpy(file("large.npy"));
    std::ifstream maps("/proc/self/maps");
    const auto address = reinterpret_cast<std::uintptr_t>(array.data());
    std::string found;
    for (std::string line; std::getline(maps, line);) {
        std::uintptr_t begin = 0;
        std::uintptr_t end = 0;
        char dash = 0;
        std::istringstream(line) >> std::hex >> begin >> dash >> end;
        if (begin <= address && address + array.sizeInBytes() <= end) {
            found = line;
        }
    }
    EXPECT_THAT(found, HasSubstr(" r--p "));
    EXPECT_THAT(found, HasSubstr("large.npy"));
}

TEST_F(NpyFileTest, TheMappingEndsWithTheLastShareOfTheArray) {
    numpy("np.save('large.npy', np.arange(100000.0))");
    const auto mapped = [&] { return read("/proc/self/maps").find("large.npy") != std::string::npos; };
    {
        auto array = std::make_unique<Array>(readNpy(file("large.npy")));
        auto frame = array->lendBuffer();
        EXPECT_EQ(frame.first.get(), array->data());
        array.reset();
        EXPECT_TRUE(mapped());
    }
    EXPECT_FALSE(mapped());
}

TEST_F(NpyFileTest, TheHeaderOfAnOutputIsPaddedSoThatElementsAreAligned) {
    store(file("out.npy"), make<double>({2, 3}, {1, 2, 3, 4, 5, 6}, MemoryOrder::ColumnMajor));
    const std::string bytes = read(file("out.npy"));
    const std::string header = "{'descr': '<f8', 'fortran_order': True, 'shape': (2, 3), }";
    ASSERT_EQ(bytes.size(), 128U + 48U);
    EXPECT_EQ(bytes.substr(0, 10), std::string("\x93NUMPY\x01\x00\x76\x00", 10));
    EXPECT_EQ(bytes.substr(10, 118), header + std::string(117 - header.size(), ' ') + "\n");
}

TEST_F(NpyFileTest, WhatFollowsTheElementsIsIgnored) {
    const std::string bytes = npy(headerOf("|u1", "(2,)"), "abc");
    EXPECT_EQ(readNpy(write("more.npy", bytes)), make<std::uint8_t>({2}, {'a', 'b'}));
}

TEST_F(NpyFileTest, KeysMayComeInAnyOrderAndInDoubleQuotes) {
    const std::string header = R"({ "shape": ( 2 , ), "fortran_order":True,"descr":"u1" })";
    EXPECT_EQ(readNpy(write("odd.npy", npy(header, "ab"))), make<std::uint8_t>({2}, {'a', 'b'}));
}

TEST_F(NpyFileTest, FilesThatAreNone) {
    EXPECT_EQ(refusal(""), "it is no .npy file (it does not begin with \"\\x93NUMPY\")");
    EXPECT_EQ(refusal("\x93NUMP"), "it is no .npy file (it does not begin with \"\\x93NUMPY\")");
    EXPECT_EQ(refusal("PK\3\4 an archive"), "it is no .npy file (it does not begin with \"\\x93NUMPY\")");
    EXPECT_EQ(refusal(npy("", "", '\4')), "it has version 4.0 of the .npy format; 1.0, 2.0 and 3.0 are known here");
    EXPECT_EQ(refusal(npy("", "", '\1', '\1')),
              "it has version 1.1 of the .npy format; 1.0, 2.0 and 3.0 are known here");
}

TEST_F(NpyFileTest, AFileThatIsCutAnywhereIsRefused) {
    const std::string bytes = npy(headerOf("<f8", "(2,)"), std::string(16, 'x'));
    for (std::size_t length = 0; length < bytes.size(); ++length) {
        EXPECT_NE(refusal(bytes.substr(0, length)), "accepted") << length;
    }
    EXPECT_EQ(refusal(bytes.substr(0, 9)), "it ends after 9 bytes, in the middle of its header");
    EXPECT_EQ(refusal(bytes.substr(0, 40)), "it ends after 40 bytes, in the middle of its header");
    EXPECT_EQ(refusal(bytes.substr(0, bytes.size() - 1)),
              "it is cut short: its header says 16 bytes of elements, 15 are there");
    EXPECT_EQ(refusal(npy(headerOf("<U4", "()"), std::string(15, 'x'))),
              "it is cut short: its header says 16 bytes of elements, 15 are there");
}

TEST_F(NpyFileTest, HugeClaimsAreRefusedWithoutMemory) {
    EXPECT_EQ(refusal(npy(headerOf("<f8", "(10000000, 10000000, 10000000)"))),
              "Array: 10000000 x 10000000 x 10000000 double is more than 9223372036854775807 bytes");
    EXPECT_EQ(refusal(npy(headerOf("|u1", "(4611686018427387904,)"), "x")),
              "it is cut short: its header says 4611686018427387904 bytes of elements, 1 are there");
    EXPECT_EQ(refusal(npy(headerOf("<U4611686018427387904", "()"))),
              "it says that it has more than 2^64 bytes of elements");
    EXPECT_THAT(refusal(npy(headerOf("|u1", "(18446744073709551616,)"))), HasSubstr("no extent that fits 64 bits"));
    std::string shape = "(";
    for (int i = 0; i < 33; ++i) {
        shape += "1, ";
    }
    EXPECT_EQ(refusal(npy(headerOf("|u1", shape + ")"), "x")), "Array: 33 dimensions; at most 32 are supported");
    std::string version2 = npy("", "", '\2');
    version2.replace(8, 4, "\xFF\xFF\xFF\x7F");
    EXPECT_EQ(refusal(version2), "it ends after 12 bytes, in the middle of its header");
}

TEST_F(NpyFileTest, TypesThatCannotBeSent) {
    const auto ofType = [&](const std::string& descr) { return refusal(npy(headerOf(descr, "()"), "xxxxxxxx")); };
    EXPECT_EQ(ofType("|O"),
              "its elements are of type '|O', which cannot be sent; Python objects stay in their process");
    EXPECT_EQ(ofType("<f2"), "its elements are of type '<f2', which cannot be sent");
    EXPECT_EQ(ofType("|S8"), "its elements are of type '|S8', which cannot be sent");
    EXPECT_EQ(ofType("<M8[ns]"), "its elements are of type '<M8[ns]', which cannot be sent");
    EXPECT_EQ(ofType(""), "its elements are of type '', which cannot be sent");
    EXPECT_EQ(ofType("<"), "its elements are of type '<', which cannot be sent");
    EXPECT_EQ(refusal(npy("{'descr': [('a', '<f8')], 'fortran_order': False, 'shape': (), }")),
              "its elements are records, which cannot be sent; send their fields one by one");
}

TEST_F(NpyFileTest, HeadersThatAreNoDictionaryOfTheThreeKeys) {
    const auto withHeader = [&](const std::string& header) { return refusal(npy(header, "xxxxxxxx")); };
    EXPECT_EQ(withHeader(""), "its header has no '{' at byte 0");
    EXPECT_EQ(withHeader("{"), "its header has no text in quotes at byte 1");
    EXPECT_EQ(withHeader("{}"), "its header has not all of the keys 'descr', 'fortran_order' and 'shape' at byte 2");
    EXPECT_EQ(withHeader("{'descr' '<f8'}"), "its header has no ':' at byte 9");
    EXPECT_EQ(withHeader("{'other': 1}"), "its header has the unknown key 'other' at byte 9");
    EXPECT_EQ(withHeader("{'shape': (), 'shape': ()}"), "its header has the key 'shape' a second time at byte 22");
    EXPECT_EQ(withHeader("{'shape': (1)}"), "its header has a number in parentheses, which is no shape, at byte 13");
    EXPECT_EQ(withHeader("{'shape': (-1,)}"), "its header has no extent that fits 64 bits at byte 11");
    EXPECT_EQ(withHeader("{'shape': (1 2)}"), "its header has no ',' at byte 13");
    EXPECT_EQ(withHeader("{'fortran_order': 1}"), "its header has neither True nor False at byte 18");
    EXPECT_EQ(withHeader("{'descr': '<f"), "its header has a text that does not end or has escapes at byte 10");
    EXPECT_EQ(withHeader("{'descr': '\\x'}"), "its header has a text that does not end or has escapes at byte 10");
    EXPECT_EQ(withHeader("{'shape': () 'descr': 'u1'}"), "its header has no '}' at byte 13");
    EXPECT_EQ(withHeader(headerOf("|u1", "()") + "x"), "its header has more text after the dictionary at byte 56");
}

TEST_F(NpyFileTest, PathsThatAreNoFile) {
    const auto sentence = [](const std::string& path) {
        try {
            readNpy(path);
        } catch (const Failure& failure) {
            return std::string(failure.what());
        }
        return std::string("accepted");
    };
    EXPECT_EQ(sentence("/nowhere/a.npy"), "cannot open '/nowhere/a.npy': No such file or directory");
    EXPECT_EQ(sentence(directory_.path()), "cannot read '" + directory_.path() + "': it is no regular file");
    ASSERT_EQ(::mkfifo(file("fifo.npy").c_str(), 0600), 0);
    EXPECT_EQ(sentence(file("fifo.npy")), "cannot read '" + file("fifo.npy") + "': it is no regular file");
}

TEST_F(NpyFileTest, AnOutputHasItsNameOnlyWhenItIsComplete) {
    NpyOutput output(file("out.npy"));
    EXPECT_FALSE(std::filesystem::exists(file("out.npy")));
    output.write(ArrayFactory().createScalar(1.0));
    EXPECT_EQ(readNpy(file("out.npy")), ArrayFactory().createScalar(1.0));
    EXPECT_EQ(filesInDirectory(), 1U);
}

TEST_F(NpyFileTest, AnOutputThatIsNotWrittenLeavesWhatWasThere) {
    write("out.npy", "old");
    { const NpyOutput output(file("out.npy")); }
    EXPECT_EQ(read(file("out.npy")), "old");
    EXPECT_EQ(filesInDirectory(), 1U);
}

TEST_F(NpyFileTest, AnOutputMayReplaceTheFileThatItsArrayIsMappedFrom) {
    store(file("a.npy"), make<double>({3}, {1, 2, 3}));
    const Array array = readNpy(file("a.npy"));
    store(file("a.npy"), make<double>({1}, {7}));
    EXPECT_EQ(array, make<double>({3}, {1, 2, 3}));
    EXPECT_EQ(readNpy(file("a.npy")), make<double>({1}, {7}));
}

TEST_F(NpyFileTest, AnOutputThroughASymbolicLinkReplacesWhatItLeadsTo) {
    store(file("a.npy"), ArrayFactory().createScalar(1.0));
    std::filesystem::create_symlink("a.npy", file("link.npy"));
    store(file("link.npy"), ArrayFactory().createScalar(2.0));
    EXPECT_TRUE(std::filesystem::is_symlink(file("link.npy")));
    EXPECT_EQ(readNpy(file("a.npy")), ArrayFactory().createScalar(2.0));
}

TEST_F(NpyFileTest, ADeviceIsWrittenToAndStaysOne) {
    store("/dev/null", ArrayFactory().createScalar(1.0));
    EXPECT_TRUE(std::filesystem::is_character_file("/dev/null"));
    try {
        store("/dev/full", ArrayFactory().createScalar(1.0));
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_STREQ(failure.what(), "cannot write '/dev/full': No space left on device");
    }
}

TEST_F(NpyFileTest, OutputsThatCannotBeWritten) {
    try {
        NpyOutput output("/nowhere/out.npy");
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_STREQ(failure.what(), "cannot write '/nowhere/out.npy': No such file or directory");
        EXPECT_EQ(failure.code(), ExitCode::Usage);
    }
    try {
        store(file("out.npy"), ArrayFactory().createArray(ElementType::ComplexInt16, {2}));
        FAIL();
    } catch (const Failure& failure) {
        EXPECT_EQ(std::string(failure.what()),
                  "cannot write '" + file("out.npy") + "': NumPy has no type for complex int16, 2 elements");
    }
    EXPECT_EQ(filesInDirectory(), 0U);
}

}  // namespace
}  // namespace krutil_client
