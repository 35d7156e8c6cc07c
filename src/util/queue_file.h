// Locking a spool-queue file for its writers and its consumer. Not exported.
//
// A consumer compacts a queue by writing the rest to a new file and renaming
// it over the queue (as FileRemoveHeadingLine does). A process that was
// waiting for the old file's flock meanwhile holds the lock of a file nobody
// will read again: it must notice and lock the file that is at the path now.
#ifndef QUVAIDX_UTIL_QUEUE_FILE_H_
#define QUVAIDX_UTIL_QUEUE_FILE_H_

#include <sys/types.h>

namespace quvaidx {

// True when the open descriptor `fd` is still the file at `path` (same
// device and inode).
bool StillTheQueue(int fd, const char* path);

// Opens the regular file `path` with `flags` and, when they hold O_CREAT,
// `mode` (O_CLOEXEC and, for the open only, O_NONBLOCK are added, so that a
// FIFO in its place cannot block the caller) and takes its exclusive flock,
// waiting as long as another process holds it. When the file was replaced while
// this call waited, the file now at `path` is opened and locked instead.
// Returns the locked descriptor, which the caller closes (closing releases
// the lock); -1 with errno set when the open or the lock fails, and EINVAL
// when `path` is not a regular file.
int OpenLockedQueue(const char* path, int flags, mode_t mode);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_QUEUE_FILE_H_
