#include "foundation/vantor/carrier/shared_memory/ReceivedMemory.hpp"

#include <linux/magic.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include <cerrno>
#include <limits>
#include <new>
#include <string>
#include <system_error>
#include <utility>

#include "foundation/vantor/carrier/shared_memory/systemMemory.hpp"

namespace foundation::vantor::carrier::shared_memory {
namespace {

constexpr std::uint64_t blockSize = 512;  // of st_blocks

[[noreturn]] void refuse(const std::string& expected, const std::string& got) {
    throw MemoryRefused("expected " + expected + ", got " + got);
}

std::string sealNames(int seals) {
    std::string names;
    const auto add = [&](int seal, const char* name) {
        if ((seals & seal) != 0) {
            names += (names.empty() ? "" : ", ") + std::string(name);
        }
    };
    add(F_SEAL_SHRINK, "SHRINK");
    add(F_SEAL_GROW, "GROW");
    add(F_SEAL_WRITE, "WRITE");
    add(F_SEAL_FUTURE_WRITE, "FUTURE_WRITE");
    add(F_SEAL_SEAL, "SEAL");
    return names.empty() ? "none" : names;
}

// The seals first: with them, nothing that is found out afterwards can change.
void check(int descriptor, std::uint64_t offset, std::uint64_t size) {
    const int seals = ::fcntl(descriptor, F_GET_SEALS);
    struct statfs system {};
    struct stat status {};
    // Memory in huge pages can be sealed too, but has other sizes.
    if (seals < 0 || ::fstatfs(descriptor, &system) != 0 || system.f_type != TMPFS_MAGIC ||
        ::fstat(descriptor, &status) != 0) {
        refuse("a descriptor of anonymous memory", "one of another kind");
    }
    if ((seals & requiredSeals) != requiredSeals) {
        refuse("the seals " + sealNames(requiredSeals), sealNames(seals));
    }
    if (size == 0 || offset % pageSize != 0) {
        refuse("1 byte or more from a multiple of " + std::to_string(pageSize) + " on",
               std::to_string(size) + " bytes from " + std::to_string(offset) + " on");
    }
    const auto length = static_cast<std::uint64_t>(status.st_size);
    if (offset > length || size > length - offset) {
        refuse(std::to_string(size) + " bytes from " + std::to_string(offset) + " on",
               "memory of " + std::to_string(length) + " bytes");
    }
    const std::uint64_t allocated = static_cast<std::uint64_t>(status.st_blocks) * blockSize;
    if (allocated < length) {
        refuse(std::to_string(length) + " allocated bytes", std::to_string(allocated));
    }
}

char* checkAndMap(int descriptor, std::uint64_t offset, std::uint64_t size) {
    check(descriptor, offset, size);
    // Writable: only pages that are written to cost memory of this process, so none is reserved for the others.
    char* const memory = map(descriptor, offset, size, MAP_PRIVATE | MAP_NORESERVE);
    if (memory == nullptr) {
        if (errno == ENOMEM) {
            throw std::bad_alloc();
        }
        refuse("memory that can be mapped", std::generic_category().message(errno));
    }
    return memory;
}

}  // namespace

ReceivedMemory::ReceivedMemory(int descriptor, std::uint64_t offset, std::uint64_t size)
    : data_(checkAndMap(descriptor, offset, size)), size_(size) {}

ReceivedMemory::ReceivedMemory(ReceivedMemory&& other) noexcept
    : data_(std::exchange(other.data_, nullptr)), size_(other.size_) {}

ReceivedMemory::~ReceivedMemory() {
    if (data_ != nullptr) {
        ::munmap(data_, size_);
    }
}

}  // namespace foundation::vantor::carrier::shared_memory
