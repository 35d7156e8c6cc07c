// Leveled logging to the system log.
//
// Every line has a level, an integer chosen by the caller. A line is written
// only when its level is at or below the process-wide threshold g_log_level
// (initially 3). The library uses 3 for errors, 6 for progress notes and 7 for
// debug notes; whatever passes is written to the system log at LOG_ERR
// priority, whatever its level.
//
// By convention every format starts with "%s:%d " and the first two
// arguments are the writing module's name and the source line of the call.
//
// Threads: the helpers keep no state besides g_log_level and format into a
// stack buffer of their own, so they may be called from any thread.
// g_log_level is a plain variable, read and written without synchronisation.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_LOG_H_
#define QUVAIDX_LOG_H_

#include <json/json.h>

#include "quvaidx/export.h"

extern "C" {

// The process-wide log threshold. Lines whose level is greater are dropped
// before any formatting is done. May be read or set directly.
QUVAIDX_API extern int g_log_level;

// Stores `level` in g_log_level. Any value is accepted. (The name is spelled
// so, without the n.)
QUVAIDX_API void ChageLogLevel(int level);

// Formats a printf-style message and writes it to the system log, if `level`
// is at or below g_log_level. The message is cut at 16383 bytes. The text is
// logged verbatim: a '%' inside the formatted message is not interpreted
// again.
QUVAIDX_API void AppLogError(int level, const char* format, ...)
    QUVAIDX_PRINTF(2, 3);

// As AppLogError, followed by the compact JSON text of `value` (which ends in
// a line feed). The value is serialised only when the line passes the
// threshold. The whole line is cut at 16383 bytes; a message that already
// fills the line is written alone.
QUVAIDX_API void AppLogJson(int level, Json::Value& value, const char* format,
                            ...) QUVAIDX_PRINTF(3, 4);

}  // extern "C"

#endif  // QUVAIDX_LOG_H_
