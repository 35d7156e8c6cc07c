// Compacting a spool queue whose head was blanked, and removing the
// temporary copies that a killed rewrite left behind. Not exported.
#ifndef QUVAIDX_UTIL_QUEUE_COMPACT_H_
#define QUVAIDX_UTIL_QUEUE_COMPACT_H_

#include <sys/types.h>

namespace quvaidx {

// Compaction pays when the blanked part is at least this large and at least
// as large as the rest: each byte is then copied at most once per byte
// blanked, so a queue drains in linear time, and the file stays within
// twice its live size plus this.
inline constexpr off_t kCompactMinBytes = 1 << 20;

// Replaces the queue `path`, whose locked descriptor is `fd`, by a new file
// holding its bytes from `from` on: made in the same directory, locked
// before it gets its name, given the queue's owner, group and permission
// bits less every execute and set-id bit, synced, and renamed over the
// queue. The file is made without a name (O_TMPFILE) and linked as
// "<path>.XXXXXX" just before the rename, so a kill at any moment leaves a
// copy only in that short window (RemoveStaleQueueCopies removes it);
// where the filesystem cannot make unnamed files, the copy is named from
// the start. Writers waiting for the old file's lock follow the new one.
// Returns the new file's locked descriptor (O_RDWR, O_CLOEXEC); the caller
// closes both. -1 with errno and the queue unchanged on failure.
int CompactQueue(const char* path, int fd, off_t from);

// True when `name` is `base` + "." + six letters or digits: the name of a
// temporary copy of the queue `base` made by mkstemp or by CompactQueue.
bool IsQueueCopyName(const char* name, const char* base);

// Removes the regular files beside the queue `path` whose names
// IsQueueCopyName accepts, calling `removed(name)` for each. The caller
// holds the queue's lock, so that no copy still being written is taken.
// Returns the number removed; -1 with errno when the directory cannot be
// read.
int RemoveQueueCopies(const char* path,
                      void (*removed)(const char* name, const char* path));

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_QUEUE_COMPACT_H_
