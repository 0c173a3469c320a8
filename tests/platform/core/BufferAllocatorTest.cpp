#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

#include <gtest/gtest.h>

#include <chrono>
#include <cstdint>
#include <cstring>
#include <fstream>
#include <limits>
#include <new>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define KRUTIL_ADDRESS_SANITIZER 1
#endif
#endif

namespace foundation::vantor::carrier::framing {
namespace {

constexpr std::size_t mebi = 1U << 20;

class BufferAllocatorTest : public testing::Test {
  protected:
    void SetUp() override { before_ = BufferAllocator::inUse(); }
    void TearDown() override { EXPECT_EQ(BufferAllocator::inUse(), before_) << "buffers in use at the end"; }

    static std::size_t residentBytes() {
        std::ifstream file("/proc/self/statm");
        std::size_t total = 0;
        std::size_t resident = 0;
        file >> total >> resident;
        return resident * 4096;
    }

    std::size_t before_ = 0;
};

TEST_F(BufferAllocatorTest, EachBufferIsAlignedWritableAndKnowsItsSize) {
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{63}, std::size_t{64}, std::size_t{65},
                                   std::size_t{4096}, mebi - 1, mebi, mebi + 1, 5 * mebi + 3}) {
        char* const buffer = BufferAllocator::allocate(size);
        ASSERT_NE(buffer, nullptr) << size;
        EXPECT_EQ(reinterpret_cast<std::uintptr_t>(buffer) % 64, 0U) << size;
        EXPECT_EQ(BufferAllocator::sizeOf(buffer), size);
        std::memset(buffer, 0x5A, size);
        BufferAllocator::release(buffer);
        EXPECT_EQ(BufferAllocator::sizeOf(buffer), std::nullopt) << size;
    }
}

TEST_F(BufferAllocatorTest, BuffersOfSizeZeroHaveAddressesOfTheirOwn) {
    char* const first = BufferAllocator::allocate(0);
    char* const second = BufferAllocator::allocate(0);
    EXPECT_NE(first, second);
    EXPECT_EQ(BufferAllocator::sizeOf(first), 0U);
    BufferAllocator::release(first);
    EXPECT_EQ(BufferAllocator::sizeOf(second), 0U);
    BufferAllocator::release(second);
}

TEST_F(BufferAllocatorTest, AddressesInsideABufferAreUnknown) {
    char* const buffer = BufferAllocator::allocate(100);
    EXPECT_EQ(BufferAllocator::sizeOf(buffer + 1), std::nullopt);
    EXPECT_EQ(BufferAllocator::sizeOf(nullptr), std::nullopt);
    int local = 0;
    EXPECT_EQ(BufferAllocator::sizeOf(reinterpret_cast<const char*>(&local)), std::nullopt);
    BufferAllocator::release(buffer);
}

TEST_F(BufferAllocatorTest, InUseCountsBuffersAndAdoptions) {
    char* const buffer = BufferAllocator::allocate(10);
    EXPECT_EQ(BufferAllocator::inUse(), before_ + 1);
    BufferAllocator::adopt(
        buffer, 10, [](void*) {}, nullptr);
    EXPECT_EQ(BufferAllocator::inUse(), before_ + 2);
    BufferAllocator::release(buffer);
    BufferAllocator::release(buffer);
    EXPECT_EQ(BufferAllocator::inUse(), before_);
}

TEST_F(BufferAllocatorTest, NullIsReleasedWithoutEffect) {
    BufferAllocator::release(nullptr);
}

TEST_F(BufferAllocatorTest, FrameBufferIsReleasedByAPlainFunction) {
    for (const std::size_t size : {std::size_t{0}, std::size_t{5}, 2 * mebi}) {
        const FrameBuffer buffer = BufferAllocator::makeFrameBuffer(size);
        ASSERT_NE(buffer.first, nullptr);
        EXPECT_EQ(buffer.second, size);
        ASSERT_NE(buffer.first.get_deleter().target<void (*)(char*)>(), nullptr);
        EXPECT_EQ(*buffer.first.get_deleter().target<void (*)(char*)>(), &BufferAllocator::release);
        EXPECT_EQ(BufferAllocator::sizeOf(buffer.first.get()), size);
    }
}

TEST_F(BufferAllocatorTest, AbsurdSizesAreBadAlloc) {
    for (const std::size_t size : {std::numeric_limits<std::size_t>::max(),
                                   std::numeric_limits<std::size_t>::max() - 63, std::size_t{1} << 63}) {
        EXPECT_THROW(BufferAllocator::allocate(size), std::bad_alloc) << size;
    }
}

