#include <cstdio>
#include <cstdlib>

#include "foundation/core/diag/terminate.hpp"

namespace foundation::core::diag {

void terminate(const char* message, const char* file, int line, const char* function) {
    std::fprintf(stderr, "%s in %s, line %d: %s\n", function, file, line, message);
    std::abort();
}

}  // namespace foundation::core::diag
