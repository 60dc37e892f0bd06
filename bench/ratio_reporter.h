// Console reporter that, after the run, prints the ratio of each benchmark
// "X/ours" to its baseline "X/baseline" measured in the same run, and a
// result line for scripts/bench with the goal given for X.
#ifndef BENCH_RATIO_REPORTER_H
#define BENCH_RATIO_REPORTER_H

#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>

#include "bench_result.h"

class RatioReporter : public benchmark::ConsoleReporter {
public:
    using Goals = std::map<std::string, std::string>;  // benchmark X -> its goal, e.g. "<= 1.10"
    explicit RatioReporter(Goals goals = Goals()) : goals_(std::move(goals)) {}
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& run : runs) {
            if (run.run_type == Run::RT_Aggregate && run.aggregate_name != "median") continue;
            times_[run.run_name.function_name] = run.GetAdjustedRealTime();
            units_[run.run_name.function_name] = benchmark::GetTimeUnitString(run.time_unit);
        }
        ConsoleReporter::ReportRuns(runs);
    }
    void Finalize() override {
        ConsoleReporter::Finalize();
        for (const auto& [name, ours] : times_) {
            const std::string suffix = "/ours";
            if (name.size() < suffix.size() || name.compare(name.size() - suffix.size(), suffix.size(), suffix) != 0)
                continue;
            const std::string base = name.substr(0, name.size() - suffix.size()) + "/baseline";
            auto it = times_.find(base);
            if (it == times_.end() || it->second <= 0) continue;
            const std::string bench = name.substr(0, name.size() - suffix.size());
            std::printf("ratio %-40s %.3f\n", bench.c_str(), ours / it->second);
            const auto goal = goals_.find(bench);
            ReportRatio(bench, ours, it->second, units_[name].c_str(), goal == goals_.end() ? "-" : goal->second);
        }
    }

private:
    std::map<std::string, std::string> goals_;
    std::map<std::string, double> times_;
    std::map<std::string, std::string> units_;
};

#define RATIO_BENCHMARK_MAIN(...)                                 \
    int main(int argc, char** argv) {                             \
        benchmark::Initialize(&argc, argv);                       \
        RatioReporter reporter(RatioReporter::Goals __VA_ARGS__);  \
        benchmark::RunSpecifiedBenchmarks(&reporter);             \
        benchmark::Shutdown();                                    \
        return 0;                                                 \
    }

#endif  // BENCH_RATIO_REPORTER_H
