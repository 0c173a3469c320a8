#include "engine/Contest.hpp"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <iostream>
#include <nlohmann/json.hpp>

namespace bench {
namespace {

using Clock = std::chrono::steady_clock;

double secondsSince(Clock::time_point begin) {
    return std::chrono::duration<double>(Clock::now() - begin).count();
}

double secondsOf(const Contender& contender, std::size_t count) {
    const auto begin = Clock::now();
    contender.run(count);
    return secondsSince(begin);
}

// How often a contender does its work in a batch of that length.
std::size_t countFor(const Contender& contender, double batchSeconds) {
    std::size_t count = 1;
    double seconds = secondsOf(contender, count);
    while (seconds < batchSeconds / 4) {
        count *= 2;
        seconds = secondsOf(contender, count);
    }
    return std::max<std::size_t>(
        1, static_cast<std::size_t>(std::lround(static_cast<double>(count) * batchSeconds / seconds)));
}

}  // namespace

std::vector<std::size_t> sizes(const Effort& effort, std::size_t first, std::size_t last, std::size_t factor) {
    std::vector<std::size_t> all{first};
    while (!effort.firstSizeOnly && all.back() <= last / factor) {
        all.push_back(all.back() * factor);
    }
    return all;
}

void hold(const Contest& contest, const Effort& effort) {
    std::vector<std::size_t> counts;
    for (const Contender& contender : contest.contenders) {
        counts.push_back(countFor(contender, effort.batchSeconds));
    }
    constexpr std::size_t fewest = 3;
    std::vector<std::vector<double>> times(counts.size());
    const auto begin = Clock::now();
    for (std::size_t repetition = 0; repetition < effort.repetitions; ++repetition) {
        if (repetition >= fewest && secondsSince(begin) > effort.contestSeconds) {
            break;
        }
        for (std::size_t i = 0; i < counts.size(); ++i) {
            const std::size_t units = counts[i] * contest.contenders[i].units;
            times[i].push_back(secondsOf(contest.contenders[i], counts[i]) / static_cast<double>(units));
        }
    }
    nlohmann::ordered_json row{{"label", contest.label}, {"size", nullptr}};
    if (contest.size) {
        row["size"] = *contest.size;
    }
    for (std::size_t i = 0; i < counts.size(); ++i) {
        row["times"].push_back({{"name", contest.contenders[i].name}, {"seconds", times[i]}});
    }
    std::cout << row.dump() << std::endl;
}

}  // namespace bench
