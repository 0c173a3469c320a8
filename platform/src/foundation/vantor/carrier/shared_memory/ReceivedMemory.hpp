// Memory that another process has filled and handed over as a descriptor.
#pragma once

#include <cstddef>
#include <cstdint>
#include <stdexcept>

namespace foundation::vantor::carrier::shared_memory {

/// A descriptor is not what it has to be. The text says what was expected and what was got.
class MemoryRefused : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

/// A part of another process's memory, mapped here. What is written here stays here. Bytes that were not written here
/// show what the other process has in them, which an honest one does not change until it is told that this mapping is
/// gone; a dishonest one may change them at any time. Movable.
class ReceivedMemory {
  public:
    /// Maps `size` bytes from `offset` on. The descriptor stays the caller's and is not needed afterwards. Throws
    /// MemoryRefused unless it is anonymous memory that can neither shrink nor grow nor be written through its
    /// descriptor, the part lies within it and begins at a page, and as many bytes are allocated as it is long: a
    /// sparse one would have its memory allocated by whoever reads it. Throws std::bad_alloc when there is no room.
    ReceivedMemory(int descriptor, std::uint64_t offset, std::uint64_t size);
    ~ReceivedMemory();
    ReceivedMemory(ReceivedMemory&& other) noexcept;
    ReceivedMemory& operator=(ReceivedMemory&&) = delete;

    char* data() const noexcept { return data_; }
    std::size_t size() const noexcept { return size_; }

  private:
    char* data_;
    std::size_t size_;
};

}  // namespace foundation::vantor::carrier::shared_memory
