// Runs the registered Google benchmarks and prints, for each (candidate,
// baseline) pair, the candidate's speed as a ratio of the baseline measured
// in the same run: ratio = baseline time per iteration / candidate time.
#pragma once

#include <benchmark/benchmark.h>

#include <cstdio>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "VSABenchTable.h"

// With --benchmark_repetitions, a benchmark's time is the median of its
// repetitions (with --benchmark_enable_random_interleaving the candidate's
// and the baseline's repetitions alternate, so a slow spell of the machine
// falls on both); without, the one run's.
class VSARatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      const std::string name = r.run_name.str();
      if (r.run_type == Run::RT_Aggregate && r.aggregate_name == "median") {
        medians_[name] = r.GetAdjustedRealTime();
      } else if (r.run_type == Run::RT_Iteration) {
        times_[name] = r.GetAdjustedRealTime();
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }
  double time(const std::string& name) const {
    if (auto it = medians_.find(name); it != medians_.end()) return it->second;
    auto it = times_.find(name);
    return it == times_.end() ? 0 : it->second;
  }

 private:
  std::map<std::string, double> times_, medians_;
};

struct VSARatio {
  const char* candidate;
  const char* baseline;
  double target;
  const char* measure = nullptr;  // its name in bench/run-all's table (the candidate's if null)
};

inline int VSARunWithRatios(int argc, char** argv, const std::vector<VSARatio>& ratios) {
  benchmark::Initialize(&argc, argv);
  VSARatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  std::printf("\n%-44s %-36s %8s %8s\n", "candidate", "baseline", "ratio", "target");
  for (const VSARatio& r : ratios) {
    double c = reporter.time(r.candidate), b = reporter.time(r.baseline);
    if (c <= 0 || b <= 0) continue;
    double ratio = b / c;
    std::printf("%-44s %-36s %7.2fx %7.2fx %s\n", r.candidate, r.baseline, ratio, r.target,
                ratio >= r.target ? "ok" : "BELOW TARGET");
    VSABenchRecord(r.measure ? r.measure : r.candidate, r.baseline, ratio, r.target);
  }
  return 0;
}
