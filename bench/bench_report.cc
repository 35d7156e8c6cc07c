#include "bench_report.h"

#include <math.h>
#include <stdio.h>

#include <algorithm>
#include <cmath>

namespace quvaidx_bench {

namespace {

std::string Key(const std::string& name, int threads) {
  return name + "#" + std::to_string(threads);
}

double Median(std::vector<double> values) {
  if (values.empty()) return NAN;
  std::sort(values.begin(), values.end());
  size_t n = values.size();
  return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

}  // namespace

KeepingReporter::KeepingReporter()
    : benchmark::ConsoleReporter(benchmark::ConsoleReporter::OO_Tabular) {}

void KeepingReporter::ReportRuns(const std::vector<Run>& reports) {
  std::vector<Run> shown;
  for (const Run& run : reports) {
    if (run.run_type != Run::RT_Iteration || run.repetitions <= 1 ||
        run.error_occurred) {
      shown.push_back(run);
    }
    if (run.error_occurred || run.run_type != Run::RT_Iteration) continue;
    if (run.iterations <= 0) continue;
    Sample sample;
    sample.ns_per_op =
        run.real_accumulated_time * 1e9 / static_cast<double>(run.iterations);
    sample.cpu_ns_per_op =
        run.cpu_accumulated_time * 1e9 / static_cast<double>(run.iterations);
    for (const auto& counter : run.counters) {
      sample.counters[counter.first] = counter.second.value;
    }
    samples_[Key(run.run_name.function_name, static_cast<int>(run.threads))]
        .push_back(sample);
  }
  if (!shown.empty()) benchmark::ConsoleReporter::ReportRuns(shown);
}

double KeepingReporter::NsPerOp(const std::string& name, int threads) const {
  auto it = samples_.find(Key(name, threads));
  if (it == samples_.end()) return NAN;
  std::vector<double> values;
  for (const Sample& s : it->second) values.push_back(s.ns_per_op);
  return Median(values);
}

double KeepingReporter::CpuNsPerOp(const std::string& name, int threads) const {
  auto it = samples_.find(Key(name, threads));
  if (it == samples_.end()) return NAN;
  std::vector<double> values;
  for (const Sample& s : it->second) values.push_back(s.cpu_ns_per_op);
  return Median(values);
}

double KeepingReporter::Counter(const std::string& name,
                                const std::string& counter, int threads) const {
  auto it = samples_.find(Key(name, threads));
  if (it == samples_.end()) return NAN;
  std::vector<double> values;
  for (const Sample& s : it->second) {
    auto c = s.counters.find(counter);
    if (c != s.counters.end()) values.push_back(c->second);
  }
  return Median(values);
}

void PrintRatio(const char* label, double value, const char* unit) {
  printf("  %-64s %12.3f %s\n", label, value, unit);
}

void PrintGoal(const char* label, double value, double limit, bool at_most) {
  bool met = at_most ? value <= limit : value >= limit;
  const char* verdict = std::isnan(value) ? "NOT MEASURED"
                        : met             ? "met"
                                          : "MISSED";
  printf("  GOAL %-52s %8.3f (%s %.2f): %s\n", label, value,
         at_most ? "<=" : ">=", limit, verdict);
}

int RunAll(int argc, char** argv, KeepingReporter* reporter) {
  std::vector<std::string> storage = {
      argc > 0 ? argv[0] : "bench",
      "--benchmark_repetitions=5",
      "--benchmark_enable_random_interleaving=true",
      "--benchmark_min_time=0.2",
  };
  for (int i = 1; i < argc; ++i) storage.push_back(argv[i]);
  std::vector<char*> args;
  for (std::string& s : storage) args.push_back(s.data());
  int count = static_cast<int>(args.size());
  benchmark::Initialize(&count, args.data());
  if (benchmark::ReportUnrecognizedArguments(count, args.data())) return 1;
  benchmark::RunSpecifiedBenchmarks(reporter);
  benchmark::Shutdown();
  fflush(stdout);
  return 0;
}

}  // namespace quvaidx_bench
