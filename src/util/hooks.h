// Seams between the library and the operating system services that tests
// must be able to observe or avoid: the system log and the one-second sleeps.
//
// Production code reaches syslog(3) and sleep(3) through these functions;
// a test installs a replacement and restores the previous one when done.
// Not exported from the shared library.
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
// Sleeps through the installed sleeper.
unsigned SleepSeconds(unsigned seconds);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_HOOKS_H_
