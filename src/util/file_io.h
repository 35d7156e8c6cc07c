// Small file helpers shared inside the library. Not exported.
#ifndef QUVAIDX_UTIL_FILE_IO_H_
#define QUVAIDX_UTIL_FILE_IO_H_

#include <stddef.h>
#include <sys/stat.h>

namespace quvaidx {

// Writes all `n` bytes of `buf` to `fd`, retrying after EINTR. Returns false
// on any other error, with errno set.
bool WriteAll(int fd, const char* buf, size_t n);

// True when `a` and `b` describe the same file (device and inode).
inline bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_FILE_IO_H_
