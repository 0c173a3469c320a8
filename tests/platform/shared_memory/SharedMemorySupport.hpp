// Memory as a peer makes it that keeps to no rules.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace testing_memory {

using foundation::core::posix::OwnedDescriptor;

inline constexpr int allSeals = F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_FUTURE_WRITE | F_SEAL_SEAL;
inline constexpr std::size_t page = 4096;

/// Anonymous memory of `size` bytes, the first `written` of which are 'm', with these seals.
inline OwnedDescriptor anonymousMemory(std::size_t size, std::size_t written, int seals) {
    OwnedDescriptor descriptor(::memfd_create("test", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    EXPECT_EQ(::ftruncate(descriptor.get(), static_cast<off_t>(size)), 0);
    const std::string bytes(written, 'm');
    EXPECT_EQ(::pwrite(descriptor.get(), bytes.data(), written, 0), static_cast<ssize_t>(written));
    if (seals != 0) {
        EXPECT_EQ(::fcntl(descriptor.get(), F_ADD_SEALS, seals), 0);
    }
    return descriptor;
}

}  // namespace testing_memory
