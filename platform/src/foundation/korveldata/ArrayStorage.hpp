// The bytes that arrays share.
#pragma once

#include <atomic>
#include <cstddef>
#include <memory>

#include <boost/smart_ptr/intrusive_ptr.hpp>

namespace foundation::korveldata::detail {

/// Counts its shares itself: the count is what tells whether an array may write in place, so reading it must also make
/// visible whatever a former owner did, which the count of a std::shared_ptr does not promise. Frames hold shares
/// through a plain pointer and a plain function.
class ArrayStorage final {
  public:
    using Pointer = boost::intrusive_ptr<ArrayStorage>;
    using Buffer = std::unique_ptr<char[], void (*)(char*)>;

    /// A buffer of the BufferAllocator, its bytes undefined.
    static Pointer allocate(std::size_t size);

    /// Owns `buffer`; `writable` says whether nobody else reads it.
    static Pointer takeOver(Buffer buffer, bool writable);

    /// Reads `bytes` as long as `owner` is held.
    static Pointer overMemory(const char* bytes, std::shared_ptr<const void> owner);

    char* data() const noexcept { return data_; }

    /// True when a caller that holds a share may write: it holds the only one, and the bytes are nobody else's.
    bool writableInPlace() const noexcept { return writable_ && shares_.load(std::memory_order_acquire) == 1; }

    /// Gives up one share; the signature is the one that the BufferAllocator calls for adopted memory.
    static void dropShare(void* storage) noexcept;

  private:
    ArrayStorage(Buffer buffer, bool writable, char* data, std::shared_ptr<const void> owner) noexcept;

    friend void intrusive_ptr_add_ref(ArrayStorage* storage) noexcept;
    friend void intrusive_ptr_release(ArrayStorage* storage) noexcept;

    std::atomic<std::size_t> shares_{0};
    bool writable_;
    char* data_;
    Buffer buffer_;                      ///< null for memory of another owner
    std::shared_ptr<const void> owner_;  ///< null for a buffer
};

}  // namespace foundation::korveldata::detail
