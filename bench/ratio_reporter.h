// The console output of a benchmark run, with each benchmark's wall and CPU time kept so the
// binary can print its ratios after the run.
#ifndef LOGMGR_BENCH_RATIO_REPORTER_H_
#define LOGMGR_BENCH_RATIO_REPORTER_H_

#include <benchmark/benchmark.h>
#include <stdio.h>

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

  // Prints the ratio of the first benchmarks whose names start with |num| and |den|, in wall
  // and then CPU time; nothing for a clock where either did not run.
  void PrintRatio(const std::string& label, const std::string& num, const std::string& den) const {
    for (const auto* times : {&wall, &cpu}) {
      double n = Find(*times, num), d = Find(*times, den);
      if (n > 0 && d > 0) {
        printf("%s %-44s %.3f\n", times == &wall ? "wall" : "cpu ", label.c_str(), n / d);
      }
    }
  }

  std::map<std::string, double> wall;
  std::map<std::string, double> cpu;
};

#endif  // LOGMGR_BENCH_RATIO_REPORTER_H_
