// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#pragma once

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <map>
#include <string>
#include <vector>

namespace brenvik {

// Two benchmarks of one run, and the most that the first may take of the second's time.
struct Ratio {
  std::string what;
  std::string ours;
  std::string peer;
  double most;
};

// Runs the registered benchmarks and prints the ratio of their median times (of the processor, or of the wall
// for a benchmark with UseRealTime()); exit status 1 when one is above
// its limit or was not measured. Repetitions are taken in turns, so that a slow minute of the machine meets
// both sides.
inline int runAndCompare(int argc, char** argv, const std::vector<Ratio>& ratios) {
  class Collector : public benchmark::ConsoleReporter {
   public:
    Collector() : ConsoleReporter(OO_None) {}
    void ReportRuns(const std::vector<Run>& runs) override {
      for (const Run& run : runs) {
        if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
          const bool onTheWall = !run.run_name.time_type.empty();
          times[run.run_name.function_name].push_back(onTheWall ? run.GetAdjustedRealTime()
                                                                : run.GetAdjustedCPUTime());
        }
      }
      // One line a benchmark is enough: the median of its repetitions.
      std::vector<Run> medians;
      std::copy_if(runs.begin(), runs.end(), std::back_inserter(medians), [](const Run& run) {
        return run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
      });
      if (!medians.empty()) ConsoleReporter::ReportRuns(medians);
    }
    double median(const std::string& name) {
      std::vector<double>& all = times[name];
      if (all.empty()) return 0;
      std::sort(all.begin(), all.end());
      return all[all.size() / 2];
    }
    std::map<std::string, std::vector<double>> times;
  };

  std::vector<char*> arguments(argv, argv + argc);
  std::string defaults[] = {"--benchmark_repetitions=9", "--benchmark_min_time=0.1",
                            "--benchmark_enable_random_interleaving=true"};
  for (std::string& text : defaults) arguments.insert(arguments.begin() + 1, text.data());
  int count = static_cast<int>(arguments.size());
  arguments.push_back(nullptr);
  benchmark::Initialize(&count, arguments.data());
  if (benchmark::ReportUnrecognizedArguments(count, arguments.data())) return 2;
  Collector collector;
  benchmark::RunSpecifiedBenchmarks(&collector);
  bool good = true;
  std::printf("\n%-32s %8s %8s\n", "", "ratio", "at most");
  for (const Ratio& ratio : ratios) {
    const double ours = collector.median(ratio.ours);
    const double peer = collector.median(ratio.peer);
    const bool measured = ours > 0 && peer > 0;
    const bool within = measured && ours / peer <= ratio.most;
    std::printf("%-32s %8.3f %8.2f  %s\n", ratio.what.c_str(), measured ? ours / peer : 0.0, ratio.most,
                within     ? "ok"
                : measured ? "ABOVE"
                           : "NOT MEASURED");
    good = good && within;
  }
  return good ? 0 : 1;
}

}  // namespace brenvik
