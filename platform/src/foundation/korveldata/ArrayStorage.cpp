#include "foundation/korveldata/ArrayStorage.hpp"

#include <utility>

#include "foundation/korveldata/Array.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::korveldata::detail {

using vantor::carrier::framing::BufferAllocator;

ArrayStorage::ArrayStorage(Buffer buffer, bool writable, char* data, std::shared_ptr<const void> owner) noexcept
    : writable_(writable), data_(data), buffer_(std::move(buffer)), owner_(std::move(owner)) {}

ArrayStorage::Pointer ArrayStorage::allocate(std::size_t size) {
    return takeOver(Buffer(BufferAllocator::allocateToSend(size), &BufferAllocator::release), true);
}

ArrayStorage::Pointer ArrayStorage::takeOver(Buffer buffer, bool writable) {
    char* const data = buffer.get();
    return Pointer(new ArrayStorage(std::move(buffer), writable, data, nullptr));
}

ArrayStorage::Pointer ArrayStorage::overMemory(const char* bytes, std::shared_ptr<const void> owner) {
    // Never written to: such storage is not writable in place.
    return Pointer(new ArrayStorage(Buffer(nullptr, &BufferAllocator::release), false, const_cast<char*>(bytes),
                                    std::move(owner)));
}

void ArrayStorage::dropShare(void* storage) noexcept {
    intrusive_ptr_release(static_cast<ArrayStorage*>(storage));
}

void intrusive_ptr_add_ref(ArrayStorage* storage) noexcept {
    storage->shares_.fetch_add(1, std::memory_order_relaxed);
}

void intrusive_ptr_release(ArrayStorage* storage) noexcept {
    if (storage->shares_.fetch_sub(1, std::memory_order_acq_rel) == 1) {
        delete storage;
    }
}

}  // namespace foundation::korveldata::detail
