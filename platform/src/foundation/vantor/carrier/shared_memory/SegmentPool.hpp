// The segments of a process: which are used, by whom they may be seen, and which wait to be used again.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <set>
#include <unordered_map>

#include "foundation/vantor/carrier/shared_memory/Segment.hpp"

namespace foundation::vantor::carrier::shared_memory {

/// Filling fresh memory takes several times as long as filling memory that was used before, so segments are kept.
///
/// Whoever has once been shown a segment may go on looking at it. So a segment is shown to one viewer only, as long as
/// it exists, and what earlier users of this process left behind the end of the present bytes is cleared.
///
/// All members may be called from any thread.
class SegmentPool {
  public:
    /// One that segments are shown to: a session, by a number that no other has.
    using Viewer = std::uint64_t;

    struct Bounds {
        std::size_t segments = 32;                     ///< that exist: each holds a descriptor
        std::size_t idleBytes = 256U << 20;            ///< kept while nobody uses them
        std::size_t copyBytes = std::size_t{1} << 30;  ///< of all segments, above which no new ones are made for copies
    };

    /// The pool that BufferAllocator and all sessions of the process share. Never destroyed.
    static SegmentPool& ofProcess();

    explicit SegmentPool(const Bounds& bounds);
    SegmentPool(const SegmentPool&) = delete;
    SegmentPool& operator=(const SegmentPool&) = delete;

    /// A viewer from now on. `arrays`: it is to be shown arrays that this process makes, so take() is worth calling.
    Viewer addViewer(bool arrays);

    /// The viewer is not shown anything more, but may go on looking: no segment that it has seen is used again, and
    /// what is written to those in use is hidden from it.
    void removeViewer(Viewer viewer);

    /// Whether there is a viewer for arrays.
    bool wantsArrays() const noexcept { return wantsArrays_.load(std::memory_order_relaxed); }

    /// Memory of at least `size` bytes to be filled and perhaps shown; null when a bound is reached or the system has
    /// none. Contents are undefined. To be given back.
    char* take(std::size_t size);

    /// The same for bytes that exist elsewhere and need not be copied: only memory that pays. So fresh memory is had
    /// only when as much was asked for before, and only what will be kept. `viewer` is the one it is to be shown to.
    char* takeForCopy(std::size_t size, Viewer viewer);

    /// Nobody reads or writes the memory any more, viewers included.
    void giveBack(char* memory);

    /// Gives segments back to the system that nobody has used since `before`.
    void trim(std::chrono::steady_clock::time_point before);

    /// The descriptor of memory that was taken, by which `viewer` may see it from now on. None for memory that is not
    /// of this pool or must not be shown to this one.
    Segment::Descriptor show(const char* memory, Viewer viewer);

    /// Somebody will go on looking at this memory, unknown for how long: it is neither shown nor used again, and what
    /// is written to it from now on is hidden.
    void hide(const char* memory);

    /// Bytes of all segments. Without a lock.
    std::size_t bytes() const noexcept { return bytes_.load(std::memory_order_relaxed); }

    /// Segments that exist, and how many of them are used; for tests.
    std::size_t size() const;
    std::size_t inUse() const;

  private:
    struct Entry {
        std::unique_ptr<Segment> segment;
        Viewer viewer = 0;      // 0: nobody has seen it
        std::size_t dirty = 0;  // bytes from the start that may have been written to
        bool hidden = false;
        std::chrono::steady_clock::time_point idleSince;
    };
    using Entries = std::list<Entry>;

    template <class Accept>
    char* takeIdle(std::size_t capacity, std::size_t size, Accept accept);
    char* addSegment(std::unique_lock<std::mutex>& lock, std::size_t capacity, std::size_t size);
    char* use(Entries& from, Entries::iterator entry, std::size_t size);
    void forget(Entries& from, Entries::iterator entry, Entries& doomed);
    void forgetOldestIdle(Entries& doomed);

    const Bounds bounds_;
    std::atomic<bool> wantsArrays_{false};

    mutable std::mutex mutex_;
    Viewer lastViewer_ = 0;
    std::set<Viewer> arrayViewers_;
    Entries used_;
    std::unordered_map<const char*, Entries::iterator> byAddress_;  // of used_
    Entries idle_;                                                  // the latest first
    std::size_t idleBytes_ = 0;
    std::size_t segments_ = 0;           // that exist or are being made
    std::atomic<std::size_t> bytes_{0};  // of all of these; changed with the mutex held
    std::set<std::size_t> askedFor_;     // capacities of copies that were not made
};

}  // namespace foundation::vantor::carrier::shared_memory
