// An owned file descriptor.
#pragma once

#include <unistd.h>

#include <utility>

namespace foundation::core::posix {

/// Closes its descriptor when it goes. A value that can be moved; -1 stands for none.
class OwnedDescriptor {
  public:
    OwnedDescriptor() noexcept = default;
    explicit OwnedDescriptor(int descriptor) noexcept : descriptor_(descriptor) {}
    OwnedDescriptor(OwnedDescriptor&& other) noexcept : descriptor_(other.release()) {}
    OwnedDescriptor& operator=(OwnedDescriptor&& other) noexcept {
        reset(other.release());
        return *this;
    }
    ~OwnedDescriptor() { reset(); }

    int get() const noexcept { return descriptor_; }
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
