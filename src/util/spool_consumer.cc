// The consumer side of spool queues: reading the head, removing what was
// done, trimming by hand, counting attempts, clearing stale copies. All
// under the queue's exclusive flock.
//
// A finished entry is blanked in place (util/queue_lines.h) and the head
// remembered in the side file (util/queue_state.h); the queue is cut to
// nothing once it holds no entry, and compacted into a new file once its
// blank part outweighs the rest (util/queue_compact.h).
#include "quvaidx/spool_consumer.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <atomic>
#include <string>

#include "quvaidx/system.h"
#include "util/file_io.h"
#include "util/log_internal.h"
#include "util/queue_compact.h"
#include "util/queue_file.h"
#include "util/queue_lines.h"
#include "util/queue_state.h"

namespace {

using quvaidx::QueueIdentity;
using quvaidx::QueueLine;
using quvaidx::QueueLineReader;
using quvaidx::QueueState;

constexpr char kModule[] = "quvaidx_system";

// A reader stores the head it found only when it lies this far beyond the
// remembered one, so that reading rarely writes.
constexpr off_t kReaderHintStep = 64 * 1024;

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
  if (before >= 0 && quvaidx::WriteAll(fd, lines.data(), lines.size()) &&
      fdatasync(fd) == 0) {
    return 0;
  }
  int err = errno != 0 ? errno : EIO;
  if (before >= 0 && ftruncate(fd, before) != 0) {
    // nothing more can be done; the failure is reported by the caller
  }
  return err;
}

// True when `entry` is the one whose attempts `state` counts.
bool IsCountedEntry(const QueueState& state, const std::string& entry) {
  return state.tries > 0 && state.entry_size == entry.size() &&
         state.entry_hash == quvaidx::EntryHash(entry);
}

// A queue held under its lock, with its bookkeeping.
class HeldQueue {
 public:
  explicit HeldQueue(const char* path) : path_(path) {}
  ~HeldQueue() {
    if (fd_ >= 0) close(fd_);
    if (new_fd_ >= 0) close(new_fd_);
  }
  HeldQueue(const HeldQueue&) = delete;
  HeldQueue& operator=(const HeldQueue&) = delete;

  // Opens and locks the queue as OpenLockedQueue does and reads its
  // bookkeeping. Returns false with errno set.
  bool Hold(int flags, mode_t mode) {
    fd_ = quvaidx::OpenLockedQueue(path_, flags, mode);
    off_t size;
    if (fd_ < 0 || !quvaidx::IdentifyQueue(fd_, &id_, &size)) return false;
    quvaidx::LoadQueueState(path_, &state_);
    head_ = quvaidx::TrustedHead(fd_, id_, size, state_);
    return true;
  }

  int fd() const { return fd_; }
  off_t head() const { return head_; }
  QueueState& state() { return state_; }

  // Records that every byte before `head` is a line feed. With `rewrite`,
  // a queue left without an entry is cut to nothing and one whose blank
  // part outweighs the rest is compacted. The bookkeeping is then stored
  // when it changed, or always with `store`. What fails here costs speed
  // on a later call, never an entry. Returns false when the bookkeeping
  // could not be stored (errno set).
  bool Settle(off_t head, bool rewrite, bool store) {
    struct stat st;
    if (rewrite && fstat(fd_, &st) == 0) {
      if (head >= st.st_size) {
        if (st.st_size > 0 && ftruncate(fd_, 0) == 0) head = 0;
      } else if (head >= quvaidx::kCompactMinBytes &&
                 head >= st.st_size - head) {
        Compact(head);
        if (new_fd_ >= 0) head = 0;
      }
    }
    head_ = head;
    if (!store && head == state_.head && state_.file == id_) return true;
    state_.file = id_;
    state_.head = head;
    return quvaidx::StoreQueueState(path_, state_);
  }

 private:
  void Compact(off_t head) {
    new_fd_ = quvaidx::CompactQueue(path_, fd_, head);
    if (new_fd_ >= 0) {
      quvaidx::IdentifyQueue(new_fd_, &id_);
      return;
    }
    // Tried again on every later removal, so one line per process says
    // why the queue is not getting smaller.
    static std::atomic<bool> logged{false};
    if (!logged.exchange(true)) {
      LogFailure("RemoveDoneQueueEntries", __LINE__, "compact", path_, errno);
    }
  }

  const char* path_;
  int fd_ = -1;      // the queue, locked
  int new_fd_ = -1;  // its compacted replacement, locked, or -1
  QueueIdentity id_;
  QueueState state_;
  off_t head_ = 0;
};

// Blanks the first entries of the held queue for which `take(i, line)`
// holds, i = 0, 1, ..., stopping at the first that fails it or at the end.
// Returns the number blanked, or -1 (errno set) when reading or blanking
// fails; *head receives where the queue's head is afterwards.
template <typename Take>
int BlankLeadingEntries(HeldQueue& queue, Take take, off_t* head) {
  QueueLineReader reader(queue.fd(), queue.head());
  QueueLine line;
  off_t first = -1;  // start of the first entry taken
  off_t end = queue.head();
  int taken = 0;
  int got;
  while ((got = reader.Next(&line)) > 0) {
    if (!take(taken, line)) break;
    if (first < 0) first = line.start;
    end = line.end;
    ++taken;
  }
  if (got < 0) return -1;
  if (taken == 0) {
    // Nothing taken: the head is the first entry there is, or the end.
    *head = got > 0 ? line.start : reader.offset();
    return 0;
  }
  if (!quvaidx::BlankRange(queue.fd(), first, end)) return -1;
  *head = end;
  return taken;
}

}  // namespace

