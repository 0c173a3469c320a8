#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

#include <sys/mman.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <iterator>
#include <limits>
#include <list>
#include <mutex>
#include <new>
#include <unordered_map>
#include <vector>

#include "foundation/core/diag/terminate.hpp"
#include "foundation/vantor/carrier/framing/forbiddenMemory.hpp"
#include "foundation/vantor/carrier/framing/largeBuffers.hpp"
#include "foundation/vantor/carrier/shared_memory/SegmentPool.hpp"

namespace foundation::vantor::carrier::framing {
namespace {

using Clock = std::chrono::steady_clock;
using shared_memory::SegmentPool;

constexpr std::size_t alignment = 64;
constexpr std::size_t pageSize = 4096;

// From this size on a buffer is put into pages of 2 MiB: one fault instead of 512, and fewer searches for where a page
// is.
constexpr std::size_t largePagesFrom = 4U << 20;

// Bytes kept for recycling, in whole buffers. Sanitizers see that a buffer is used after its release: the one for
// addresses is told what nobody may use, and a race with its next owner is one.
constexpr std::size_t recycleBound = 256U << 20;

// One holder of an address: an allocation of our own, or memory of another owner.
struct Record {
    std::size_t size = 0;
    std::size_t capacity = 0;             // bytes mapped; 0 when the memory is from the heap or another owner's
    void (*drop)(void* owner) = nullptr;  // null for memory of our own
    void* owner = nullptr;
    Adoption adoption = Adoption::Borrowed;
};

struct Entry {
    Record latest;
    std::vector<Record> earlier;
};

struct Shard {
    std::mutex mutex;
    std::unordered_map<const char*, Entry> entries;
};

struct Kept {
    char* buffer;
    std::size_t capacity;
    Clock::time_point since;
};

// The latest first. At most recycleBound / largeSize elements, so a search from the front is quick.
struct Recycled {
    std::mutex mutex;
    std::list<Kept> kept;
    std::size_t bytes = 0;
};

// Buffers may be released by destructors of static objects, so none of this is ever destroyed.
std::array<Shard, 16>& shards() {
    static auto* const all = new std::array<Shard, 16>();
    return *all;
}

Recycled& recycled() {
    static auto* const all = new Recycled();
    return *all;
}

std::atomic<std::size_t> buffersInUse{0};
std::atomic<std::size_t> bytesMapped{0};  // in use or kept

Shard& shardOf(const char* address) {
    // Small buffers differ in the bits above the alignment, large ones in those above the page.
    const auto bits = reinterpret_cast<std::uintptr_t>(address);
    return shards()[(bits / alignment ^ bits / pageSize ^ bits / largeSize) % shards().size()];
}

char* map(std::size_t capacity) {
    // No swap is reserved: a size is only what a peer claims until the bytes have come.
    void* const memory =
        ::mmap(nullptr, capacity, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) {
        throw std::bad_alloc();
    }
    bytesMapped.fetch_add(capacity, std::memory_order_relaxed);
    if (capacity >= largePagesFrom) {
        // As far as the system has them to give.
        ::madvise(memory, capacity, MADV_HUGEPAGE);
    }
    return static_cast<char*>(memory);
}

void unmap(char* memory, std::size_t capacity) {
    ::munmap(memory, capacity);
    bytesMapped.fetch_sub(capacity, std::memory_order_relaxed);
}

void unmap(const std::list<Kept>& all) {
    for (const Kept& each : all) {
        // What is mapped there next is somebody else's.
        allow(each.buffer, each.capacity);
        unmap(each.buffer, each.capacity);
    }
}

char* takeRecycled(std::size_t capacity) {
    Recycled& all = recycled();
    const std::lock_guard lock(all.mutex);
    const auto found = std::find_if(all.kept.begin(), all.kept.end(),
                                    [capacity](const Kept& kept) { return kept.capacity == capacity; });
    if (found == all.kept.end()) {
        return nullptr;
    }
    char* const buffer = found->buffer;
    all.kept.erase(found);
    all.bytes -= capacity;
    return buffer;
}

// Takes out what has waited longest, as long as that is to be evicted. With the mutex held.
template <class Condition>
std::list<Kept> evict(Recycled& all, Condition condition) {
    std::list<Kept> evicted;
    while (!all.kept.empty() && condition(all.kept.back())) {
        all.bytes -= all.kept.back().capacity;
        evicted.splice(evicted.begin(), all.kept, std::prev(all.kept.end()));
    }
    return evicted;
}

// Keeps a buffer in place of those that have waited longest; returns these, which must be unmapped.
std::list<Kept> keep(char* buffer, std::size_t capacity) {
    std::list<Kept> node;
    if (capacity > recycleBound) {
        unmap(buffer, capacity);
        return node;
    }
    try {
        node.push_back({buffer, capacity, Clock::now()});
    } catch (const std::bad_alloc&) {
        unmap(buffer, capacity);
        return node;
    }
    forbid(buffer, capacity);
    Recycled& all = recycled();
    const std::lock_guard lock(all.mutex);
    all.kept.splice(all.kept.begin(), node);
    all.bytes += capacity;
    return evict(all, [&all](const Kept&) { return all.bytes > recycleBound; });
}

char* obtain(std::size_t size, std::size_t& capacity) {
    capacity = 0;
    if (size > static_cast<std::size_t>(std::numeric_limits<std::ptrdiff_t>::max()) / 2) {
        throw std::bad_alloc();
    }
    if (size < largeSize) {
        const std::size_t rounded = size == 0 ? alignment : (size + alignment - 1) / alignment * alignment;
        void* const memory = std::aligned_alloc(alignment, rounded);
        if (memory == nullptr) {
            throw std::bad_alloc();
        }
        return static_cast<char*>(memory);
    }
    capacity = capacityFor(size);
    char* buffer = takeRecycled(capacity);
    if (buffer != nullptr) {
        allow(buffer, size);
    } else {
        buffer = map(capacity);
    }
    forbid(buffer + size, capacity - size);
    return buffer;
}

void giveBack(char* buffer, std::size_t size, std::size_t capacity) {
    if (capacity == 0) {
        std::free(buffer);
        return;
    }
    allow(buffer + size, capacity - size);
    unmap(keep(buffer, capacity));
}

void enter(const char* address, const Record& record) {
    Shard& shard = shardOf(address);
    const std::lock_guard lock(shard.mutex);
    const auto [found, fresh] = shard.entries.try_emplace(address);
    if (!fresh) {
        found->second.earlier.push_back(found->second.latest);
    }
    found->second.latest = record;
    buffersInUse.fetch_add(1, std::memory_order_relaxed);
}

// How the bytes were adopted; empty for memory of our own and for addresses that are not in use.
std::optional<Adoption> adoptionOf(const char* buffer) {
    Shard& shard = shardOf(buffer);
    const std::lock_guard lock(shard.mutex);
    const auto found = shard.entries.find(buffer);
    if (found == shard.entries.end() || found->second.latest.drop == nullptr) {
        return std::nullopt;
    }
    return found->second.latest.adoption;
}

}  // namespace

char* BufferAllocator::allocate(std::size_t size) {
    Record record;
    char* const buffer = obtain(size, record.capacity);
    record.size = size;
    try {
        enter(buffer, record);
    } catch (...) {
        giveBack(buffer, size, record.capacity);
        throw;
    }
    return buffer;
}

char* BufferAllocator::allocateToSend(std::size_t size) {
    SegmentPool& pool = SegmentPool::ofProcess();
    char* const memory = size >= largeSize && pool.wantsArrays() ? pool.take(size) : nullptr;
    if (memory == nullptr) {
        return allocate(size);
    }
    const auto giveBack = [](void* owner) { SegmentPool::ofProcess().giveBack(static_cast<char*>(owner)); };
    try {
        return adopt(memory, size, giveBack, memory, Adoption::Owned);
    } catch (...) {
        giveBack(memory);
        throw;
    }
}

void BufferAllocator::release(char* buffer) {
    if (buffer == nullptr) {
        return;
    }
    Record record;
    {
        Shard& shard = shardOf(buffer);
        const std::lock_guard lock(shard.mutex);
        const auto found = shard.entries.find(buffer);
        if (found == shard.entries.end()) {
            core::diag::terminate("BufferAllocator::release: the address is not that of a buffer in use", __FILE__,
                                  __LINE__, __func__);
        }
        Entry& entry = found->second;
        record = entry.latest;
        if (entry.earlier.empty()) {
            shard.entries.erase(found);
        } else {
            entry.latest = entry.earlier.back();
            entry.earlier.pop_back();
        }
    }
    buffersInUse.fetch_sub(1, std::memory_order_relaxed);
    // Without the lock: a drop function may release or adopt other buffers.
    if (record.drop != nullptr) {
        record.drop(record.owner);
    } else {
        giveBack(buffer, record.size, record.capacity);
    }
}

std::optional<std::size_t> BufferAllocator::sizeOf(const char* buffer) {
    Shard& shard = shardOf(buffer);
    const std::lock_guard lock(shard.mutex);
    const auto found = shard.entries.find(buffer);
    return found == shard.entries.end() ? std::nullopt : std::optional(found->second.latest.size);
}

char* BufferAllocator::adopt(char* address, std::size_t size, void (*drop)(void* owner), void* owner,
                             Adoption adoption) {
    enter(address, Record{size, 0, drop, owner, adoption});
    return address;
}

bool BufferAllocator::isAdopted(const char* buffer) {
    return adoptionOf(buffer) == Adoption::Borrowed;
}

bool BufferAllocator::isForeign(const char* buffer) {
    return adoptionOf(buffer) == Adoption::Foreign;
}

FrameBuffer BufferAllocator::makeFrameBuffer(std::size_t size) {
    return {std::unique_ptr<char[], std::function<void(char*)>>(allocate(size), &BufferAllocator::release), size};
}

std::size_t BufferAllocator::largeBytes() {
    return bytesMapped.load(std::memory_order_relaxed) + SegmentPool::ofProcess().bytes();
}

void BufferAllocator::trim(Clock::duration unused) {
    const Clock::time_point before = Clock::now() - unused;
    SegmentPool::ofProcess().trim(before);
    Recycled& all = recycled();
    std::unique_lock lock(all.mutex);
    const std::list<Kept> evicted = evict(all, [before](const Kept& kept) { return kept.since <= before; });
    lock.unlock();
    unmap(evicted);
}

std::size_t BufferAllocator::inUse() {
    return buffersInUse.load(std::memory_order_relaxed);
}

}  // namespace foundation::vantor::carrier::framing
