#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <limits>
#include <memory>
#include <string>
#include <utility>

#include "foundation/vantor/carrier/shared_memory/Segment.hpp"
#include "foundation/vantor/carrier/shared_memory/systemMemory.hpp"
#include "platform/shared_memory/SharedMemorySupport.hpp"
#include "support/Pipe.hpp"

namespace foundation::vantor::carrier::shared_memory {
namespace {

using testing_memory::allSeals;
using testing_memory::anonymousMemory;
using testing_memory::OwnedDescriptor;
using testing_memory::page;

// Why a descriptor is refused.
std::string refusal(int descriptor, std::uint64_t offset, std::uint64_t size) {
    try {
        const ReceivedMemory memory(descriptor, offset, size);
    } catch (const MemoryRefused& refused) {
        return refused.what();
    }
    return "taken";
}

std::string refusal(const OwnedDescriptor& descriptor, std::uint64_t offset = 0, std::uint64_t size = page) {
    return refusal(descriptor.get(), offset, size);
}

bool isMapped(const void* address) {
    std::ifstream maps("/proc/self/maps");
    std::string line;
    const auto wanted = reinterpret_cast<std::uintptr_t>(address);
    while (std::getline(maps, line)) {
        const std::uintptr_t begin = std::stoull(line, nullptr, 16);
        const std::uintptr_t end = std::stoull(line.substr(line.find('-') + 1), nullptr, 16);
        if (begin <= wanted && wanted < end) {
            return true;
        }
    }
    return false;
}

// Of this process. Allocates nothing.
std::size_t mappedPages() {
    const OwnedDescriptor statistics(::open("/proc/self/statm", O_RDONLY | O_CLOEXEC));
    char text[100] = {};
    EXPECT_GT(::read(statistics.get(), text, sizeof text - 1), 0);
    return std::strtoul(text, nullptr, 10);
}

TEST(ReceivedMemoryTest, ShowsWhatTheOtherSideWrites) {
    const auto segment = Segment::create(4 * page);
    std::memcpy(segment->data() + page, "first", 5);
    const ReceivedMemory memory(segment->descriptor()->get(), page, 2 * page);
    EXPECT_EQ(memory.size(), 2 * page);
    EXPECT_EQ(std::string(memory.data(), 5), "first");
    std::memcpy(segment->data() + page, "later", 5);
    EXPECT_EQ(std::string(memory.data(), 5), "later");
}

TEST(ReceivedMemoryTest, WhatIsWrittenStaysHere) {
    const auto segment = Segment::create(2 * page);
    std::memset(segment->data(), 's', 2 * page);
    const ReceivedMemory memory(segment->descriptor()->get(), 0, 2 * page);
    memory.data()[page] = 'r';
    EXPECT_EQ(segment->data()[page], 's');
    std::memset(segment->data(), 't', 2 * page);
    EXPECT_EQ(memory.data()[page], 'r');
    EXPECT_EQ(memory.data()[page + 1], 's') << "a page that was written to is a copy";
}

TEST(ReceivedMemoryTest, LiesWhereLargePagesCanBeUsed) {
    const auto segment = Segment::create(3 * largePageSize);
    std::memset(segment->data(), 's', segment->size());
    for (const std::size_t offset : {std::size_t{0}, page, largePageSize, largePageSize - page}) {
        const std::size_t before = mappedPages();
        const ReceivedMemory memory(segment->descriptor()->get(), offset, largePageSize + 1);
        EXPECT_EQ(mappedPages(), before + largePageSize / page + 1) << "what it takes to find the place is given back";
        EXPECT_EQ(reinterpret_cast<std::uintptr_t>(memory.data()) % largePageSize, offset % largePageSize);
        memory.data()[largePageSize] = 'r';
        EXPECT_EQ(memory.data()[largePageSize - 1], 's');
    }
    EXPECT_EQ(segment->data()[largePageSize], 's');
}

TEST(ReceivedMemoryTest, OutlivesTheDescriptorAndTheSegment) {
    auto segment = Segment::create(page);
    std::memset(segment->data(), 's', page);
    const ReceivedMemory memory(segment->descriptor()->get(), 0, page);
    segment.reset();
    EXPECT_EQ(memory.data()[page - 1], 's');
}

TEST(ReceivedMemoryTest, IsUnmappedOnceWhoeverHasIt) {
    const auto segment = Segment::create(page);
    auto memory = std::make_unique<ReceivedMemory>(segment->descriptor()->get(), 0, page);
    const char* const address = memory->data();
    {
        const ReceivedMemory moved(std::move(*memory));
        EXPECT_EQ(moved.data(), address);
        memory.reset();
        EXPECT_TRUE(isMapped(address));
    }
    EXPECT_FALSE(isMapped(address));
}

TEST(ReceivedMemoryTest, EachSealIsNeeded) {
    const auto with = [](int seals) { return refusal(anonymousMemory(page, page, seals)); };
    const std::string expected = "expected the seals SHRINK, GROW, FUTURE_WRITE, SEAL, got ";
    EXPECT_EQ(with(0), expected + "none");
    EXPECT_EQ(with(allSeals & ~F_SEAL_SHRINK), expected + "GROW, FUTURE_WRITE, SEAL");
    EXPECT_EQ(with(allSeals & ~F_SEAL_GROW), expected + "SHRINK, FUTURE_WRITE, SEAL");
    EXPECT_EQ(with(allSeals & ~F_SEAL_FUTURE_WRITE), expected + "SHRINK, GROW, SEAL");
    EXPECT_EQ(with(allSeals & ~F_SEAL_SEAL), expected + "SHRINK, GROW, FUTURE_WRITE");
    EXPECT_EQ(with(F_SEAL_WRITE), expected + "WRITE");
    EXPECT_EQ(with(allSeals | F_SEAL_WRITE), "taken");
}

TEST(ReceivedMemoryTest, OtherKindsOfDescriptorsAreRefused) {
    const std::string other = "expected a descriptor of anonymous memory, got one of another kind";
    const test_support::Pipe pipe;
    EXPECT_EQ(refusal(pipe.read), other);
    const OwnedDescriptor file(::open("/proc/self/exe", O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(refusal(file), other);
    const OwnedDescriptor directory(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    EXPECT_EQ(refusal(directory), other);
    const OwnedDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(refusal(socket), other);
    const auto memory = anonymousMemory(page, page, allSeals);
    const OwnedDescriptor place(::open(("/proc/self/fd/" + std::to_string(memory.get())).c_str(), O_PATH | O_CLOEXEC));
    EXPECT_EQ(refusal(place), other);
    EXPECT_EQ(refusal(-1, 0, page), other);
}

TEST(ReceivedMemoryTest, DescriptorsThatCannotBeReadAreRefused) {
    const auto memory = anonymousMemory(page, page, 0);
    const OwnedDescriptor writing(
        ::open(("/proc/self/fd/" + std::to_string(memory.get())).c_str(), O_WRONLY | O_CLOEXEC));
    ASSERT_EQ(::fcntl(memory.get(), F_ADD_SEALS, allSeals), 0);
    EXPECT_EQ(refusal(writing), "expected memory that can be mapped, got Permission denied");
}

TEST(ReceivedMemoryTest, MemoryInHugePagesIsRefused) {
    const OwnedDescriptor huge(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING | MFD_HUGETLB));
    if (!huge) {
        GTEST_SKIP() << "the system has no huge pages";
    }
    EXPECT_EQ(refusal(huge), "expected a descriptor of anonymous memory, got one of another kind");
}

TEST(ReceivedMemoryTest, PartsLieWithinTheMemoryAndBeginAtAPage) {
    const auto memory = anonymousMemory(2 * page + 1, 2 * page + 1, allSeals);
    EXPECT_EQ(refusal(memory, 2 * page, 1), "taken");
    EXPECT_EQ(refusal(memory, 0, 2 * page + 1), "taken");
    EXPECT_EQ(refusal(memory, 0, 0), "expected 1 byte or more from a multiple of 4096 on, got 0 bytes from 0 on");
    EXPECT_EQ(refusal(memory, 1, 1), "expected 1 byte or more from a multiple of 4096 on, got 1 bytes from 1 on");
    EXPECT_EQ(refusal(memory, 0, 2 * page + 2), "expected 8194 bytes from 0 on, got memory of 8193 bytes");
    EXPECT_EQ(refusal(memory, 3 * page, 1), "expected 1 bytes from 12288 on, got memory of 8193 bytes");
    constexpr std::uint64_t most = std::numeric_limits<std::uint64_t>::max();
    EXPECT_EQ(refusal(memory, page, most),
              "expected 18446744073709551615 bytes from 4096 on, got memory of 8193 bytes");
    EXPECT_EQ(refusal(memory, most - page + 1, page),
              "expected 4096 bytes from 18446744073709547520 on, got memory of 8193 bytes");
}

TEST(ReceivedMemoryTest, SparseMemoryIsRefused) {
    EXPECT_EQ(refusal(anonymousMemory(100 * page, 99 * page, allSeals)), "expected 409600 allocated bytes, got 405504");
    EXPECT_EQ(refusal(anonymousMemory(std::size_t{1} << 28, 1, allSeals), 0, std::size_t{1} << 28),
              "expected 268435456 allocated bytes, got 4096");
}

TEST(ReceivedMemoryTest, MemoryIsNotTruncatedOnceItIsTaken) {
    const auto memory = anonymousMemory(page, page, allSeals);
    const ReceivedMemory received(memory.get(), 0, page);
    EXPECT_EQ(::ftruncate(memory.get(), 0), -1);
    EXPECT_EQ(errno, EPERM);
    EXPECT_EQ(received.data()[page - 1], 'm');
}

}  // namespace
}  // namespace foundation::vantor::carrier::shared_memory
