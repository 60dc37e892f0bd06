// One line per benchmark result, which scripts/bench collects into its table:
//   BENCH_RESULT<TAB>name<TAB>ours<TAB>baseline<TAB>ratio<TAB>goal
// `ours` and `baseline` carry their unit; a result with an absolute goal has
// "-" as its baseline and ratio.
#ifndef BENCH_BENCH_RESULT_H
#define BENCH_BENCH_RESULT_H

#include <cstdio>
#include <string>

inline std::string BenchValue(double value, const char* unit) {
    char text[64];
    std::snprintf(text, sizeof text, value >= 100 ? "%.0f %s" : value >= 1 ? "%.2f %s" : "%.4g %s", value,
                  unit);
    return text;
}

// A result measured against a baseline of the same run.
inline void ReportRatio(const std::string& name, double ours, double baseline, const char* unit,
                        const std::string& goal) {
    if (ours <= 0 || baseline <= 0) return;
    std::printf("BENCH_RESULT\t%s\t%s\t%s\t%.3f\t%s\n", name.c_str(), BenchValue(ours, unit).c_str(),
                BenchValue(baseline, unit).c_str(), ours / baseline, goal.c_str());
    std::fflush(stdout);
}

// A result with an absolute goal.
inline void ReportAbsolute(const std::string& name, double ours, const char* unit, const std::string& goal) {
    std::printf("BENCH_RESULT\t%s\t%s\t-\t-\t%s\n", name.c_str(), BenchValue(ours, unit).c_str(), goal.c_str());
    std::fflush(stdout);
}

#endif  // BENCH_BENCH_RESULT_H
