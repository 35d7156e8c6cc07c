// Internal constants of the line search, visible to its tests.
#ifndef QUVAHOST_PLATFORM_FILE_LINE_H_
#define QUVAHOST_PLATFORM_FILE_LINE_H_

#include <stddef.h>

namespace quvahost {

// Bytes read from the file per read(2) in QLIBCFileGetLine.
inline constexpr size_t kLineSearchBlock = 64 * 1024;

}  // namespace quvahost

#endif  // QUVAHOST_PLATFORM_FILE_LINE_H_
