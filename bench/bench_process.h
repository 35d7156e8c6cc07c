// Other programs run by the benchmarks: baselines (ffprobe, vipsthumbnail,
// convert) and the daemons under measure.
#ifndef QUVAIDX_BENCH_BENCH_PROCESS_H_
#define QUVAIDX_BENCH_BENCH_PROCESS_H_

#include <sys/types.h>

#include <string>
#include <vector>

namespace quvaidx_bench {

// Starts `argv` (its first word looked up in PATH) with standard output on
// /dev/null, and standard error too unless `keep_stderr`. Returns the
// child's pid, or -1.
pid_t SpawnQuiet(const std::vector<std::string>& argv,
                 bool keep_stderr = false);

// Waits for `pid`. Returns its exit status, or -1 when it did not exit.
int WaitExit(pid_t pid);

}  // namespace quvaidx_bench

#endif  // QUVAIDX_BENCH_BENCH_PROCESS_H_
