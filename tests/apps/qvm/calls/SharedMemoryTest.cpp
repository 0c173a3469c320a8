// Large arrays between a client and a real engine of one machine.
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <cstdint>
#include <string>
#include <vector>

#include "apps/qvm/calls/CallFixture.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"
#include "programs/support/Relay.hpp"
#include "support/TemporaryDirectory.hpp"

namespace qvm_test {
namespace {

using foundation::vantor::carrier::framing::BufferAllocator;
using programs_test::Relay;

constexpr std::uint64_t mebi = 1U << 20;
constexpr std::uint64_t size = 3 * mebi;

// Bytes of a call besides its elements: far fewer than a content that is shared.
constexpr std::uint64_t fewBytes = 4096;

// What a call may look at: `mapped` says what the memory of an array belongs to, as the system sees it.
constexpr const char* helpers = R"(
import os
kept = []
def mapped(a):
    address = a.__array_interface__['data'][0]
    for line in open('/proc/self/maps'):
        begin, end = (int(x, 16) for x in line.split()[0].split('-'))
        if begin <= address < end:
            return line.split(None, 5)[5].strip() if len(line.split(None, 5)) > 5 else ''
def total(a):
    return int(a.astype('uint64').sum())
def keep(a):
    kept.append(a)
    return len(kept)
def keptTotals():
    return [total(a) for a in kept]
def drop():
    kept.clear()
    return 0
def overwrite(a):
    before = total(a)
    a[:] = 1
    return [before, total(a)]
)";

std::uint64_t totalOf(const Array& array) {
    std::uint64_t total = 0;
    for (std::uint64_t i = 0; i < array.sizeInBytes(); ++i) {
        total += static_cast<unsigned char>(array.data()[i]);
    }
    return total;
}

std::vector<std::int64_t> numbersOf(const Array& array) {
    const auto* const numbers = reinterpret_cast<const std::int64_t*>(array.data());
    return {numbers, numbers + array.numberOfElements()};
}

std::string textOf(const Array& array) {
    const std::u16string units = array.toText();
    return {units.begin(), units.end()};
}

// Whether the array's elements are read in memory that is another process's.
bool isForeign(const Array& array) {
    return BufferAllocator::isForeign(array.data());
}

class SharedMemoryTest : public testing::Test {
  protected:
    SharedMemoryTest() { prepare(client_); }

    static void prepare(EngineClient& client) { EXPECT_EQ(client.eval(helpers).errorText(), ""); }

    Array call1(const std::string& function, std::vector<Array> arguments = {}) {
        return call(client_, function, std::move(arguments)).at(0);
    }

    // Bytes that the client writes to its stream during a call.
    template <class Call>
    std::uint64_t written(Call callIt) {
        const std::uint64_t before = client_.session().traffic().written;
        callIt();
        return client_.session().traffic().written - before;
    }

