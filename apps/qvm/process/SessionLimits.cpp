#include "qvm/process/SessionLimits.hpp"

#include <sys/resource.h>
#include <sys/sysinfo.h>

#include <algorithm>
#include <cerrno>
#include <system_error>

namespace qvm {
namespace {

// Code cannot lift the limit again, as far as its user may not.
void lower(__rlimit_resource resource, std::uint64_t most, const char* failure) {
    rlimit limit{};
    if (most == 0) {
        return;
    }
    bool done = ::getrlimit(resource, &limit) == 0;
    limit.rlim_cur = std::min<rlim_t>(limit.rlim_cur, most);
    limit.rlim_max = std::min<rlim_t>(limit.rlim_max, most);
    done = done && ::setrlimit(resource, &limit) == 0;
    if (!done) {
        throw std::system_error(errno, std::generic_category(), failure);
    }
}

// Zero if the system does not say it.
std::uint64_t memoryOfTheMachine() {
#if defined(KRUTIL_SANITIZED)
    return 0;
#else
    struct sysinfo info {};
    return ::sysinfo(&info) == 0 ? (std::uint64_t{info.totalram} + info.totalswap) * info.mem_unit : 0;
#endif
}

}  // namespace

SessionLimits usualSessionLimits() {
    return {memoryOfTheMachine(), 65'536};
}

// RLIMIT_DATA and not RLIMIT_AS: what is only reserved or only read does not count. That is half of the address space
// of a session, with NumPy or without.
void apply(const SessionLimits& limits) {
    lower(RLIMIT_DATA, limits.memory, "Cannot limit the memory of the session");
    lower(RLIMIT_NOFILE, limits.descriptors, "Cannot limit the descriptors of the session");
}

}  // namespace qvm
