// Draining a spool queue through the consumer calls, against the per-entry
// rewrite of the whole queue that they replaced, measured in the same run.
#ifndef QUVAIDX_BENCH_SPOOL_DRAIN_H_
#define QUVAIDX_BENCH_SPOOL_DRAIN_H_

#include <string>
#include <vector>

namespace spool_drain {

// The queue files the comparison makes in `dir`, for a clean-up that runs
// from a signal handler (copies "<queue>.XXXXXX" that a killed rewrite
// leaves are the caller's to sweep).
std::vector<std::string> DrainFiles(const std::string& dir);

// Drains a queue of `lines` entries (folders that no longer exist; the work
// per entry is one access(2)) in `dir` with ReadQueueHead, CountQueueAttempt
// and RemoveDoneQueueEntries, in a child process that reports its rate,
// its resident memory along the way and its longest call; then drains a
// few entries of queues of 10,000, 100,000 and `lines` lines the old way
// (each finished entry removed by FileRemoveHeadingLine under the lock),
// and prints both and their ratio. Returns false when a step failed.
bool RunDrainComparison(const std::string& dir, int lines);

}  // namespace spool_drain

#endif  // QUVAIDX_BENCH_SPOOL_DRAIN_H_
