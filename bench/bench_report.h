// The results of a benchmark binary, kept so that it can relate them at
// the end: a reporter, ratio and goal lines, and the common main body. Needs
// Google Benchmark only, not the library, so that any benchmark can use it.
#ifndef QUVAIDX_BENCH_BENCH_REPORT_H_
#define QUVAIDX_BENCH_BENCH_REPORT_H_

#include <map>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

namespace quvaidx_bench {

// ---------------------------------------------------------------------------
// Results and ratios

// A console reporter that also keeps every run, so that the binary can
// relate results after all benchmarks have run. When a benchmark is
// repeated, only its aggregates (mean, median, ...) are printed.
class KeepingReporter : public benchmark::ConsoleReporter {
 public:
  KeepingReporter();
  void ReportRuns(const std::vector<Run>& reports) override;

  // Median wall-clock nanoseconds per iteration of the benchmark registered
  // as `name`, run with `threads` threads (over all repetitions); NaN when
  // it did not run. With several threads this is the wall time divided by
  // the requests of all threads together, i.e. the inverse throughput.
  double NsPerOp(const std::string& name, int threads = 1) const;
  // Median CPU nanoseconds per iteration of the process (all its threads,
  // user and system time); meaningful for single-threaded benchmarks, where
  // it is less disturbed than wall time by other load on the machine.
  double CpuNsPerOp(const std::string& name, int threads = 1) const;
  // Median of a user counter; NaN when absent.
  double Counter(const std::string& name, const std::string& counter,
                 int threads = 1) const;

 private:
  struct Sample {
    double ns_per_op;
    double cpu_ns_per_op;
    std::map<std::string, double> counters;
  };
  std::map<std::string, std::vector<Sample>> samples_;
};

// Prints one line of the final summary.
void PrintRatio(const char* label, double value, const char* unit);
// Prints a goal line: "met" when value <= limit (at_most) or value >= limit
// (otherwise).
void PrintGoal(const char* label, double value, double limit, bool at_most);

// Common main body: initialises the benchmark library with the default
// options below (overridable on the command line), runs the benchmarks with
// `reporter` and returns 0.
// Defaults: 5 repetitions in random interleaving, 0.2 s per repetition.
int RunAll(int argc, char** argv, KeepingReporter* reporter);

}  // namespace quvaidx_bench

#endif  // QUVAIDX_BENCH_BENCH_REPORT_H_
