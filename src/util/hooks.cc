#include "util/hooks.h"

#include <syslog.h>
#include <unistd.h>

namespace quvaidx {
namespace {

void SyslogSink(int priority, const char* line) {
  syslog(priority, "%s", line);
}

LogSink g_sink = SyslogSink;
SleepFunction g_sleeper = ::sleep;

}  // namespace

LogSink SetLogSink(LogSink sink) {
  LogSink previous = g_sink;
  g_sink = sink != nullptr ? sink : SyslogSink;
  return previous;
}

SleepFunction SetSleepFunction(SleepFunction sleeper) {
  SleepFunction previous = g_sleeper;
  g_sleeper = sleeper != nullptr ? sleeper : ::sleep;
  return previous;
}

void WriteLogLine(int priority, const char* line) { g_sink(priority, line); }

unsigned SleepSeconds(unsigned seconds) { return g_sleeper(seconds); }

}  // namespace quvaidx
