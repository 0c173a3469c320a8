// Builds arrays.
#pragma once

#include <cstdint>
#include <memory>
#include <string_view>
#include <vector>

#include "foundation/korveldata/Array.hpp"

namespace foundation::korveldata {

/// Builds arrays whose elements live in 64-byte aligned buffers of the BufferAllocator. Carries no state; all members
/// may be called from any thread. Every member throws std::bad_alloc, and ArrayFormatError as checkedSizeInBytes()
/// does.
class ArrayFactory {
  public:
    /// All elements zero.
    Array createArray(ElementType type, const std::vector<std::uint64_t>& dimensions,
                      MemoryOrder order = MemoryOrder::RowMajor) const;

    /// A copy of `elements`, which are as many bytes as type and dimensions say. May be null when there are none.
    Array createArray(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                      const void* elements) const;

    /// One element, no dimensions.
    template <typename T>
    Array createScalar(const T& value) const {
        return createArray(ElementTypeOf<T>::value, {}, MemoryOrder::RowMajor, &value);
    }

    /// The code units of `text`, copied, as a row of 1 x their number.
    Array createText(std::u16string_view text) const;

    /// An array in `buffer` itself, not copied. The buffer must be one of the BufferAllocator and hold exactly the
    /// bytes that type and dimensions say; otherwise ArrayFormatError, the buffer released. It is released by its
    /// deleter when the last share is gone. A buffer that its allocator has adopted from another owner is never written
    /// to.
    Array fromBuffer(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                     std::unique_ptr<char[], void (*)(char*)> buffer) const;
};

}  // namespace foundation::korveldata
