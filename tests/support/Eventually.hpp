// Waiting for what the system has no way to wait for.
#pragma once

#include <chrono>
#include <thread>

namespace test_support {

/// Looks again and again until `holds()`, for a minute at most; returns whether it came to hold. Between two looks the
/// calling thread sleeps for two milliseconds.
template <class Condition>
[[nodiscard]] bool eventually(Condition holds) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(1);
    while (!holds()) {
        if (std::chrono::steady_clock::now() >= deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
}

}  // namespace test_support