int ReadQueueHead(const char* queue, int max_entries, Json::Value& entries) {
  if (queue == nullptr || max_entries < 1) return -1;
  try {
    HeldQueue held(queue);
    if (!held.Hold(O_RDONLY, 0)) {
      if (errno == ENOENT) {
        entries = Json::Value(Json::arrayValue);
        return 0;
      }
      LogFailure("ReadQueueHead", __LINE__, "lock", queue, errno);
      return -1;
    }
    Json::Value head(Json::arrayValue);
    QueueLineReader reader(held.fd(), held.head());
    QueueLine line;
    off_t first = -1;
    int got = 0;
    while (static_cast<int>(head.size()) < max_entries &&
           (got = reader.Next(&line)) > 0) {
      if (first < 0) first = line.start;
      head.append(line.text);
    }
    if (got < 0) {
      LogFailure("ReadQueueHead", __LINE__, "read", queue, errno);
      return -1;
    }
    if (first < 0) first = reader.offset();
    if (first - held.head() >= kReaderHintStep) {
      held.Settle(first, /*rewrite=*/false, /*store=*/false);  // a hint
    }
    entries.swap(head);
    return static_cast<int>(entries.size());
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
    HeldQueue held(queue);
    if (!held.Hold(appended.empty() ? O_RDWR : O_RDWR | O_CREAT, 0666)) {
      if (errno == ENOENT) return 0;  // nothing to remove, nothing to add
      LogFailure("RemoveDoneQueueEntries", __LINE__, "lock", queue, errno);
      return -1;
    }
    // First the tail, then the head: a crash in between leaves an entry
    // twice, never lost.
    if (!appended.empty()) {
      int err = AppendLines(held.fd(), appended);
      if (err != 0) {
        LogFailure("RemoveDoneQueueEntries", __LINE__, "append to", queue, err);
        return -1;
      }
    }
    bool counted_done = false;
    off_t head = 0;
    const int removed = BlankLeadingEntries(
        held,
        [&](int i, const QueueLine& line) {
          if (static_cast<Json::ArrayIndex>(i) >= done.size() ||
              line.text != done[i].asString()) {
            return false;
          }
          counted_done =
              counted_done || IsCountedEntry(held.state(), line.text);
          return true;
        },
        &head);
    if (removed < 0) {
      LogFailure("RemoveDoneQueueEntries", __LINE__, "blank the head of", queue,
                 errno);
      return -1;
    }
    if (counted_done) held.state().tries = 0;
    // The bookkeeping is a hint, except for the attempts reset here.
    held.Settle(head, /*rewrite=*/true, /*store=*/counted_done);
    return removed;
  } catch (...) {  // out of memory: no exception leaves the library
    return -1;
  }
}

int TrimQueueHead(const char* queue, int n) {
  if (queue == nullptr) return -1;
  try {
    HeldQueue held(queue);
    if (!held.Hold(O_RDWR, 0)) {
      LogFailure("TrimQueueHead", __LINE__, "lock", queue, errno);
      return -1;
    }
    if (n <= 0) return 0;
    off_t head = 0;
    const int removed = BlankLeadingEntries(
        held, [n](int i, const QueueLine&) { return i < n; }, &head);
    if (removed < 0) {
      LogFailure("TrimQueueHead", __LINE__, "trim", queue, errno);
      return -1;
    }
    if (removed > 0) held.state().tries = 0;  // the head entry changed
    held.Settle(head, /*rewrite=*/true, /*store=*/removed > 0);
    return 0;
  } catch (...) {  // out of memory: no exception leaves the library
    return -1;
  }
}

int CountQueueAttempt(const char* queue, const char* entry) {
  if (queue == nullptr || entry == nullptr) return -1;
  try {
    HeldQueue held(queue);
    if (!held.Hold(O_RDONLY, 0)) {
      LogFailure("CountQueueAttempt", __LINE__, "lock", queue, errno);
      return -1;
    }
    QueueState& state = held.state();
    const std::string text(entry);
    if (IsCountedEntry(state, text)) {
      if (state.tries < INT32_MAX) ++state.tries;
    } else {
      state.tries = 1;
      state.entry_size = static_cast<uint32_t>(text.size());
      state.entry_hash = quvaidx::EntryHash(text);
    }
    if (!held.Settle(held.head(), /*rewrite=*/false, /*store=*/true)) {
      LogFailure("CountQueueAttempt", __LINE__, "count an attempt in",
                 quvaidx::QueueStatePath(queue).c_str(), errno);
      return -1;
    }
    return state.tries;
  } catch (...) {  // out of memory: no exception leaves the library
    return -1;
  }
}

int RemoveStaleQueueCopies(const char* queue) {
  if (queue == nullptr) return -1;
  HeldQueue held(queue);
  if (!held.Hold(O_RDONLY, 0) && errno != ENOENT) {
    LogFailure("RemoveStaleQueueCopies", __LINE__, "lock", queue, errno);
    return -1;
  }
  const int removed = quvaidx::RemoveQueueCopies(queue, [](const char* name,
                                                           const char* path) {
    quvaidx::LogDirect(LOG_WARNING,
                       "%s: %s(%d) - removed %s, a copy of %s left by a "
                       "rewrite that did not finish",
                       kModule, "RemoveStaleQueueCopies", __LINE__, name, path);
  });
  if (removed < 0) {
    LogFailure("RemoveStaleQueueCopies", __LINE__, "read the folder of", queue,
               errno);
  }
  return removed;
}
