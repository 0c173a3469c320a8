// The value type of array data.
//
// An Array is a description (element type, dimensions, memory order) and a share in the bytes of its elements. Copies
// share the bytes; whoever wants to write gets bytes of its own first, unless it is the only owner. So an array passes
// from a computation to a socket, and from a socket to a computation, without its elements being copied.
//
// Thread-safety is that of a plain value: different Array objects may be used from different threads even while they
// share bytes, and one object may be read by many.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

#include <boost/container/small_vector.hpp>
#include <boost/smart_ptr/intrusive_ptr.hpp>

#include "foundation/korveldata/ArrayFormatError.hpp"
#include "foundation/korveldata/ElementType.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::korveldata {

namespace detail {
class ArrayStorage;
/// Adds a share in the storage; from any thread.
void intrusive_ptr_add_ref(ArrayStorage* storage) noexcept;
/// Drops a share, and the storage with the last one; from any thread.
void intrusive_ptr_release(ArrayStorage* storage) noexcept;
}  // namespace detail

/// How an array's elements are laid out. Neither order costs a copy anywhere.
enum class MemoryOrder {
    RowMajor,     ///< the last index runs fastest
    ColumnMajor,  ///< the first index runs fastest
};

/// Most dimensions that an array may have.
inline constexpr std::size_t maxDimensions = 32;

/// Bytes of all elements of an array so described; 0 when a dimension is 0, whatever the others are. Throws
/// ArrayFormatError when the type has no size, there are more than maxDimensions dimensions, one of them or the number
/// of bytes is above 2^63 - 1.
std::uint64_t checkedSizeInBytes(ElementType type, std::span<const std::uint64_t> dimensions);

/// Elements of one type, with their dimensions and their order. Copies share the elements.
class Array final {
  public:
    /// 0 x 0 doubles.
    Array() noexcept;
    ~Array();

    /// Shares the elements; cheap for elements of any number.
    Array(const Array& other);
    /// Shares the elements of `other`, and drops the share in those that it had.
    Array& operator=(const Array& other);

    /// Leaves `other` as a default array.
    Array(Array&& other) noexcept;
    /// Drops the share in the elements that it had, and leaves `other` as a default array.
    Array& operator=(Array&& other) noexcept;

    /// An array over memory of another owner, without a copy: `elements` must stay valid and unchanged until `owner` is
    /// released, which happens on whatever thread drops the last share and must not throw. The memory is never written
    /// to. It may be null when there are no elements. Throws ArrayFormatError as checkedSizeInBytes() does.
    static Array overMemory(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                            const void* elements, std::shared_ptr<const void> owner);

    /// Type of the elements.
    ElementType elementType() const noexcept { return type_; }

    /// Extent of each dimension; none for a scalar. Valid until the array is assigned to or destroyed.
    std::span<const std::uint64_t> dimensions() const noexcept { return {dimensions_.data(), dimensions_.size()}; }

    /// How the elements are laid out.
    MemoryOrder order() const noexcept { return order_; }

    /// Product of the dimensions: 1 for a scalar.
    std::uint64_t numberOfElements() const noexcept;

    /// numberOfElements() times the size of one.
    std::uint64_t sizeInBytes() const noexcept;

    /// The elements, in order(). Never null, 64-byte aligned unless the array is over memory of another owner.
    const char* data() const noexcept;

    /// True when mutableData() would leave the elements where they are: nobody else shares them.
    bool writableInPlace() const noexcept;

    /// The elements, for writing until the array is next copied, lent, assigned to or destroyed. When they are shared,
    /// or another owner's, the array first gets a copy of its own; a sole owner's stay where they are. Throws
    /// std::bad_alloc, the array unchanged.
    char* mutableData();

    /// The elements as a frame's buffer, not copied: the address is data() (except for an array without elements, which
    /// lends an empty buffer), the deleter the plain function BufferAllocator::release. They live until that deleter
    /// ran, and count as shared until then. The borrower must not write to them. Throws std::bad_alloc.
    vantor::carrier::framing::FrameBuffer lendBuffer() const;

    /// The code units of a Char16 array, as they lie in memory. Throws ArrayFormatError for any other type.
    std::u16string toText() const;

    /// Same type, dimensions and elements, index by index: the memory order does not count. Elements are compared as
    /// bytes, so a NaN equals itself, and 0.0 differs from -0.0.
    friend bool operator==(const Array& left, const Array& right);

  private:
    friend class ArrayFactory;

    /// Room for the dimensions of most arrays without an allocation.
    using Dimensions = boost::container::small_vector<std::uint64_t, 4>;

    Array(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
          boost::intrusive_ptr<detail::ArrayStorage> storage);

    void becomeEmpty() noexcept;

    ElementType type_ = ElementType::Double;
    MemoryOrder order_ = MemoryOrder::RowMajor;
    Dimensions dimensions_{0, 0};
    boost::intrusive_ptr<detail::ArrayStorage> storage_;  ///< null only when there are no elements
};

}  // namespace foundation::korveldata
