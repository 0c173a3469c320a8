#include "foundation/vantor/carrier/shared_memory/Segment.hpp"

#include <linux/mman.h>
#include <sys/mman.h>
#include <sys/resource.h>

#include <limits>
#include <new>
#include <utility>

#include "foundation/vantor/carrier/shared_memory/systemMemory.hpp"

namespace foundation::vantor::carrier::shared_memory {
namespace {

// A file that grows beyond this limit ends its process by a signal, and anonymous memory counts as a file.
bool isWithinFileSizeLimit(std::size_t size) {
    rlimit limit{};
    return ::getrlimit(RLIMIT_FSIZE, &limit) == 0 && size <= limit.rlim_cur;
}

// The system waits for all its processors before it makes large pages, which only pays for many at once.
constexpr std::size_t leastForLargePages = 8 * largePageSize;

// As far as the system has large pages to give. Filling them takes a third of the time, and whoever maps them, each
// reader again, takes one fault where there would be 32.
void useLargePages(char* memory, std::size_t size) {
    if (size < leastForLargePages) {
        return;
    }
    const std::size_t whole = size / largePageSize * largePageSize;
    // A large page takes the place of others, of one at least.
    for (std::size_t at = 0; at < whole; at += largePageSize) {
        if (::madvise(memory + at, pageSize, MADV_POPULATE_WRITE) != 0) {
            return;
        }
    }
    ::madvise(memory, whole, MADV_COLLAPSE);
}

}  // namespace

Segment::Segment(Descriptor descriptor, char* data, std::size_t size) noexcept
    : descriptor_(std::move(descriptor)), data_(data), size_(size) {}

std::unique_ptr<Segment> Segment::create(std::size_t size) {
    if (size == 0 || size > static_cast<std::size_t>(std::numeric_limits<off_t>::max()) - pageSize) {
        return nullptr;
    }
    size = (size + pageSize - 1) / pageSize * pageSize;
    core::posix::OwnedDescriptor descriptor(::memfd_create("krutil-array", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!descriptor || !isWithinFileSizeLimit(size) || ::ftruncate(descriptor.get(), static_cast<off_t>(size)) != 0) {
        return nullptr;
    }
    // Mapped before it is sealed: this is the one mapping that may write.
    char* const memory = map(descriptor.get(), 0, size, MAP_SHARED);
    if (memory == nullptr) {
        return nullptr;
    }
    useLargePages(memory, size);
    // Through the mapping, so that the memory counts as this process's: memory that only a descriptor stands for counts
    // as nobody's, and a system that runs out of it would end others first. A failure is reported here; later it would
    // be a signal.
    if (::madvise(memory, size, MADV_POPULATE_WRITE) != 0 ||
        ::fcntl(descriptor.get(), F_ADD_SEALS, requiredSeals) != 0) {
        ::munmap(memory, size);
        return nullptr;
    }
    try {
        auto shared = std::make_shared<const core::posix::OwnedDescriptor>(std::move(descriptor));
        return std::unique_ptr<Segment>(new Segment(std::move(shared), memory, size));
    } catch (const std::bad_alloc&) {
        ::munmap(memory, size);
        return nullptr;
    }
}

Segment::~Segment() {
    ::munmap(data_, size_);
}

bool Segment::detach() noexcept {
    if (!descriptor_) {
        return true;
    }
    if (::mmap(data_, size_, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_FIXED | MAP_NORESERVE, descriptor_->get(), 0) ==
        MAP_FAILED) {
        return false;
    }
    descriptor_.reset();
    return true;
}

}  // namespace foundation::vantor::carrier::shared_memory
