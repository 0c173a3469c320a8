// What a fuzzer says when its input has found a defect.
#pragma once

#include <cstdio>
#include <cstdlib>

namespace fuzz {

/// Ends the program, which makes the input a finding, unless `holds`. `what` says what did not hold.
inline void require(bool holds, const char* what) {
    if (!holds) {
        std::fprintf(stderr, "does not hold: %s\n", what);
        std::abort();
    }
}

}  // namespace fuzz
