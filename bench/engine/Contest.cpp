#include "engine/Contest.hpp"

#include <algorithm>
#include <chrono>
#include <cmath>
#include <iostream>
#include <nlohmann/json.hpp>

namespace bench {
namespace {

double secondsOf(const Contender& contender, std::size_t count) {
    const auto begin = std::chrono::steady_clock::now();
    contender.run(count);
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

// How often a contender does its work in a batch of that length.
std::size_t countFor(const Contender& contender, double batchSeconds) {
    secondsOf(contender, 1);
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

void hold(const Contest& contest, const Effort& effort) {
    std::vector<std::size_t> counts;
    for (const Contender& contender : contest.contenders) {
        counts.push_back(countFor(contender, effort.batchSeconds));
    }
    std::vector<std::vector<double>> times(counts.size());
    for (std::size_t repetition = 0; repetition < effort.repetitions; ++repetition) {
        for (std::size_t i = 0; i < counts.size(); ++i) {
            const std::size_t units = counts[i] * (i == 0 ? 1 : contest.units);
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
