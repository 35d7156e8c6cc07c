// Appending entries to spool-queue files.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include "quvahost/quvahost.h"
#include "quvaidx/system.h"
#include "util/hooks.h"
#include "util/log_internal.h"
#include "util/queue_file.h"

namespace {

constexpr char kModule[] = "quvaidx_system";
constexpr int kQueueOpenFlags = O_RDWR | O_CREAT | O_APPEND | O_SYNC;
constexpr int kMaxOpenRetries = 16;
constexpr int kLineBufferSize = 4097;

// True when the queue already holds a line equal to `entry`.
bool QueueHoldsEntry(const char* queue, const char* entry, size_t length) {
  char line[kLineBufferSize];
  return QLIBCFileGetLine(queue, entry, line, sizeof(line), 0x404) > 0 &&
         strlen(line) == length;
}

}  // namespace

int WriteIndexQueue(const char* entry, const char* queue) {
  if (entry == nullptr || queue == nullptr) return -1;
  size_t length = strlen(entry);
  if (length > static_cast<size_t>(kMaxQueueEntry) ||
      memchr(entry, '\n', length) != nullptr) {
    // A cut entry would lose its line feed and glue itself to the next
    // one; a line feed would split it into two bogus entries.
    quvaidx::LogDirect(LOG_ERR,
                       "%s: %s(%d) - refused entry of %zu bytes for %s: "
                       "line feed or longer than %d bytes",
                       kModule, "WriteIndexQueue", __LINE__, length, queue,
                       kMaxQueueEntry);
    return -1;
  }

  int fd = -1;
  for (int retries = 0;;) {
    if (QueueHoldsEntry(queue, entry, length)) return 0;
    // O_NOFOLLOW: a link planted at the queue path is refused (ELOOP, in
    // the line below), not written through.
    // 0666: a queue holds text, never anything to execute.
    fd = open(queue, kQueueOpenFlags | O_CLOEXEC | O_NOFOLLOW, 0666);
    if (fd >= 0) {
      if (flock(fd, LOCK_EX) != 0) {
        int err = errno;
        quvaidx::LogDirect(LOG_ERR,
                           "%s: %s(%d) - failed to lock file descriptor of "
                           "%s, reason=%s",
                           kModule, "WriteIndexQueue", __LINE__, queue,
                           strerror(err));
        close(fd);
        return -1;
      }
      if (quvaidx::StillTheQueue(fd, queue)) break;
      close(fd);  // replaced meanwhile: open the new one
      continue;
    }
    int err = errno;
    quvaidx::LogDirect(LOG_ERR, "(%s, %d) open(%s, %d) failed, reason=%s\n",
                       kModule, __LINE__, queue, kQueueOpenFlags,
                       strerror(err));
    if (err != EACCES || retries++ >= kMaxOpenRetries) return -1;
    quvaidx::SleepSeconds(1);
  }

  char line[kMaxQueueEntry + 1];
  memcpy(line, entry, length);
  line[length] = '\n';
  int result = 0;
  struct stat before;
  bool sized = fstat(fd, &before) == 0;
  ssize_t written = write(fd, line, length + 1);
  if (written != static_cast<ssize_t>(length + 1)) {
    // A short write (disk full) would leave a torn line that glues itself
    // to the next entry: take it back while the lock is still held.
    int err = written < 0 ? errno : ENOSPC;
    if (written > 0 && sized) {
      if (ftruncate(fd, before.st_size) != 0) {
        // nothing more can be done; the failure is reported below
      }
    }
    quvaidx::LogDirect(LOG_ERR,
                       "%s: %s(%d) - failed to write (%s, %zu) into %s, "
                       "reason=%s",
                       kModule, "WriteIndexQueue", __LINE__, entry, length,
                       queue, strerror(err));
    result = -1;
  }
  flock(fd, LOCK_UN);
  close(fd);
  return result;
}
