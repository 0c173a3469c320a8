// Counts what the whole program allocates with operator new while an AllocationRecorder lives, and makes a chosen
// allocation fail. Linking this unit replaces the program's operator new and delete.
#pragma once

#include <cstddef>
#include <vector>

/// Records the allocations of the thread that made it, from construction to stop() or destruction. One per thread at a
/// time.
class AllocationRecorder {
  public:
    /// `failing` is the number of the allocation that throws std::bad_alloc, counted from 0; none by default.
    explicit AllocationRecorder(long failing = -1) noexcept;
    ~AllocationRecorder();
    AllocationRecorder(const AllocationRecorder&) = delete;
    AllocationRecorder& operator=(const AllocationRecorder&) = delete;

    /// Ends the recording; the numbers stay.
    void stop() noexcept;

    std::size_t allocations() const noexcept { return allocations_; }
    std::size_t bytes() const noexcept { return bytes_; }

    /// Bytes asked for by a single allocation, at most.
    std::size_t largest() const noexcept { return largest_; }

    /// Bytes in use at once, at most, of those allocated meanwhile. Releases of older ones count down.
    std::size_t peak() const noexcept { return peak_; }

    /// Allocations of arrays (new[]), and the size of the last of them.
    std::size_t arrays() const noexcept { return arrays_; }
    std::size_t lastArray() const noexcept { return lastArray_; }

    /// Allocations without their release, and releases of older ones counted down.
    long outstanding() const noexcept { return outstanding_; }

    /// Whether an allocation of this program begins at `address`, recorded or not. An object of its own begins one; an
    /// object that shares its memory with a reference count does not. `address` must be that of a whole object on the
    /// heap.
    static bool beginsAt(const void* address) noexcept;

    /// Whether the chosen allocation was reached and failed.
    bool failed() const noexcept { return failed_; }

  private:
    friend struct AllocationHooks;

    std::size_t allocations_ = 0;
    std::size_t bytes_ = 0;
    std::size_t largest_ = 0;
    std::ptrdiff_t held_ = 0;
    std::size_t peak_ = 0;
    std::size_t arrays_ = 0;
    std::size_t lastArray_ = 0;
    long outstanding_ = 0;
    long failing_;
    bool failed_ = false;
};
