#include "foundation/vantor/carrier/shared_memory/SegmentPool.hpp"

#include <algorithm>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"
#include "platform/shared_memory/SharedMemorySupport.hpp"

namespace foundation::vantor::carrier::shared_memory {
namespace {

constexpr std::size_t mebi = 1U << 20;

class SegmentPoolTest : public testing::Test {
  protected:
    static SegmentPool::Bounds bounds() {
        SegmentPool::Bounds small;
        small.segments = 3;
        small.idleBytes = 4 * mebi;
        small.copyBytes = 6 * mebi;
        return small;
    }

    SegmentPool pool_{bounds()};
    const SegmentPool::Viewer viewer_ = pool_.addViewer(true);
};

TEST_F(SegmentPoolTest, WhatWasGivenBackIsUsedAgainForItsSizeClass) {
    char* const first = pool_.take(mebi);
    char* const second = pool_.take(mebi);
    EXPECT_NE(first, second);
    pool_.giveBack(first);
    EXPECT_NE(pool_.take(2 * mebi), first);
    EXPECT_EQ(pool_.take(mebi - 10), first);
    EXPECT_EQ(pool_.inUse(), 3U);
}

TEST_F(SegmentPoolTest, SegmentsThatNobodyHasUsedForLongAreGivenBack) {
    const auto begin = std::chrono::steady_clock::now();
    char* const used = pool_.take(mebi);
    pool_.giveBack(pool_.take(mebi));
    pool_.trim(begin - std::chrono::hours(1));
    EXPECT_EQ(pool_.bytes(), 2 * mebi);
    pool_.trim(std::chrono::steady_clock::now());
    EXPECT_EQ(pool_.bytes(), mebi);
    EXPECT_EQ(pool_.size(), 1U);
    pool_.giveBack(used);
}

TEST_F(SegmentPoolTest, NumberOfSegmentsIsBounded) {
    char* const first = pool_.take(mebi);
    pool_.take(mebi);
    char* const third = pool_.take(mebi);
    EXPECT_EQ(pool_.take(mebi), nullptr);
    pool_.giveBack(third);
    // An idle one of another size makes room.
    EXPECT_NE(pool_.take(2 * mebi), nullptr);
    EXPECT_EQ(pool_.size(), 3U);
    pool_.giveBack(first);
    EXPECT_EQ(pool_.take(mebi), first);
}

TEST_F(SegmentPoolTest, IdleBytesAreBoundedAndTheOldestGoFirst) {
    char* const first = pool_.take(2 * mebi);
    char* const second = pool_.take(2 * mebi);
    char* const third = pool_.take(2 * mebi);
    pool_.giveBack(first);
    pool_.giveBack(second);
    EXPECT_EQ(pool_.size(), 3U);
    pool_.giveBack(third);
    EXPECT_EQ(pool_.size(), 2U);
    EXPECT_EQ(pool_.take(2 * mebi), third);
    EXPECT_EQ(pool_.take(2 * mebi), second);
    char* const large = pool_.take(5 * mebi);
    EXPECT_EQ(pool_.size(), 3U);
    pool_.giveBack(large);
    EXPECT_EQ(pool_.size(), 2U) << "one that does not fit the bound is not kept";
}

TEST_F(SegmentPoolTest, CopiesGetFreshMemoryFromTheSecondTimeOn) {
    EXPECT_EQ(pool_.takeForCopy(mebi, viewer_), nullptr);
    EXPECT_EQ(pool_.takeForCopy(2 * mebi, viewer_), nullptr);
    char* const memory = pool_.takeForCopy(mebi, viewer_);
    ASSERT_NE(memory, nullptr);
    pool_.giveBack(memory);
    EXPECT_EQ(pool_.takeForCopy(mebi, viewer_), memory);
}

TEST_F(SegmentPoolTest, CopiesGetOnlyWhatWillBeKept) {
    EXPECT_EQ(pool_.takeForCopy(5 * mebi, viewer_), nullptr);
    EXPECT_EQ(pool_.takeForCopy(5 * mebi, viewer_), nullptr);
    char* const idle = pool_.take(mebi);
    pool_.giveBack(idle);
    EXPECT_EQ(pool_.takeForCopy(mebi, viewer_), idle) << "what exists may be used the first time";
}

TEST_F(SegmentPoolTest, CopiesLeaveRoomForOtherBytes) {
    pool_.take(5 * mebi);
    EXPECT_EQ(pool_.takeForCopy(2 * mebi, viewer_), nullptr);
    EXPECT_EQ(pool_.takeForCopy(2 * mebi, viewer_), nullptr);
    EXPECT_EQ(pool_.takeForCopy(2 * mebi, viewer_), nullptr);
    EXPECT_NE(pool_.take(2 * mebi), nullptr);
}

TEST_F(SegmentPoolTest, OneViewerOnlyIsShownASegment) {
    const SegmentPool::Viewer other = pool_.addViewer(true);
    EXPECT_NE(other, viewer_);
    char* const memory = pool_.take(mebi);
    EXPECT_TRUE(pool_.show(memory, viewer_));
    EXPECT_FALSE(pool_.show(memory, other));
    EXPECT_TRUE(pool_.show(memory, viewer_));
    EXPECT_FALSE(pool_.show(memory + 1, viewer_));
    pool_.giveBack(memory);
    EXPECT_FALSE(pool_.show(memory, viewer_)) << "nobody uses it";
}

TEST_F(SegmentPoolTest, BytesForOneViewerNeverLieWhereAnotherMayLook) {
    const SegmentPool::Viewer other = pool_.addViewer(true);
    char* const memory = pool_.take(mebi);
    EXPECT_TRUE(pool_.show(memory, viewer_));
    pool_.giveBack(memory);
    // Nobody knows yet which of the two this is for.
    char* const second = pool_.take(mebi);
    EXPECT_NE(second, memory);
    EXPECT_EQ(pool_.takeForCopy(mebi, other), nullptr);
    char* const third = pool_.takeForCopy(mebi, other);
    EXPECT_NE(third, memory);
    EXPECT_EQ(pool_.takeForCopy(mebi, viewer_), memory);
}

TEST_F(SegmentPoolTest, ViewersOfCopiesOnlyDoNotAskForArrays) {
    pool_.removeViewer(viewer_);
    const SegmentPool::Viewer other = pool_.addViewer(false);
    EXPECT_FALSE(pool_.wantsArrays());
    pool_.takeForCopy(mebi, other);
    EXPECT_NE(pool_.takeForCopy(mebi, other), nullptr);
}

TEST_F(SegmentPoolTest, WhatEarlierUsersLeftBehindTheEndIsCleared) {
    char* const memory = pool_.take(mebi);
    std::memset(memory, 'x', mebi);
    pool_.giveBack(memory);
    ASSERT_EQ(pool_.take(mebi - 5000), memory);
    EXPECT_EQ(memory[mebi - 5001], 'x');
    EXPECT_TRUE(std::all_of(memory + mebi - 5000, memory + mebi, [](char byte) { return byte == 0; }));
}

TEST_F(SegmentPoolTest, RemovedViewerSeesNothingMore) {
    char* const used = pool_.take(mebi);
    char* const idle = pool_.take(mebi);
    char* const unseen = pool_.take(mebi);
    std::memset(used, 'x', mebi);
    const ReceivedMemory view(pool_.show(used, viewer_)->get(), 0, mebi);
    EXPECT_TRUE(pool_.show(idle, viewer_));
    pool_.giveBack(idle);
    pool_.removeViewer(viewer_);
    EXPECT_FALSE(pool_.wantsArrays());
    EXPECT_EQ(pool_.size(), 2U);
    EXPECT_EQ(used[0], 'x');
    used[0] = 'y';
    EXPECT_EQ(view.data()[0], 'x');
    pool_.giveBack(used);
    EXPECT_EQ(pool_.size(), 1U);
    EXPECT_TRUE(pool_.show(unseen, pool_.addViewer(true)));
}

TEST_F(SegmentPoolTest, HiddenMemoryIsNeitherShownNorUsedAgain) {
    char* const memory = pool_.take(mebi);
    std::memset(memory, 'x', mebi);
    const ReceivedMemory view(pool_.show(memory, viewer_)->get(), 0, mebi);
    pool_.hide(memory);
    memory[0] = 'y';
    EXPECT_EQ(view.data()[0], 'x');
    EXPECT_FALSE(pool_.show(memory, viewer_));
    pool_.giveBack(memory);
    EXPECT_EQ(pool_.size(), 0U);
    pool_.hide(view.data());
}

TEST_F(SegmentPoolTest, AnyThreadTakesAndGivesBack) {
    SegmentPool pool{SegmentPool::Bounds()};
    const SegmentPool::Viewer viewer = pool.addViewer(true);
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&pool, viewer, i] {
            for (int turn = 0; turn < 50; ++turn) {
                char* const memory = pool.take(mebi);
                ASSERT_NE(memory, nullptr);
                std::memset(memory, 'a' + i, 100);
                EXPECT_TRUE(pool.show(memory, viewer));
                EXPECT_EQ(std::string(memory, 100), std::string(100, static_cast<char>('a' + i)));
                pool.giveBack(memory);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(pool.inUse(), 0U);
    EXPECT_LE(pool.size(), 4U);
}

}  // namespace
}  // namespace foundation::vantor::carrier::shared_memory
