// Canonical paths, renames that never replace, trimming a file's head.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include "quvaidx/log.h"
#include "quvaidx/system.h"
#include "util/file_io.h"
#include "util/hooks.h"
#include "util/log_internal.h"

namespace quvaidx {

bool WriteAll(int fd, const char* buf, size_t n) {
  while (n > 0) {
    ssize_t done = write(fd, buf, n);
    if (done < 0) {
      if (errno == EINTR) continue;  // Retry
      return false;
    }
    buf += done;
    n -= static_cast<size_t>(done);
  }
  return true;
}

}  // namespace quvaidx

namespace {

constexpr char kModule[] = "quvaidx_system";
constexpr int kRenameTries = 16;
constexpr size_t kCopyBlock = 64 * 1024;

// Moves source to destination unless destination exists. Returns 0 when
// moved, 1 when the destination exists (nothing changed), -1 with errno.
int RenameNoReplace(const char* source, const char* destination) {
  if (renameat2(AT_FDCWD, source, AT_FDCWD, destination, RENAME_NOREPLACE) ==
      0) {
    return 0;
  }
  if (errno == EEXIST) return 1;
  if (errno != EINVAL && errno != ENOSYS) return -1;
  // The filesystem cannot rename without replacing: a hard link fails
  // instead of replacing, then the source name goes.
  if (link(source, destination) == 0) {
    unlink(source);  // the data is safe under the new name either way
    return 0;
  }
  if (errno == EEXIST) return 1;
  if (errno != EPERM && errno != EOPNOTSUPP) return -1;
  // No hard links either (FAT and the like): the plain rename, whose
  // existence test above is all the protection such filesystems allow.
  return rename(source, destination) == 0 ? 0 : -1;
}

// Copies everything of `in` after its first `n` lines to `out`. Returns
// false when reading or writing failed.
bool CopyAfterLines(int in, int out, int n) {
  char block[kCopyBlock];
  int skipped = 0;
  for (;;) {
    ssize_t got = read(in, block, sizeof(block));
    if (got < 0) {
      if (errno == EINTR) continue;  // Retry
      return false;
    }
    if (got == 0) return true;
    const char* start = block;
    const char* end = block + got;
    while (skipped < n && start < end) {
      const void* newline =
          memchr(start, '\n', static_cast<size_t>(end - start));
      if (newline == nullptr) {
        start = end;  // the line goes on in the next block
      } else {
        start = static_cast<const char*>(newline) + 1;
        ++skipped;
      }
    }
    if (!quvaidx::WriteAll(out, start, static_cast<size_t>(end - start)))
      return false;
  }
}

}  // namespace

char* GetRealPath(const char* path) {
  if (path != nullptr) {
    char* resolved = realpath(path, nullptr);
    if (resolved != nullptr) return resolved;
    char* copy = strdup(path);
    if (copy != nullptr) return copy;
  }
  quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetRealPath: %s", kModule,
                     __LINE__, path != nullptr ? path : "(null)");
  return nullptr;
}

int RenameFile(const char* source, const char* destination) {
  struct stat st;
  if (stat(destination, &st) == 0) return 0;
  if (stat(source, &st) != 0) return -1;
  for (int tries = 0; tries < kRenameTries; ++tries) {
    int moved = RenameNoReplace(source, destination);
    if (moved >= 0) return 0;  // moved, or a destination appeared: kept
    if (errno == ENOENT) {
      AppLogError(3, "%s:%d [Error] rename: %s -> %s", kModule, __LINE__,
                  source, destination);
      return -1;
    }
    quvaidx::SleepSeconds(0);  // yield, then try again
  }
  AppLogError(3, "%s:%d [Error] rename reach max retry: %s -> %s", kModule,
              __LINE__, source, destination);
  return -1;
}

int FileRemoveHeadingLine(const char* path, int n) {
  if (path == nullptr) return -1;
  // The copy replaces whatever the path names: through a link, the link
  // would become a copy of its target.
  // O_NONBLOCK: opening a FIFO planted there must not wait for a writer.
  int in = open(path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (in < 0) {
    if (errno == ELOOP) {
      AppLogError(3, "%s:%d [Error] %s is a symbolic link; not trimmed",
                  kModule, __LINE__, path);
    }
    return -1;
  }
  struct stat st;
  if (fstat(in, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(in);
    return -1;
  }
  std::string temp_path = std::string(path) + ".XXXXXX";
  int out = mkostemp(&temp_path[0], O_CLOEXEC);
  if (out < 0) {
    close(in);
    return -1;
  }
  bool ok = CopyAfterLines(in, out, n) && fsync(out) == 0 &&
            fchown(out, st.st_uid, st.st_gid) == 0 &&
            fchmod(out, st.st_mode & 07777) == 0;
  close(in);
  if (!ok) {
    close(out);
    unlink(temp_path.c_str());
    return -1;
  }
  if (close(out) != 0 || rename(temp_path.c_str(), path) != 0) {
    const int err = errno;
    unlink(temp_path.c_str());  // the queue itself is untouched
    errno = err;
    return -1;
  }
  return 0;
}
