// Locking a spool-queue file, following a file replaced meanwhile.
#include "util/queue_file.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "util/file_io.h"

namespace quvaidx {

bool StillTheQueue(int fd, const char* path) {
  struct stat open_file;
  struct stat at_path;
  return fstat(fd, &open_file) == 0 && stat(path, &at_path) == 0 &&
         SameFile(open_file, at_path);
}

int OpenLockedQueue(const char* path, int flags, mode_t mode) {
  for (;;) {
    int fd = open(path, flags | O_CLOEXEC | O_NONBLOCK, mode);
    if (fd < 0) return -1;
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
      close(fd);
      errno = EINVAL;
      return -1;
    }
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) & ~O_NONBLOCK);
    int locked;
    while ((locked = flock(fd, LOCK_EX)) != 0 && errno == EINTR) {
    }
    if (locked != 0) {
      int err = errno;
      close(fd);
      errno = err;
      return -1;
    }
    if (StillTheQueue(fd, path)) return fd;
    close(fd);  // replaced while we waited: lock the new file
  }
}

}  // namespace quvaidx
