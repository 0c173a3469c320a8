// krutil_bench [--rows] [--benchmark_filter=REGEX]... : every comparison, one after the other, with the ratios of its
// repetitions: the median and the quartiles. A ratio of 1 means that the library adds nothing to its baseline. With
// --rows it prints a line of JSON for each instead, the seconds of both sides and each repetition.

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <iostream>
#include <map>
#include <nlohmann/json.hpp>
#include <regex>
#include <string>
#include <utility>
#include <vector>

#include "Comparison.hpp"
#include "SerializerBench.hpp"
#include "peers/SmallMessageBench.hpp"

namespace bench {
namespace {

constexpr const char* baselineSuffix = "/baseline";

struct Comparison {
    std::string name;
    std::string contender;

    // What Google Benchmark knows the contender's side by.
    std::string benchmark() const { return name + "/" + contender; }
};

std::vector<Comparison>& comparisons() {
    static std::vector<Comparison> all;
    return all;
}

// Seconds of one iteration, by benchmark and repetition.
class Times : public benchmark::BenchmarkReporter {
  public:
    bool ReportContext(const Context& /*context*/) override { return true; }
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.run_type == Run::RT_Iteration) {
                const bool wall = !run.run_name.time_type.empty();
                const double time = wall ? run.GetAdjustedRealTime() : run.GetAdjustedCPUTime();
                seconds[run.run_name.function_name].push_back(time / benchmark::GetTimeUnitMultiplier(run.time_unit));
            }
        }
    }

    std::map<std::string, std::vector<double>> seconds;
};

double quantile(const std::vector<double>& sorted, double share) {
    const double place = share * static_cast<double>(sorted.size() - 1);
    const auto below = static_cast<std::size_t>(place);
    const std::size_t above = std::min(below + 1, sorted.size() - 1);
    return sorted[below] + (place - static_cast<double>(below)) * (sorted[above] - sorted[below]);
}

void printRatios(const Comparison& comparison, const std::vector<double>& ours, const std::vector<double>& baseline) {
    std::vector<double> ratios;
    for (std::size_t i = 0; i < ours.size(); ++i) {
        ratios.push_back(ours[i] / baseline[i]);
    }
    std::sort(ratios.begin(), ratios.end());
    std::printf("%-70s %8.2f  (%.2f to %.2f)\n", comparison.benchmark().c_str(), quantile(ratios, 0.5),
                quantile(ratios, 0.25), quantile(ratios, 0.75));
    std::fflush(stdout);
}

void printRow(const Comparison& comparison, const std::vector<double>& ours, const std::vector<double>& baseline) {
    const nlohmann::ordered_json row{
        {"label", comparison.name},
        {"size", nullptr},
        {"times",
         {{{"name", "baseline"}, {"seconds", baseline}}, {{"name", comparison.contender}, {"seconds", ours}}}}};
    std::cout << row.dump() << std::endl;
}

// Matches exactly the two sides of a comparison.
std::string filterFor(const std::string& name) {
    static const std::regex special(R"([.^$|()\[\]{}*+?\\])");
    return "^" + std::regex_replace(name, special, "\\$&") + "(/baseline)?(/real_time)?$";
}

}  // namespace

void compare(const std::string& name, Clock clock, Measurement ours, Measurement baseline,
             const std::string& contender) {
    const Comparison comparison{name, contender};
    const auto add = [clock](const std::string& fullName, Measurement measurement) {
        auto* registered = benchmark::RegisterBenchmark(fullName.c_str(), std::move(measurement));
        if (clock == Clock::Wall) {
            registered->UseRealTime();
        }
    };
    add(comparison.benchmark(), std::move(ours));
    add(comparison.benchmark() + baselineSuffix, std::move(baseline));
    comparisons().push_back(comparison);
}

}  // namespace bench

int main(int argc, char** argv) {
    // What the command line says comes later, and wins. The two sides of a comparison have their turns in random order,
    // repetition by repetition.
    std::vector<std::string> defaults{"--benchmark_repetitions=9", "--benchmark_min_time=0.02",
                                      "--benchmark_enable_random_interleaving=true"};
    std::vector<char*> arguments(argv, argv + argc);
    const auto rowsOption = std::find_if(arguments.begin(), arguments.end(),
                                         [](const char* each) { return std::strcmp(each, "--rows") == 0; });
    const bool rows = rowsOption != arguments.end();
    if (rows) {
        arguments.erase(rowsOption);
    }
    for (std::string& each : defaults) {
        arguments.insert(arguments.begin() + 1, each.data());
    }
    int count = static_cast<int>(arguments.size());
    benchmark::Initialize(&count, arguments.data());
    if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) {
        return 2;
    }
    bench::addSerializerBenches();
    bench::addSmallMessageBenches();
    const std::regex wanted(benchmark::GetBenchmarkFilter());
    for (const bench::Comparison& comparison : bench::comparisons()) {
        const std::string ours = comparison.benchmark();
        if (!std::regex_search(ours, wanted)) {
            continue;
        }
        bench::Times times;
        benchmark::RunSpecifiedBenchmarks(&times, bench::filterFor(ours));
        (rows ? bench::printRow : bench::printRatios)(comparison, times.seconds[ours],
                                                      times.seconds[ours + bench::baselineSuffix]);
    }
    return 0;
}
