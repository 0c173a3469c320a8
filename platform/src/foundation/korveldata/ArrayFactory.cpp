#include "foundation/korveldata/ArrayFactory.hpp"

#include <cstring>
#include <optional>
#include <utility>

#include "foundation/korveldata/ArrayStorage.hpp"
#include "foundation/korveldata/describe.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::korveldata {

using detail::ArrayStorage;
using vantor::carrier::framing::BufferAllocator;

namespace {

ArrayStorage::Pointer allocate(std::uint64_t bytes) {
    return bytes == 0 ? nullptr : ArrayStorage::allocate(bytes);
}

}  // namespace

Array ArrayFactory::createArray(ElementType type, const std::vector<std::uint64_t>& dimensions,
                                MemoryOrder order) const {
    const std::uint64_t bytes = checkedSizeInBytes(type, dimensions);
    ArrayStorage::Pointer storage = allocate(bytes);
    if (storage) {
        std::memset(storage->data(), 0, bytes);
    }
    return Array(type, dimensions, order, std::move(storage));
}

Array ArrayFactory::createArray(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                                const void* elements) const {
    const std::uint64_t bytes = checkedSizeInBytes(type, dimensions);
    if (bytes != 0 && elements == nullptr) {
        throw ArrayFormatError("Array: " + describe(type, dimensions) + " from a null address");
    }
    ArrayStorage::Pointer storage = allocate(bytes);
    if (storage) {
        std::memcpy(storage->data(), elements, bytes);
    }
    return Array(type, dimensions, order, std::move(storage));
}

Array ArrayFactory::createText(std::u16string_view text) const {
    return createArray(ElementType::Char16, {1, text.size()}, MemoryOrder::RowMajor, text.data());
}

Array ArrayFactory::fromBuffer(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                               std::unique_ptr<char[], void (*)(char*)> buffer) const {
    const std::uint64_t expected = checkedSizeInBytes(type, dimensions);
    const std::optional<std::size_t> size = BufferAllocator::sizeOf(buffer.get());
    if (!size) {
        throw ArrayFormatError("Array: " + describe(type, dimensions) +
                               " in a buffer that is not the BufferAllocator's, so that its length is not known");
    }
    if (*size != expected) {
        throw ArrayFormatError("Array: " + describe(type, dimensions) + " needs " + std::to_string(expected) +
                               " bytes; the buffer has " + std::to_string(*size));
    }
    const bool writable = !BufferAllocator::isAdopted(buffer.get());
    return Array(type, dimensions, order,
                 expected == 0 ? nullptr : ArrayStorage::takeOver(std::move(buffer), writable));
}

}  // namespace foundation::korveldata