TEST_F(BufferAllocatorTest, PagesOfALargeBufferAreNotTouchedBeforeItsUserTouchesThem) {
    const std::size_t resident = residentBytes();
    char* const buffer = BufferAllocator::allocate(8ULL << 30);
    buffer[0] = 1;
    buffer[(8ULL << 30) - 1] = 1;
    EXPECT_LT(residentBytes(), resident + 64 * mebi);
    BufferAllocator::release(buffer);
}

TEST_F(BufferAllocatorTest, LargeBufferIsRecycledForItsSizeClass) {
    char* const first = BufferAllocator::allocate(9 * mebi);
    BufferAllocator::release(first);
    char* const second = BufferAllocator::allocate(9 * mebi - 5000);
    EXPECT_EQ(second, first);
    EXPECT_EQ(BufferAllocator::sizeOf(second), 9 * mebi - 5000);
    char* const third = BufferAllocator::allocate(9 * mebi);
    EXPECT_NE(third, first);
    BufferAllocator::release(second);
    BufferAllocator::release(third);
}

TEST_F(BufferAllocatorTest, RecyclingIsBounded) {
    BufferAllocator::trim({});
    const std::size_t before = BufferAllocator::largeBytes();
    [[maybe_unused]] const std::size_t resident = residentBytes();
    const auto expectBounded = [&] {
        EXPECT_LE(BufferAllocator::largeBytes(), before + 256 * mebi);
#ifndef KRUTIL_SANITIZED
        // A sanitizer has memory of its own.
        EXPECT_LE(residentBytes(), resident + 256 * mebi + 16 * mebi);
#endif
    };
    std::vector<char*> buffers;
    for (int i = 0; i < 24; ++i) {
        buffers.push_back(BufferAllocator::allocate(16 * mebi));
        std::memset(buffers.back(), 1, 16 * mebi);
    }
    for (char* const buffer : buffers) {
        BufferAllocator::release(buffer);
    }
    expectBounded();
    char* const beyond = BufferAllocator::allocate(300 * mebi);
    std::memset(beyond, 1, 300 * mebi);
    BufferAllocator::release(beyond);
    expectBounded();
}

TEST_F(BufferAllocatorTest, LatestBufferIsKeptInPlaceOfOlderOnes) {
    std::vector<char*> buffers;
    for (int i = 0; i < 16; ++i) {
        buffers.push_back(BufferAllocator::allocate(16 * mebi));
    }
    char* const latest = BufferAllocator::allocate(200 * mebi);
    for (char* const buffer : buffers) {
        BufferAllocator::release(buffer);
    }
    BufferAllocator::release(latest);
    char* const again = BufferAllocator::allocate(200 * mebi);
    EXPECT_EQ(again, latest);
    BufferAllocator::release(again);
}

TEST_F(BufferAllocatorTest, WhatIsKeptIsGivenBackWhenNobodyHasUsedItForLong) {
    BufferAllocator::trim({});
    const std::size_t before = BufferAllocator::largeBytes();
    char* const used = BufferAllocator::allocate(5 * mebi);
    char* const kept = BufferAllocator::allocate(16 * mebi);
    std::memset(kept, 1, 16 * mebi);
    BufferAllocator::release(kept);
    [[maybe_unused]] const std::size_t resident = residentBytes();
    BufferAllocator::trim(std::chrono::hours(1));
    EXPECT_EQ(BufferAllocator::largeBytes(), before + 21 * mebi);
    BufferAllocator::trim({});
    EXPECT_EQ(BufferAllocator::largeBytes(), before + 5 * mebi);
#ifndef KRUTIL_SANITIZED
    EXPECT_LE(residentBytes(), resident - 15 * mebi);
#endif
    BufferAllocator::release(used);
}

TEST_F(BufferAllocatorTest, TheAddressSanitizerSeesUseBeyondABufferAndAfterItsRelease) {
#if !defined(KRUTIL_ADDRESS_SANITIZER)
    GTEST_SKIP() << "only with the address sanitizer";
#endif
    testing::FLAGS_gtest_death_test_style = "threadsafe";
    // Of a size that leaves room in its class; fresh, and recycled from a larger one.
    for (int i = 0; i < 2; ++i) {
        volatile char* const buffer = BufferAllocator::allocate(9 * mebi - 5000);
        EXPECT_DEATH(buffer[9 * mebi - 5000] = 1, "use-after-poison");
        buffer[9 * mebi - 5001] = 1;
        BufferAllocator::release(const_cast<char*>(buffer));
        EXPECT_DEATH(buffer[0] = 1, "use-after-poison");
        BufferAllocator::release(BufferAllocator::allocate(9 * mebi));
    }
}

