#pragma once

// RatioReporter: the console report of Google Benchmark, followed by the
// ratios of chosen pairs of benchmarks of the same run (real time per
// iteration), so that a figure is always quoted against its baseline:
//
//   int main(int argc, char** argv) {
//     return tn::bench::runWithRatios(argc, argv, {{"BM_Daemon", "BM_Echo", 1.3}});
//   }
//
// prints, after the usual table,
//
//   BM_Daemon / BM_Echo = 1.21  (target at most 1.3)
//
// A name matches every benchmark whose name starts with it; the first
// match is used.

#include <benchmark/benchmark.h>

#include <optional>
#include <string>
#include <vector>

namespace tn::bench {

struct Ratio {
  std::string numerator;
  std::string denominator;
  std::optional<double> target;  // at most; printed beside the ratio
};

class RatioReporter : public benchmark::ConsoleReporter {
 public:
  explicit RatioReporter(std::vector<Ratio> ratios) : ratios_(std::move(ratios)) {}

  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
        times_.emplace_back(run.benchmark_name(), run.GetAdjustedRealTime());
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }

  void Finalize() override {
    ConsoleReporter::Finalize();
    for (const Ratio& ratio : ratios_) {
      const std::optional<double> top = timeOf(ratio.numerator);
      const std::optional<double> bottom = timeOf(ratio.denominator);
      if (!top || !bottom || *bottom == 0) continue;
      std::string line = ratio.numerator + " / " + ratio.denominator + " = " + format(*top / *bottom);
      if (ratio.target) line += "  (target at most " + format(*ratio.target) + ")";
      GetOutputStream() << line << "\n";
    }
  }

 private:
  std::optional<double> timeOf(const std::string& prefix) const {
    for (const auto& [name, time] : times_) {
      if (name.rfind(prefix, 0) == 0) return time;
    }
    return std::nullopt;
  }
  static std::string format(double value) {
    char text[32];
    std::snprintf(text, sizeof text, "%.2f", value);
    return text;
  }

  std::vector<Ratio> ratios_;
  std::vector<std::pair<std::string, double>> times_;
};

// Runs the benchmarks selected on the command line with a RatioReporter.
inline int runWithRatios(int argc, char** argv, std::vector<Ratio> ratios) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  RatioReporter reporter(std::move(ratios));
  benchmark::RunSpecifiedBenchmarks(&reporter);
  benchmark::Shutdown();
  return 0;
}

}  // namespace tn::bench
