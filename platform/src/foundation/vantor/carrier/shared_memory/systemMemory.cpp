#include "foundation/vantor/carrier/shared_memory/systemMemory.hpp"

#include <sys/mman.h>

#include <cerrno>

namespace foundation::vantor::carrier::shared_memory {
namespace {

// An address from which on `size` bytes are reserved, as far from a large page's begin as `offset`; null when there is
// no room.
char* reserve(std::uint64_t offset, std::size_t size) noexcept {
    const std::size_t room = size + largePageSize;
    void* const memory = ::mmap(nullptr, room, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    if (memory == MAP_FAILED) {
        return nullptr;
    }
    char* const begin = static_cast<char*>(memory);
    const std::size_t before = (offset - reinterpret_cast<std::uintptr_t>(begin)) % largePageSize;
    const std::size_t needed = (size + pageSize - 1) / pageSize * pageSize;
    if (before != 0) {
        ::munmap(begin, before);
    }
    ::munmap(begin + before + needed, room - before - needed);
    return begin + before;
}

}  // namespace

char* map(int descriptor, std::uint64_t offset, std::size_t size, int flags) noexcept {
    char* const place = size < largePageSize ? nullptr : reserve(offset, size);
    void* const memory = ::mmap(place, size, PROT_READ | PROT_WRITE, flags | (place == nullptr ? 0 : MAP_FIXED),
                                descriptor, static_cast<off_t>(offset));
    if (memory == MAP_FAILED) {
        if (place != nullptr) {
            const int error = errno;
            ::munmap(place, size);
            errno = error;
        }
        return nullptr;
    }
    return static_cast<char*>(memory);
}

}  // namespace foundation::vantor::carrier::shared_memory
