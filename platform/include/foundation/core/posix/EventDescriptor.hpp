// A descriptor that one thread makes readable and another one waits for.
#pragma once

#include <sys/eventfd.h>

#include <cerrno>
#include <string>
#include <system_error>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace foundation::core::posix {

/// An eventfd, not readable at first. Every member may be called from any thread; raise() from signal handlers too.
class EventDescriptor {
  public:
    /// Throws std::system_error, whose text begins with `purpose`: who needs the descriptor.
    explicit EventDescriptor(const std::string& purpose) : descriptor_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        if (!descriptor_) {
            throw std::system_error(errno, std::generic_category(), purpose + " needs a descriptor (eventfd)");
        }
    }

    /// The descriptor, to wait for. It stays with this object.
    int get() const noexcept { return descriptor_.get(); }

    /// Makes it readable. Keeps errno.
    void raise() const noexcept {
        const int before = errno;
        // Fails only when the counter is at its maximum, which is readable as well.
        ::eventfd_write(descriptor_.get(), 1);
        errno = before;
    }

    /// Makes it unreadable. Returns whether it was readable.
    bool clear() const noexcept {
        eventfd_t ignored = 0;
        return ::eventfd_read(descriptor_.get(), &ignored) == 0;
    }

    /// Closes the descriptor in a forked child, which must not share it. Nothing else may be called after that.
    void closeInChild() noexcept { descriptor_.reset(); }

  private:
    OwnedDescriptor descriptor_;
};

}  // namespace foundation::core::posix
