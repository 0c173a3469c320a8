// The end of the process as an exception.
#pragma once

#include <string>

namespace fuzz {

/// Thrown by foundation::core::diag::terminate() in programs that link Ended.cpp, which replaces the platform's.
struct Ended {
    std::string message;
};

}  // namespace fuzz
