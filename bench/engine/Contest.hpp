// Ways to do the same work, timed in turn. Single thread.
#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace bench {

/// One way to do the work.
struct Contender {
    std::string name;

    /// Does the work `count` times, one after the other. Throws when an outcome is not what it must be, so nothing that
    /// does less work than it should is timed.
    std::function<void(std::size_t count)> run;

    /// What is done in one count, of what is asked about: 1,000 requests, a line.
    std::size_t units = 1;
};

/// Contenders with the same work. The first is the baseline of the others.
struct Contest {
    std::string label;           ///< which case of the question it is: "1 MiB there and back"; may be empty
    std::optional<double> size;  ///< where the case stands on the axis of a plot
    std::vector<Contender> contenders;
};

/// How long a contest may take, and how large.
struct Effort {
    std::size_t repetitions = 15;
    double contestSeconds = 20;      ///< after which a contest ends, once it has three repetitions
    double batchSeconds = 0.05;      ///< work of one contender in one repetition, at least one count of it
    std::size_t largest = 1U << 20;  ///< bytes of an array, in a question that goes through sizes
    bool firstSizeOnly = false;      ///< of such a question
};

/// The sizes from `first` to `last` that a question goes through, each so many times the one before.
std::vector<std::size_t> sizes(const Effort& effort, std::size_t first, std::size_t last, std::size_t factor);

/// Runs every contender once for nothing, so that connections, buffers and caches are warm. Then, in each repetition,
/// runs all of them one after the other, and prints a line of JSON: the seconds of one unit, for each contender and
/// each repetition.
void hold(const Contest& contest, const Effort& effort);

}  // namespace bench
