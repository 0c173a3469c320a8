// Memory that this process fills and others read.
#pragma once

#include <cstddef>
#include <memory>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace foundation::vantor::carrier::shared_memory {

/// Anonymous memory with a descriptor that another process can be given. Only this object's own mapping can ever write
/// to it: whoever has the descriptor can map it for reading, or privately, and can neither shorten it nor punch holes.
/// All of its memory is allocated from the start, so a reader causes no allocation and no fault. The kernel frees it
/// when the last mapping and the last descriptor are gone, however their processes end.
///
/// A forked child shares the mapping: what either process writes, both see.
///
/// Not synchronised.
class Segment {
  public:
    /// `size` bytes, rounded up to whole pages; null when the system cannot give that much (or may not, RLIMIT_FSIZE),
    /// has no descriptor left, or lacks one of the seals.
    static std::unique_ptr<Segment> create(std::size_t size);
    ~Segment();
    Segment(const Segment&) = delete;
    Segment& operator=(const Segment&) = delete;

    char* data() const noexcept { return data_; }
    std::size_t size() const noexcept { return size_; }

    /// By which others see the memory; none once it is detached. It is closed when nobody has a share in it any more.
    using Descriptor = std::shared_ptr<const core::posix::OwnedDescriptor>;
    const Descriptor& descriptor() const noexcept { return descriptor_; }

    /// From now on nobody else sees what is written here; the bytes stay as they are, for all sides. Final. Safe while
    /// other threads read. Returns false, and has changed nothing, when the system refuses.
    bool detach() noexcept;

  private:
    Segment(Descriptor descriptor, char* data, std::size_t size) noexcept;

    Descriptor descriptor_;
    char* data_;
    std::size_t size_;
};

}  // namespace foundation::vantor::carrier::shared_memory
