#include "qvm/process/StandardDescriptors.hpp"

#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <string>
#include <system_error>

namespace qvm {
namespace {

[[noreturn]] void fail(const char* what) {
    throw std::system_error(errno, std::generic_category(), what);
}

}  // namespace

int duplicateAside(int descriptor, const char* failure) {
    const int made = ::fcntl(descriptor, F_DUPFD_CLOEXEC, firstPrivateDescriptor);
    if (made < 0) {
        fail(failure);
    }
    return made;
}

void checkDescriptorLimit() {
    rlimit limit{};
    if (::getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < static_cast<rlim_t>(neededDescriptors)) {
        throw std::runtime_error("This process may have " + std::to_string(limit.rlim_cur) +
                                 " descriptors at a time (RLIMIT_NOFILE), and an engine needs " +
                                 std::to_string(neededDescriptors) +
                                 ". Raise the limit, for example with \"ulimit -n 1024\".");
    }
}

void holdStandardDescriptors() {
    // The lowest free number is used, so this fills 0, 1 and 2 in turn.
    int descriptor = 0;
    do {
        descriptor = ::open("/dev/null", O_RDWR);
        if (descriptor < 0) {
            fail("Cannot open /dev/null");
        }
    } while (descriptor <= STDERR_FILENO);
    ::close(descriptor);
}

ProtocolDescriptors moveProtocolAside() {
    const int in = duplicateAside(STDIN_FILENO, "Cannot move standard input aside");
    const int out = duplicateAside(STDOUT_FILENO, "Cannot move standard output aside");
    giveToRunningCode();
    return {in, out};
}

void giveToRunningCode() {
    const int null = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    if (null < 0) {
        fail("Cannot open /dev/null");
    }
    const bool done = ::dup2(null, STDIN_FILENO) >= 0 && ::dup2(STDERR_FILENO, STDOUT_FILENO) >= 0;
    ::close(null);
    if (!done) {
        fail("Cannot redirect the standard descriptors");
    }
}

}  // namespace qvm
