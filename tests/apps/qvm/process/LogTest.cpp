// Where the engine says what it says about itself.
#include "qvm/process/Log.hpp"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <string>
#include <system_error>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "qvm/process/StandardDescriptors.hpp"

namespace qvm_test {
namespace {

// All private numbers that this process may have are taken. A log that could say nothing would be none.
TEST(LogTest, AnEngineThatCannotKeepItsStandardErrorSaysSo) {
    struct rlimit before {};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const struct rlimit small { qvm::firstPrivateDescriptor + 1, before.rlim_max };
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &small), 0);
    std::string said;
    {
        const foundation::core::posix::OwnedDescriptor taken(::dup2(STDERR_FILENO, qvm::firstPrivateDescriptor));
        try {
            const qvm::Log log("");
        } catch (const std::system_error& error) {
            said = error.what();
        }
    }
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(said, "Cannot keep standard error: Too many open files");
}

}  // namespace
}  // namespace qvm_test
