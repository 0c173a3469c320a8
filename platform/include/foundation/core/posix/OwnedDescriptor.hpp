// An owned file descriptor.
#pragma once

#include <unistd.h>

#include <utility>

namespace foundation::core::posix {

/// Closes its descriptor when it goes. A value that can be moved; -1 stands for none.
class OwnedDescriptor {
  public:
    OwnedDescriptor() noexcept = default;
    /// Takes over `descriptor`, -1 for none.
    explicit OwnedDescriptor(int descriptor) noexcept : descriptor_(descriptor) {}
    /// Leaves `other` without a descriptor.
    OwnedDescriptor(OwnedDescriptor&& other) noexcept : descriptor_(other.release()) {}
    /// Closes the descriptor that it had, and leaves `other` without one.
    OwnedDescriptor& operator=(OwnedDescriptor&& other) noexcept {
        reset(other.release());
        return *this;
    }
    ~OwnedDescriptor() { reset(); }

    /// The descriptor, which stays with this object; -1 for none.
    int get() const noexcept { return descriptor_; }
    /// Whether there is a descriptor.
    explicit operator bool() const noexcept { return descriptor_ >= 0; }

    /// Hands the descriptor to the caller.
    int release() noexcept { return std::exchange(descriptor_, -1); }

    /// Closes the descriptor and owns another one.
    void reset(int descriptor = -1) noexcept {
        if (descriptor_ >= 0) {
            ::close(descriptor_);
        }
        descriptor_ = descriptor;
    }

  private:
    int descriptor_ = -1;
};

}  // namespace foundation::core::posix
