// Direct system-log lines, for the modules that log whatever g_log_level.
// Not exported.
#ifndef QUVAIDX_UTIL_LOG_INTERNAL_H_
#define QUVAIDX_UTIL_LOG_INTERNAL_H_

#include "quvaidx/export.h"

namespace quvaidx {

// Formats a line (cut at 16383 bytes) and writes it to the system log with
// `priority`, regardless of g_log_level.
void LogDirect(int priority, const char* format, ...) QUVAIDX_PRINTF(2, 3);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_LOG_INTERNAL_H_
