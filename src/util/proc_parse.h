// Parsers of /proc texts, on buffers so that they can be tested and fuzzed
// without the process filesystem. Not exported.
#ifndef QUVAIDX_UTIL_PROC_PARSE_H_
#define QUVAIDX_UTIL_PROC_PARSE_H_

#include <stddef.h>

namespace quvaidx {

// Scans the lines of text[0, length) for "VmRSS:" and "VmSize:" anywhere in
// a line and reads the number after the line's first word. Sets *rss and
// *vmsize to -1 first; a label without a number leaves its output at -1.
// Returns true when both labels were seen.
bool ParseProcStatus(const char* text, size_t length, long* rss, long* vmsize);

// Reads the number of the first line holding "MemTotal:" into *total (-1
// first). Returns true when such a line was seen.
bool ParseMemInfo(const char* text, size_t length, long* total);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_PROC_PARSE_H_
