// The consumer side of spool queues: reading the head, removing what was
// done, trimming by hand. All under the queue's exclusive flock.
#include "quvaidx/spool_consumer.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "quvaidx/system.h"
#include "util/file_io.h"
#include "util/log_internal.h"
#include "util/queue_file.h"

namespace {

constexpr char kModule[] = "quvaidx_system";
constexpr size_t kReadBlock = 64 * 1024;

// Reads a queue file line by line from its current offset, holding at most
// kMaxQueueEntry bytes of a line.
class LineReader {
 public:
  explicit LineReader(int fd) : fd_(fd), block_(kReadBlock) {}

  // Stores the next line without its line feed in *entry, or the empty
  // string for a line that no writer of the library writes (empty, too long,
  // holding a zero byte). Returns 1 for a line, 0 at the end of the file, -1
  // when reading fails.
  int Next(std::string* entry) {
    entry->clear();
    bool started = false;
    bool too_long = false;
    for (;;) {
      if (pos_ == len_) {
        if (end_) break;
        ssize_t got = read(fd_, block_.data(), block_.size());
        if (got < 0) {
          if (errno == EINTR) continue;  // Retry
          return -1;
        }
        pos_ = 0;
        len_ = static_cast<size_t>(got);
        end_ = got == 0;
        continue;
      }
      started = true;
      const char* start = block_.data() + pos_;
      const size_t available = len_ - pos_;
      const void* newline = memchr(start, '\n', available);
      const size_t length = newline != nullptr
                                ? static_cast<const char*>(newline) - start
                                : available;
      if (!too_long) {
        if (entry->size() + length > static_cast<size_t>(kMaxQueueEntry)) {
          too_long = true;  // the rest of the line is skipped, not kept
          entry->clear();
        } else {
          entry->append(start, length);
        }
      }
      pos_ += length + (newline != nullptr ? 1 : 0);
      if (newline != nullptr) break;
    }
    if (!started) return 0;
    if (too_long || memchr(entry->data(), '\0', entry->size()) != nullptr) {
      entry->clear();
    }
    return 1;
  }

 private:
  int fd_;
  std::vector<char> block_;
  size_t pos_ = 0;    // next unread byte of block_
  size_t len_ = 0;    // bytes held in block_
  bool end_ = false;  // read(2) reported the end of the file
};

// True when `value` is an array of strings.
bool IsStringArray(const Json::Value& value) {
  if (!value.isArray()) return false;
  for (const Json::Value& item : value) {
    if (!item.isString()) return false;
  }
  return true;
}

// True when `entry` can be a line of its own: what WriteIndexQueue accepts,
// less the empty entry.
bool IsQueueableEntry(const std::string& entry) {
  return !entry.empty() &&
         entry.size() <= static_cast<size_t>(kMaxQueueEntry) &&
         entry.find('\n') == std::string::npos &&
         entry.find('\0') == std::string::npos;
}

void LogFailure(const char* function, int line, const char* what,
                const char* queue, int err) {
  quvaidx::LogDirect(LOG_ERR, "%s: %s(%d) - failed to %s %s, reason=%s",
                     kModule, function, line, what, queue,
                     strerror(err != 0 ? err : EIO));
}

// Appends `lines` to the locked queue `fd`. On a short write the torn tail
// is cut off again, as WriteIndexQueue does. Returns 0 or an errno value.
int AppendLines(int fd, const std::string& lines) {
  off_t before = lseek(fd, 0, SEEK_END);
  if (quvaidx::WriteAll(fd, lines.data(), lines.size()) && fdatasync(fd) == 0) {
    return 0;
  }
  int err = errno != 0 ? errno : EIO;
  if (before >= 0 && ftruncate(fd, before) != 0) {
    // nothing more can be done; the failure is reported by the caller
  }
  return err;
}

}  // namespace

int ReadQueueHead(const char* queue, int max_entries, Json::Value& entries) {
  if (queue == nullptr || max_entries < 1) return -1;
  try {
    int fd = quvaidx::OpenLockedQueue(queue, O_RDONLY, 0);
    if (fd < 0) {
      if (errno == ENOENT) {
        entries = Json::Value(Json::arrayValue);
        return 0;
      }
      LogFailure("ReadQueueHead", __LINE__, "lock", queue, errno);
      return -1;
    }
    Json::Value head(Json::arrayValue);
    LineReader reader(fd);
    std::string line;
    int count = 0;
    int got = 0;
    while (count < max_entries && (got = reader.Next(&line)) > 0) {
      head.append(line);
      ++count;
    }
    int err = errno;
    close(fd);  // releases the lock
    if (got < 0) {
      LogFailure("ReadQueueHead", __LINE__, "read", queue, err);
      return -1;
    }
    entries.swap(head);
    return count;
  } catch (...) {  // out of memory: no exception leaves the library
    return -1;
  }
}

int RemoveDoneQueueEntries(const char* queue, const Json::Value& done,
                           const Json::Value& requeue) {
  if (queue == nullptr || !IsStringArray(done) || !IsStringArray(requeue)) {
    return -1;
  }
  try {
    std::string appended;
    for (const Json::Value& item : requeue) {
      std::string entry = item.asString();
      if (IsQueueableEntry(entry)) appended += entry + "\n";
    }
    const int flags = appended.empty() ? O_RDONLY : O_RDWR | O_APPEND | O_CREAT;
    int fd = quvaidx::OpenLockedQueue(queue, flags, 0777);
    if (fd < 0) {
      if (errno == ENOENT) return 0;  // nothing to remove, nothing to add
      LogFailure("RemoveDoneQueueEntries", __LINE__, "lock", queue, errno);
      return -1;
    }
    // First the tail, then the head: a crash in between leaves an entry
    // twice, never lost.
    if (!appended.empty()) {
      int err = AppendLines(fd, appended);
      if (err != 0) {
        close(fd);
        LogFailure("RemoveDoneQueueEntries", __LINE__, "append to", queue, err);
        return -1;
      }
    }
    if (lseek(fd, 0, SEEK_SET) != 0) {
      int err = errno;
      close(fd);
      LogFailure("RemoveDoneQueueEntries", __LINE__, "read", queue, err);
      return -1;
    }
    LineReader reader(fd);
    std::string line;
    int matched = 0;
    for (const Json::Value& item : done) {
      int got = reader.Next(&line);
      if (got < 0) {
        int err = errno;
        close(fd);
        LogFailure("RemoveDoneQueueEntries", __LINE__, "read", queue, err);
        return -1;
      }
      if (got == 0 || line != item.asString()) break;
      ++matched;
    }
    int result = matched;
    if (matched > 0 && FileRemoveHeadingLine(queue, matched) != 0) {
      LogFailure("RemoveDoneQueueEntries", __LINE__, "trim", queue, errno);
      result = -1;
    }
    close(fd);
    return result;
  } catch (...) {  // out of memory: no exception leaves the library
    return -1;
  }
}

int TrimQueueHead(const char* queue, int n) {
  if (queue == nullptr) return -1;
  int fd = quvaidx::OpenLockedQueue(queue, O_RDONLY, 0);
  if (fd < 0) {
    LogFailure("TrimQueueHead", __LINE__, "lock", queue, errno);
    return -1;
  }
  int result = 0;
  if (n > 0 && FileRemoveHeadingLine(queue, n) != 0) {
    LogFailure("TrimQueueHead", __LINE__, "trim", queue, errno);
    result = -1;
  }
  close(fd);
  return result;
}
