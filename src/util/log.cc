#include "quvaidx/log.h"

#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <syslog.h>

#include <string>

#include "util/hooks.h"
#include "util/log_internal.h"

int g_log_level = 3;

namespace {

constexpr size_t kLogBufferSize = 16384;

// Formats into buf (kLogBufferSize bytes) and returns the length written,
// never more than kLogBufferSize - 1.
size_t FormatMessage(char* buf, const char* format, va_list args) {
  int n = vsnprintf(buf, kLogBufferSize, format, args);
  if (n < 0) {
    buf[0] = '\0';
    return 0;
  }
  return static_cast<size_t>(n) < kLogBufferSize ? static_cast<size_t>(n)
                                                 : kLogBufferSize - 1;
}

}  // namespace

namespace quvaidx {

void LogDirect(int priority, const char* format, ...) {
  char buf[kLogBufferSize];
  va_list args;
  va_start(args, format);
  FormatMessage(buf, format, args);
  va_end(args);
  WriteLogLine(priority, buf);
}

}  // namespace quvaidx

extern "C" {

void ChageLogLevel(int level) { g_log_level = level; }

void AppLogError(int level, const char* format, ...) {
  if (level > g_log_level) return;
  char buf[kLogBufferSize];
  va_list args;
  va_start(args, format);
  FormatMessage(buf, format, args);
  va_end(args);
  quvaidx::WriteLogLine(LOG_ERR, buf);
}

void AppLogJson(int level, Json::Value& value, const char* format, ...) {
  if (level > g_log_level) return;
  std::string text;
  try {
    text = Json::FastWriter().write(value);
  } catch (...) {
    // Out of memory while serialising: log the message alone.
  }
  char buf[kLogBufferSize];
  va_list args;
  va_start(args, format);
  size_t used = FormatMessage(buf, format, args);
  va_end(args);
  snprintf(buf + used, kLogBufferSize - used, "%s", text.c_str());
  quvaidx::WriteLogLine(LOG_ERR, buf);
}

}  // extern "C"
