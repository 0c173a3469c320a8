// Measurements in pairs: what the library does, and beside it, in the same run, the least that the same work can cost.
#pragma once

#include <benchmark/benchmark.h>

#include <functional>
#include <string>

namespace bench {

/// Which clock tells how long one iteration took.
enum class Clock {
    Cpu,   ///< of the thread that measures
    Wall,  ///< for work that other threads share
};

using Measurement = std::function<void(benchmark::State&)>;

/// Registers `ours` beside `baseline`, under a name that may have several contenders. The report tells the ratios of
/// their repetitions.
void compare(const std::string& name, Clock clock, Measurement ours, Measurement baseline,
             const std::string& contender = "krutil");

}  // namespace bench