struct Owner {
    int dropped = 0;
    static void drop(void* owner) { ++static_cast<Owner*>(owner)->dropped; }
};

TEST_F(BufferAllocatorTest, AdoptedMemoryIsDroppedNotFreed) {
    alignas(64) char memory[100] = {};
    Owner owner;
    EXPECT_EQ(BufferAllocator::adopt(memory, 100, &Owner::drop, &owner), memory);
    EXPECT_EQ(BufferAllocator::sizeOf(memory), 100U);
    EXPECT_EQ(owner.dropped, 0);
    BufferAllocator::release(memory);
    EXPECT_EQ(owner.dropped, 1);
    EXPECT_EQ(BufferAllocator::sizeOf(memory), std::nullopt);
}

TEST_F(BufferAllocatorTest, AddressAdoptedTwiceIsReleasedLatestFirst) {
    char memory[100] = {};
    Owner first;
    Owner second;
    BufferAllocator::adopt(memory, 100, &Owner::drop, &first);
    BufferAllocator::adopt(memory, 60, &Owner::drop, &second);
    EXPECT_EQ(BufferAllocator::sizeOf(memory), 60U);
    BufferAllocator::release(memory);
    EXPECT_EQ(second.dropped, 1);
    EXPECT_EQ(first.dropped, 0);
    EXPECT_EQ(BufferAllocator::sizeOf(memory), 100U);
    BufferAllocator::release(memory);
    EXPECT_EQ(first.dropped, 1);
}

TEST_F(BufferAllocatorTest, BufferOfItsOwnCanBeAdoptedOnTop) {
    char* const buffer = BufferAllocator::allocate(50);
    Owner owner;
    BufferAllocator::adopt(buffer, 20, &Owner::drop, &owner);
    BufferAllocator::release(buffer);
    EXPECT_EQ(owner.dropped, 1);
    EXPECT_EQ(BufferAllocator::sizeOf(buffer), 50U);
    BufferAllocator::release(buffer);
}

TEST_F(BufferAllocatorTest, DropFunctionMayUseTheAllocator) {
    static char* inner = nullptr;
    inner = BufferAllocator::allocate(10);
    char memory[10] = {};
    BufferAllocator::adopt(
        memory, 10, [](void*) { BufferAllocator::release(inner); }, nullptr);
    BufferAllocator::release(memory);
    EXPECT_EQ(BufferAllocator::sizeOf(inner), std::nullopt);
}

TEST_F(BufferAllocatorTest, ThreadsReleaseWhatOthersAllocated) {
    std::vector<std::vector<char*>> made(4);
    const auto run = [&](auto work) {
        std::vector<std::thread> threads;
        for (std::size_t t = 0; t < made.size(); ++t) {
            threads.emplace_back([&work, t] { work(t); });
        }
        for (std::thread& thread : threads) {
            thread.join();
        }
    };
    run([&](std::size_t t) {
        std::minstd_rand random(static_cast<unsigned>(t + 1));
        for (int i = 0; i < 300; ++i) {
            const std::size_t size = i % 30 == 0 ? mebi + random() % mebi : random() % 5000;
            made[t].push_back(BufferAllocator::allocate(size));
            std::memcpy(made[t].back(), "x", size == 0 ? 0 : 1);
            if (i % 3 == 0) {
                BufferAllocator::release(made[t].back());
                made[t].pop_back();
            }
        }
    });
    std::set<char*> distinct;
    for (const auto& buffers : made) {
        distinct.insert(buffers.begin(), buffers.end());
    }
    EXPECT_EQ(distinct.size(), 4U * 200U);
    run([&](std::size_t t) {
        for (char* const buffer : made[(t + 1) % made.size()]) {
            BufferAllocator::release(buffer);
        }
    });
}

class BufferAllocatorDeathTest : public testing::Test {
  protected:
    void SetUp() override { ::testing::FLAGS_gtest_death_test_style = "threadsafe"; }
};

TEST_F(BufferAllocatorDeathTest, ReleaseOfAnUnknownAddressEndsTheProcess) {
    char memory[10] = {};
    EXPECT_DEATH(BufferAllocator::release(memory),
                 "fatal: BufferAllocator::release: the address is not that of a buffer in use "
                 "\\(.*BufferAllocator\\.cpp:[0-9]+, release\\)");
}

TEST_F(BufferAllocatorDeathTest, SecondReleaseEndsTheProcess) {
    EXPECT_DEATH(
        {
            char* const buffer = BufferAllocator::allocate(10);
            BufferAllocator::release(buffer);
            BufferAllocator::release(buffer);
        },
        "fatal: BufferAllocator::release: the address is not that of a buffer in use");
}

}  // namespace
}  // namespace foundation::vantor::carrier::framing
