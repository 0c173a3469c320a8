// Waiting for what the system has no way to wait for.
#pragma once

#include <chrono>
#include <thread>

#include "support/Patience.hpp"

namespace test_support {

/// Looks again and again until `holds()`, as long as a test is patient; returns whether it came to hold. Between two
/// looks the calling thread sleeps for two milliseconds.
template <class Condition>
[[nodiscard]] bool eventually(Condition holds) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    while (!holds()) {
        if (std::chrono::steady_clock::now() >= deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
}

}  // namespace test_support