    EngineProcess engine_{{"--stdio"}};
    EngineClient client_{engine_.connection(), {}, {}, true};
};

TEST_F(SharedMemoryTest, ArgumentsAreReadWhereTheClientWroteThem) {
    ASSERT_TRUE(client_.session().features().contains("SHM"));
    const Array array = bytes(size);
    EXPECT_LT(written([&] {
                  EXPECT_EQ(textOf(call1("mapped", {array})), "/memfd:krutil-array (deleted)");
                  EXPECT_EQ(numbersOf(call1("total", {array})),
                            (std::vector{static_cast<std::int64_t>(totalOf(array))}));
              }),
              fewBytes);
}

TEST_F(SharedMemoryTest, SmallArraysTravelAsBytes) {
    const Array array = bytes(mebi - 1);
    EXPECT_GE(written([&] { EXPECT_EQ(textOf(call1("mapped", {array})).find("memfd"), std::string::npos); }), mebi - 1);
}

TEST_F(SharedMemoryTest, CodeWritesToItsOwnCopyOfAPage) {
    const Array array = bytes(size);
    const auto total = static_cast<std::int64_t>(totalOf(array));
    EXPECT_EQ(numbersOf(call1("overwrite", {array})), (std::vector<std::int64_t>{total, size}));
    EXPECT_EQ(static_cast<std::int64_t>(totalOf(array)), total);
    EXPECT_EQ(numbersOf(call1("total", {array})), (std::vector{total}));
}

TEST_F(SharedMemoryTest, TheClientWritesElsewhereUntilTheEngineHasLetGo) {
    Array array = bytes(size);
    const auto total = static_cast<std::int64_t>(totalOf(array));
    call1("keep", {array});
    EXPECT_FALSE(array.writableInPlace());
    const char* const before = array.data();
    std::fill_n(array.mutableData(), size, '\1');
    EXPECT_NE(array.data(), before);
    call1("keep", {array});
    EXPECT_EQ(numbersOf(call1("keptTotals")), (std::vector<std::int64_t>{total, size}));
    call1("drop");
    EXPECT_TRUE(array.writableInPlace());
    const char* const again = array.data();
    EXPECT_EQ(array.mutableData(), again);
    array = Array();
    // Both segments wait to be used again, the latest first.
    EXPECT_EQ(bytes(size).data(), again);
}

TEST_F(SharedMemoryTest, ResultsAreCopiedOnce) {
    client_.eval("import numpy\nresult = numpy.arange(" + std::to_string(size) +
                 ", dtype='uint8')\ndef give(): return result\n"
                 "def change():\n    result[:] = 1\n    return 0\n");
    // The first two go as bytes, or into memory that is fresh.
    const Array first = call1("give");
    const Array second = call1("give");
    EXPECT_FALSE(isForeign(first));
    EXPECT_TRUE(isForeign(second));
    const std::uint64_t total = totalOf(first);
    EXPECT_EQ(totalOf(second), total);
    call1("change");
    EXPECT_EQ(totalOf(second), total) << "the engine has changed its array, not what it sent";
    const Array third = call1("give");
    EXPECT_EQ(totalOf(third), size);
    EXPECT_EQ(totalOf(second), total) << "its segment is not used again before it is released";
}

TEST_F(SharedMemoryTest, TruthValuesAreCheckedOnACopy) {
    Array array = ArrayFactory().createArray(ElementType::Bool, {size});
    EXPECT_LT(written([&] {
                  EXPECT_EQ(textOf(call1("mapped", {array})).find("memfd"), std::string::npos);
                  EXPECT_EQ(numbersOf(call1("total", {array})), (std::vector<std::int64_t>{0}));
              }),
              fewBytes);
}

TEST_F(SharedMemoryTest, AForkReadsOnInWhatItsParentHasGivenBack) {
    client_.eval(
        "def fork(a):\n"
        "    global there, back\n"
        "    there, back = os.pipe(), os.pipe()\n"
        "    if os.fork() == 0:\n"
        "        os.read(there[0], 1)\n"
        "        os.write(back[1], str(total(a)).encode())\n"
        "        os._exit(0)\n"
        "    return 0\n"
        "def childsTotal():\n"
        "    os.write(there[1], b'.')\n"
        "    return int(os.read(back[0], 100))\n");
    Array array = bytes(size);
    const auto total = static_cast<std::int64_t>(totalOf(array));
    call1("fork", {array});
    ASSERT_TRUE(array.writableInPlace()) << "the parent has let go";
    std::fill_n(array.mutableData(), size, '\1');
    EXPECT_EQ(numbersOf(call1("childsTotal")), (std::vector{total}));
    EXPECT_EQ(numbersOf(call1("total", {array})), (std::vector<std::int64_t>{size}));
}

TEST_F(SharedMemoryTest, WhatTheEngineKeepsForEverIsBounded) {
    std::vector<Array> arrays;
    for (int i = 0; i < 40; ++i) {
        arrays.push_back(bytes(mebi));
    }
    // More than the segments that a process has.
    const std::uint64_t asBytes = written([&] {
        for (const Array& array : arrays) {
            call1("keep", {array});
        }
    });
    EXPECT_EQ(asBytes / mebi, 8U);
    const auto total = static_cast<std::int64_t>(totalOf(arrays[0]));
    EXPECT_EQ(numbersOf(call1("keptTotals")), std::vector<std::int64_t>(40, total));
}

TEST_F(SharedMemoryTest, AKilledEngineLeavesNothingBehind) {
    Array array = bytes(size);
    const std::uint64_t total = totalOf(array);
    call1("keep", {array});
    ASSERT_FALSE(array.writableInPlace());
    engine_.signal(SIGKILL);
    EXPECT_EQ(client_.awaitEnd().reason, session::SessionEnd::Reason::Lost);
    client_.session().close();
    EXPECT_TRUE(array.writableInPlace());
    EXPECT_EQ(totalOf(array), total);
    EngineProcess next({"--stdio"});
    EngineClient client(next.connection(), {}, {}, true);
    prepare(client);
    EXPECT_EQ(numbersOf(call(client, "total", {array}).at(0)), (std::vector{static_cast<std::int64_t>(total)}));
}

TEST(SharedMemoryOffTest, ArraysTravelAsBytesWhenOneEndDoesNotWantIt) {
    for (const bool atEngine : {true, false}) {
        SCOPED_TRACE(atEngine);
        EngineProcess engine(atEngine ? std::vector<std::string>{"--stdio", "--no-shared-memory"}
                                      : std::vector<std::string>{"--stdio"});
        EngineClient client(engine.connection(), {}, {}, atEngine);
        client.eval(helpers);
        EXPECT_FALSE(client.session().features().contains("SHM"));
        const std::uint64_t before = client.session().traffic().written;
        const Array array = bytes(size);
        EXPECT_EQ(textOf(call(client, "mapped", {array}).at(0)).find("memfd"), std::string::npos);
        EXPECT_GE(client.session().traffic().written - before, size);
    }
}

TEST(SharedMemoryOffTest, ArraysTravelAsBytesThroughWhatDropsDescriptors) {
    const test_support::TemporaryDirectory directory;
    const std::string socket = directory.path() + "/engine";
    EngineProcess engine({"--listen", socket});
    engine.awaitStderr("serving");
    Relay relay(directory.path() + "/relay", socket);
    EngineClient client(connectTo(relay.path()), {}, {}, true);
    client.eval(helpers);
    EXPECT_FALSE(client.session().features().contains("SHM"));
    const Array array = bytes(size);
    const std::uint64_t before = client.session().traffic().written;
    EXPECT_EQ(numbersOf(call(client, "total", {array}).at(0)),
              (std::vector{static_cast<std::int64_t>(totalOf(array))}));
    EXPECT_GE(client.session().traffic().written - before, size);
}

}  // namespace
}  // namespace qvm_test
