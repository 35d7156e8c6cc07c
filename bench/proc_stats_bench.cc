// Process statistics: GetFileDescriptorNum, which lists /proc/PID/fd
// itself, against what a shell script does, popen of
// "/bin/ls -l /proc/PID/fd | /usr/bin/wc -l", in the same run. Both count
// the same lines (checked before timing: the pipeline's figure includes the
// pipe this process reads it from, the library's the directory it lists).
// GetMemoryUsagekb and GetTotalMemory are timed alongside, for reference.
#include <stdio.h>
#include <unistd.h>

#include "bench_support.h"
#include "quvaidx/system.h"

namespace qb = quvaidx_bench;

namespace {

// The line count of the pipeline, or -1.
int PopenFdCount(int pid) {
  char command[96];
  snprintf(command, sizeof(command), "/bin/ls -l /proc/%d/fd | /usr/bin/wc -l",
           pid);
  FILE* pipe = popen(command, "r");
  if (pipe == nullptr) return -1;
  int count = -1;
  if (fscanf(pipe, "%d", &count) != 1) count = -1;
  if (pclose(pipe) != 0) return -1;
  return count;
}

void BM_FdLibrary(benchmark::State& state) {
  const int pid = getpid();
  for (auto _ : state) {
    int count = GetFileDescriptorNum(pid);
    if (count <= 0) {
      state.SkipWithError("GetFileDescriptorNum failed");
      return;
    }
    benchmark::DoNotOptimize(count);
  }
}

void BM_FdPopen(benchmark::State& state) {
  const int pid = getpid();
  for (auto _ : state) {
    int count = PopenFdCount(pid);
    if (count <= 0) {
      state.SkipWithError("popen failed");
      return;
    }
    benchmark::DoNotOptimize(count);
  }
}

void BM_MemoryUsage(benchmark::State& state) {
  const int pid = getpid();
  for (auto _ : state) {
    long rss = 0;
    long vmsize = 0;
    if (GetMemoryUsagekb(pid, rss, vmsize) != 0) {
      state.SkipWithError("GetMemoryUsagekb failed");
      return;
    }
    benchmark::DoNotOptimize(rss + vmsize);
  }
}

void BM_TotalMemory(benchmark::State& state) {
  for (auto _ : state) {
    long total = 0;
    if (GetTotalMemory(total) != 0) {
      state.SkipWithError("GetTotalMemory failed");
      return;
    }
    benchmark::DoNotOptimize(total);
  }
}

}  // namespace

int main(int argc, char** argv) {
  const int library = GetFileDescriptorNum(getpid());
  const int pipeline = PopenFdCount(getpid());
  if (library <= 0 || pipeline != library) {
    fprintf(stderr, "proc_stats_bench: GetFileDescriptorNum %d, pipeline %d\n",
            library, pipeline);
    return 1;
  }
  benchmark::RegisterBenchmark("fd_count/library", BM_FdLibrary)
      ->Unit(benchmark::kMicrosecond);
  benchmark::RegisterBenchmark("fd_count/popen", BM_FdPopen)
      ->Unit(benchmark::kMicrosecond);
  benchmark::RegisterBenchmark("memory_usage/library", BM_MemoryUsage)
      ->Unit(benchmark::kMicrosecond);
  benchmark::RegisterBenchmark("total_memory/library", BM_TotalMemory)
      ->Unit(benchmark::kMicrosecond);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc != 0) return rc;
  const double lib = reporter.NsPerOp("fd_count/library") / 1e3;
  const double popen_us = reporter.NsPerOp("fd_count/popen") / 1e3;
  printf("\nDescriptor count of this process (%d descriptors), wall time:\n",
         library - 2);
  qb::PrintRatio("GetFileDescriptorNum", lib, "us");
  qb::PrintRatio("popen(\"/bin/ls -l /proc/PID/fd | /usr/bin/wc -l\")",
                 popen_us, "us");
  qb::PrintRatio("popen / library", popen_us / lib, "x");
  qb::PrintRatio("GetMemoryUsagekb",
                 reporter.NsPerOp("memory_usage/library") / 1e3, "us");
  qb::PrintRatio("GetTotalMemory",
                 reporter.NsPerOp("total_memory/library") / 1e3, "us");
  return 0;
}
