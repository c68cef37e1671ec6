// The console output of a benchmark run, with each benchmark's wall and CPU time kept so the
// binary can print its ratios after the run.
#ifndef LOGMGR_BENCH_RATIO_REPORTER_H_
#define LOGMGR_BENCH_RATIO_REPORTER_H_

#include <benchmark/benchmark.h>

#include <map>
#include <string>
#include <vector>

class RatioReporter : public benchmark::ConsoleReporter {
 public:
  explicit RatioReporter(OutputOptions options = OO_Defaults) : ConsoleReporter(options) {}

  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (!run.error_occurred) {
        wall[run.benchmark_name()] = run.GetAdjustedRealTime();
        cpu[run.benchmark_name()] = run.GetAdjustedCPUTime();
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }

  // The time of the first benchmark whose name starts with |prefix|; 0 when none ran.
  static double Find(const std::map<std::string, double>& times, const std::string& prefix) {
    for (const auto& [name, value] : times) {
      if (name.rfind(prefix, 0) == 0) return value;
    }
    return 0.0;
  }

  std::map<std::string, double> wall;
  std::map<std::string, double> cpu;
};

#endif  // LOGMGR_BENCH_RATIO_REPORTER_H_
