// Seams between the library and the operating system services that tests
// must be able to observe or avoid: the system log and the sleeps of the
// retry loops.
//
// Production code reaches syslog(3) and sleep(3) through these functions;
// a test installs a replacement and restores the previous one when done.
// Not exported from the shared library.
//
// Every internal seam of the library follows one convention:
//   - Set<Seam>(replacement) installs the replacement and returns what was
//     in force before, so a caller restores it by installing that value
//     again;
//   - installing null restores the production default; for a seam made of
//     several members (a table or a set of paths), each null member
//     restores its own default;
//   - installing is not synchronised: do it while no other thread uses the
//     seam.
// The seams are SetLogSink and SetSleepFunction here, SetSpoolPaths
// (file/spool_paths.h), SetIndexSockets (requests/index_requests_internal.h)
// and, in the host stand-in, SetHostOps (platform/host_ops.h), through which
// tests/support/fake_host.h installs its hooks.
#ifndef QUVAIDX_UTIL_HOOKS_H_
#define QUVAIDX_UTIL_HOOKS_H_

namespace quvaidx {

// Receives one finished log line and its syslog priority.
using LogSink = void (*)(int priority, const char* line);
// Sleeps for `seconds`; returns what sleep(3) returns.
using SleepFunction = unsigned (*)(unsigned seconds);

// Installs `sink` (null restores syslog) and returns the previous one.
LogSink SetLogSink(LogSink sink);
// Installs `sleeper` (null restores sleep(3)) and returns the previous one.
SleepFunction SetSleepFunction(SleepFunction sleeper);

// Writes `line` to the system log (or the installed sink) verbatim.
void WriteLogLine(int priority, const char* line);
// Sleeps through the installed sleeper. Every sleep of the library, sleep(0)
// included, goes through here.
unsigned SleepSeconds(unsigned seconds);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_HOOKS_H_
