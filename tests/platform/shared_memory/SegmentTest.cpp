#include "foundation/vantor/carrier/shared_memory/Segment.hpp"

#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <limits>
#include <memory>

#include "foundation/vantor/carrier/shared_memory/systemMemory.hpp"
#include "platform/shared_memory/SharedMemorySupport.hpp"

namespace foundation::vantor::carrier::shared_memory {
namespace {

using testing_memory::allSeals;
using testing_memory::page;

class SegmentTest : public testing::Test {
  protected:
    const std::unique_ptr<Segment> segment_ = Segment::create(3 * page);
};

TEST_F(SegmentTest, IsRoundedUpToPagesAndAllocatedWhole) {
    const auto odd = Segment::create(2 * page + 1);
    EXPECT_EQ(odd->size(), 3 * page);
    struct stat status {};
    ASSERT_EQ(::fstat(odd->descriptor()->get(), &status), 0);
    EXPECT_EQ(status.st_size, static_cast<off_t>(3 * page));
    EXPECT_EQ(status.st_blocks * 512, static_cast<blkcnt_t>(3 * page));
    EXPECT_EQ(::fcntl(odd->descriptor()->get(), F_GET_SEALS), allSeals);
    EXPECT_EQ(::fcntl(odd->descriptor()->get(), F_GETFD), FD_CLOEXEC);
}

TEST_F(SegmentTest, LiesWhereLargePagesCanBeUsedAndIsAllocatedWithThem) {
    for (const std::size_t size : {largePageSize, 8 * largePageSize, 8 * largePageSize + page}) {
        const auto large = Segment::create(size);
        EXPECT_EQ(reinterpret_cast<std::uintptr_t>(large->data()) % largePageSize, 0U);
        struct stat status {};
        ASSERT_EQ(::fstat(large->descriptor()->get(), &status), 0);
        EXPECT_EQ(status.st_size, static_cast<off_t>(size));
        EXPECT_EQ(status.st_blocks * 512, static_cast<blkcnt_t>(size));
        EXPECT_TRUE(std::all_of(large->data(), large->data() + size, [](char byte) { return byte == 0; }));
    }
}

TEST_F(SegmentTest, WhoeverHasTheDescriptorReadsAndCanChangeNothing) {
    const int descriptor = segment_->descriptor()->get();
    const auto refused = [](int result) { return result == -1 && errno == EPERM; };
    EXPECT_TRUE(refused(::ftruncate(descriptor, 0)));
    EXPECT_TRUE(refused(::ftruncate(descriptor, 4 * page)));
    EXPECT_TRUE(refused(::fallocate(descriptor, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE, 0, page)));
    EXPECT_TRUE(refused(static_cast<int>(::pwrite(descriptor, "x", 1, 0))));
    EXPECT_TRUE(refused(::fcntl(descriptor, F_ADD_SEALS, F_SEAL_WRITE)));
    EXPECT_EQ(::mmap(nullptr, page, PROT_READ | PROT_WRITE, MAP_SHARED, descriptor, 0), MAP_FAILED);
    std::memcpy(segment_->data() + 2 * page, "seen", 4);
    char seen[4] = {};
    EXPECT_EQ(::pread(descriptor, seen, 4, 2 * page), 4);
    EXPECT_EQ(std::string(seen, 4), "seen");
}

TEST_F(SegmentTest, DetachedIsWrittenToUnseen) {
    const testing_memory::OwnedDescriptor other(::fcntl(segment_->descriptor()->get(), F_DUPFD_CLOEXEC, 0));
    const char* const address = segment_->data();
    std::memcpy(segment_->data(), "before", 6);
    EXPECT_TRUE(segment_->detach());
    EXPECT_EQ(segment_->descriptor(), nullptr);
    EXPECT_EQ(segment_->data(), address);
    EXPECT_EQ(std::string(segment_->data(), 6), "before");
    std::memcpy(segment_->data(), "behind", 6);
    char seen[6] = {};
    EXPECT_EQ(::pread(other.get(), seen, 6, 0), 6);
    EXPECT_EQ(std::string(seen, 6), "before");
    EXPECT_TRUE(segment_->detach());
    EXPECT_EQ(std::string(segment_->data(), 6), "behind");
}

TEST_F(SegmentTest, NoneIsMadeOfWhatCannotBe) {
    EXPECT_EQ(Segment::create(0), nullptr);
    EXPECT_EQ(Segment::create(std::numeric_limits<std::size_t>::max()), nullptr);
    EXPECT_EQ(Segment::create(std::size_t{1} << 62), nullptr);
}

TEST_F(SegmentTest, NoneIsMadeThatIsLargerThanAFileMayBe) {
    rlimit before{};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
    const rlimit small{3 * page, before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    EXPECT_NE(Segment::create(3 * page), nullptr);
    EXPECT_EQ(Segment::create(3 * page + 1), nullptr);
    ::setrlimit(RLIMIT_FSIZE, &before);
}

TEST_F(SegmentTest, NoneIsMadeWithoutADescriptor) {
    rlimit before{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none{0, before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    EXPECT_EQ(Segment::create(page), nullptr);
    ::setrlimit(RLIMIT_NOFILE, &before);
}

}  // namespace
}  // namespace foundation::vantor::carrier::shared_memory
