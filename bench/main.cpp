// krutil_bench [--benchmark_filter=REGEX]... : every comparison, and a table of the ratios at the end. A ratio of 1
// means that the library adds nothing to its baseline.

#include <cstdio>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "Comparison.hpp"
#include "SerializerBench.hpp"
#include "SessionBench.hpp"

namespace bench {
namespace {

constexpr const char* baselineSuffix = "/baseline";

// Prints what the console prints, and remembers the medians.
class Ratios : public benchmark::ConsoleReporter {
  public:
    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& run : runs) {
            // A single repetition has no median; it is what a quick look at one comparison asks for.
            const bool isMedian = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
            if (isMedian || (run.run_type == Run::RT_Iteration && run.repetitions <= 1)) {
                const bool wall = !run.run_name.time_type.empty();
                times_[run.run_name.function_name] = wall ? run.GetAdjustedRealTime() : run.GetAdjustedCPUTime();
            }
        }
    }

    void print() const {
        std::printf("\n%-60s %8s\n", "median against its baseline", "ratio");
        for (const auto& [name, time] : times_) {
            const auto baseline = times_.find(name + baselineSuffix);
            if (baseline != times_.end()) {
                std::printf("%-60s %8.2f\n", name.c_str(), time / baseline->second);
            }
        }
    }

  private:
    std::map<std::string, double> times_;
};

}  // namespace

void compare(const std::string& name, Clock clock, Measurement ours, Measurement baseline) {
    const auto add = [clock](const std::string& fullName, Measurement measurement) {
        auto* registered = benchmark::RegisterBenchmark(fullName.c_str(), std::move(measurement));
        if (clock == Clock::Wall) {
            registered->UseRealTime();
        }
    };
    add(name, std::move(ours));
    add(name + baselineSuffix, std::move(baseline));
}

}  // namespace bench

int main(int argc, char** argv) {
    // What the command line says comes later, and wins.
    std::vector<std::string> defaults{"--benchmark_repetitions=5", "--benchmark_report_aggregates_only=true",
                                      "--benchmark_min_time=0.05"};
    std::vector<char*> arguments(argv, argv + argc);
    for (std::string& each : defaults) {
        arguments.insert(arguments.begin() + 1, each.data());
    }
    int count = static_cast<int>(arguments.size());
    benchmark::Initialize(&count, arguments.data());
    if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) {
        return 2;
    }
    bench::addSerializerBenches();
    bench::addSessionBenches();
    bench::Ratios reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    reporter.print();
    return 0;
}
