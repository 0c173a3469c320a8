#include "foundation/vantor/carrier/shared_memory/SegmentPool.hpp"

#include <algorithm>
#include <cstring>
#include <iterator>
#include <utility>

#include "foundation/vantor/carrier/framing/largeBuffers.hpp"

namespace foundation::vantor::carrier::shared_memory {

SegmentPool& SegmentPool::ofProcess() {
    static auto* const pool = new SegmentPool(Bounds());
    return *pool;
}

SegmentPool::SegmentPool(const Bounds& bounds) : bounds_(bounds) {}

SegmentPool::Viewer SegmentPool::addViewer(bool arrays) {
    const std::lock_guard lock(mutex_);
    ++lastViewer_;
    if (arrays) {
        arrayViewers_.insert(lastViewer_);
        wantsArrays_ = true;
    }
    return lastViewer_;
}

void SegmentPool::removeViewer(Viewer viewer) {
    Entries doomed;  // unmapped without the lock
    const std::lock_guard lock(mutex_);
    arrayViewers_.erase(viewer);
    wantsArrays_ = !arrayViewers_.empty();
    for (auto entry = idle_.begin(); entry != idle_.end();) {
        const auto next = std::next(entry);
        if (entry->viewer == viewer) {
            idleBytes_ -= entry->segment->size();
            forget(idle_, entry, doomed);
        }
        entry = next;
    }
    for (Entry& entry : used_) {
        if (entry.viewer == viewer) {
            entry.hidden = true;
            entry.segment->detach();
        }
    }
}

char* SegmentPool::take(std::size_t size) {
    const std::size_t capacity = framing::capacityFor(size);
    std::unique_lock lock(mutex_);
    // With several viewers nobody knows yet which of them the bytes are for.
    const Viewer only = arrayViewers_.size() == 1 ? *arrayViewers_.begin() : 0;
    char* const memory =
        takeIdle(capacity, size, [only](const Entry& entry) { return entry.viewer == only || entry.viewer == 0; });
    return memory != nullptr ? memory : addSegment(lock, capacity, size);
}

char* SegmentPool::takeForCopy(std::size_t size, Viewer viewer) {
    const std::size_t capacity = framing::capacityFor(size);
    if (capacity > bounds_.idleBytes) {
        return nullptr;
    }
    std::unique_lock lock(mutex_);
    char* const memory =
        takeIdle(capacity, size, [viewer](const Entry& entry) { return entry.viewer == viewer || entry.viewer == 0; });
    if (memory != nullptr) {
        return memory;
    }
    if (bytes_ + capacity > bounds_.copyBytes || askedFor_.insert(capacity).second) {
        return nullptr;
    }
    return addSegment(lock, capacity, size);
}

template <class Accept>
char* SegmentPool::takeIdle(std::size_t capacity, std::size_t size, Accept accept) {
    const auto found = std::find_if(idle_.begin(), idle_.end(), [&](const Entry& entry) {
        return entry.segment->size() == capacity && accept(entry);
    });
    if (found == idle_.end()) {
        return nullptr;
    }
    idleBytes_ -= capacity;
    if (size < found->dirty) {
        std::memset(found->segment->data() + size, 0, found->dirty - size);
    }
    return use(idle_, found, size);
}

char* SegmentPool::addSegment(std::unique_lock<std::mutex>& lock, std::size_t capacity, std::size_t size) {
    Entries doomed;
    if (segments_ >= bounds_.segments && !idle_.empty()) {
        forgetOldestIdle(doomed);
    }
    if (segments_ >= bounds_.segments) {
        return nullptr;
    }
    Entries fresh(1);
    ++segments_;
    bytes_ += capacity;
    // The system takes its time for this.
    lock.unlock();
    doomed.clear();
    fresh.front().segment = Segment::create(capacity);
    lock.lock();
    if (!fresh.front().segment) {
        --segments_;
        bytes_ -= capacity;
        return nullptr;
    }
    return use(fresh, fresh.begin(), size);
}

char* SegmentPool::use(Entries& from, Entries::iterator entry, std::size_t size) {
    char* const memory = entry->segment->data();
    byAddress_.emplace(memory, entry);
    used_.splice(used_.begin(), from, entry);
    entry->dirty = size;
    return memory;
}

void SegmentPool::forget(Entries& from, Entries::iterator entry, Entries& doomed) {
    --segments_;
    bytes_ -= entry->segment->size();
    doomed.splice(doomed.end(), from, entry);
}

void SegmentPool::forgetOldestIdle(Entries& doomed) {
    idleBytes_ -= idle_.back().segment->size();
    forget(idle_, std::prev(idle_.end()), doomed);
}

void SegmentPool::giveBack(char* memory) {
    Entries doomed;
    const std::lock_guard lock(mutex_);
    const auto found = byAddress_.find(memory);
    const Entries::iterator entry = found->second;
    byAddress_.erase(found);
    if (entry->hidden || entry->segment->size() > bounds_.idleBytes) {
        forget(used_, entry, doomed);
        return;
    }
    idleBytes_ += entry->segment->size();
    entry->idleSince = std::chrono::steady_clock::now();
    idle_.splice(idle_.begin(), used_, entry);
    while (idleBytes_ > bounds_.idleBytes) {
        forgetOldestIdle(doomed);
    }
}

void SegmentPool::trim(std::chrono::steady_clock::time_point before) {
    Entries doomed;  // unmapped without the lock
    const std::lock_guard lock(mutex_);
    while (!idle_.empty() && idle_.back().idleSince <= before) {
        forgetOldestIdle(doomed);
    }
}

Segment::Descriptor SegmentPool::show(const char* memory, Viewer viewer) {
    const std::lock_guard lock(mutex_);
    const auto found = byAddress_.find(memory);
    if (found == byAddress_.end()) {
        return {};
    }
    Entry& entry = *found->second;
    if (entry.hidden || (entry.viewer != 0 && entry.viewer != viewer)) {
        return {};
    }
    entry.viewer = viewer;
    return entry.segment->descriptor();
}

void SegmentPool::hide(const char* memory) {
    const std::lock_guard lock(mutex_);
    if (const auto found = byAddress_.find(memory); found != byAddress_.end()) {
        found->second->hidden = true;
        found->second->segment->detach();
    }
}

std::size_t SegmentPool::size() const {
    const std::lock_guard lock(mutex_);
    return segments_;
}

std::size_t SegmentPool::inUse() const {
    const std::lock_guard lock(mutex_);
    return used_.size();
}

}  // namespace foundation::vantor::carrier::shared_memory
