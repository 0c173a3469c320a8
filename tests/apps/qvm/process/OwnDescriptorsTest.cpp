#include "qvm/process/OwnDescriptors.hpp"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace {

using foundation::core::posix::OwnedDescriptor;

TEST(OwnDescriptorsTest, OneThatIsClosedIsMissed) {
    OwnedDescriptor file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    qvm::OwnDescriptors own;
    EXPECT_TRUE(own.areOpen());
    EXPECT_TRUE(own.areOurs());
    file.reset();
    EXPECT_FALSE(own.areOpen());
    EXPECT_FALSE(own.areOurs());
}

// An array may come before the engine looks which descriptors it has.
TEST(OwnDescriptorsTest, SharedMemoryOfThePeerIsNotMissed) {
    OwnedDescriptor memory(::memfd_create("array", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    ASSERT_EQ(::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW), 0);
    qvm::OwnDescriptors own;
    memory.reset();
    EXPECT_TRUE(own.areOpen());
    EXPECT_TRUE(own.areOurs());
}

}  // namespace
