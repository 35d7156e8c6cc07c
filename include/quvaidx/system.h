// System helpers of a daemon: waiting for the appliance to finish booting,
// starting other programs, spool-queue files, file utilities and process
// statistics.
//
// Spool queues are text files with one entry per line, appended under an
// exclusive flock. The thumbnail queue "/var/spool/thumb_create.queue" is
// served by the daemon of "/var/run/quvamkthumbd.pid", the web-video queue
// "/var/spool/flv_create.queue" by that of "/var/run/quvamkflvd.pid"
// (quvaidx/paths.h). A daemon that consumes a queue trims the lines it has done
// with FileRemoveHeadingLine while holding the queue's exclusive flock.
//
// Module "quvaidx_system". Nothing here keeps state between calls.
#ifndef QUVAIDX_SYSTEM_H_
#define QUVAIDX_SYSTEM_H_

#include "quvaidx/export.h"

// The preview work a path needs. Other values select nothing.
enum _tag_THUMB_TYPE_ : int {
  THUMB_TYPE_PHOTO = 1,  // photo thumbnails: the thumbnail queue
  THUMB_TYPE_VIDEO = 2,  // web video: the web-video queue
};

// Longest spool-queue entry, in bytes, without its line feed.
constexpr int kMaxQueueEntry = 4095;

// Returns once the host reports boot step 4, asking every 10 seconds. After
// 900 seconds of waiting it writes "[NOTICE] system is not ready? start
// anyway." to the system log (whatever g_log_level) and returns all the
// same; the caller is not told which ended the wait. The host is asked at
// most 91 times.
QUVAIDX_API void WaitSystemReady();

// Starts `path` with the argument vector `argv` (null-terminated, as execv
// takes it) in a child whose standard streams are on /dev/null. The child
// inherits every descriptor not marked close-on-exec, and aborts when the
// program cannot be executed. SIGCHLD's SA_NOCLDWAIT flag is cleared around
// the fork and set again afterwards if it was set, so this must not run
// while other code changes SIGCHLD's disposition.
// Returns the child's id (also when the program then fails to start), or -1
// when no child could be made. The child is not waited for.
QUVAIDX_API int ForkExecv(const char* path, char* const argv[]);

// ---------------------------------------------------------------------------
// Spool queues

// Appends `entry` and a line feed to the queue file `queue` (created with
// mode 0666 less the umask: never executable), unless a line equal to it is
// already there. The file is opened with O_APPEND | O_SYNC and written
// under an exclusive flock; if the file was replaced (trimmed or compacted
// by its consumer) while this call waited for the lock, the new file at
// `queue` is opened and locked instead, so no entry goes to an unlinked
// file. A consumer's finished entries are empty lines (see
// quvaidx/spool_consumer.h), so one never counts as a line equal to a new
// entry. An open refused with EACCES is retried up to 16
// times, one second apart. The duplicate test runs before the lock, so two
// processes queueing the same entry at once may both append it.
// Returns 0 when the entry is in the queue afterwards; -1 for a null
// argument, an entry holding a line feed or longer than kMaxQueueEntry
// bytes (the queue is left untouched), or a failed open, lock or write
// (logged).
QUVAIDX_API int WriteIndexQueue(const char* entry, const char* queue);

// Queues the preview work for `path`, a directory or regular file:
//   THUMB_TYPE_PHOTO: a web photo's folder, or a directory itself, goes to
//     the thumbnail queue;
//   THUMB_TYPE_VIDEO: a web video, or a directory, goes to the web-video
//     queue;
// then wakes the queue's daemon with SIGUSR1, also when the path was of no
// interest. The daemon must be alive by the host's alive check (a pid file
// naming a dead or recycled pid counts as no daemon), so no unrelated
// process is ever signalled.
// Returns 0 (also at once, doing nothing, for any other type); -1 when the
// path cannot be examined or is neither directory nor file, when the
// daemon is not alive (nothing queued), or when queueing failed.
QUVAIDX_API int WriteThumbQueue(const char* path, _tag_THUMB_TYPE_ type);

// ---------------------------------------------------------------------------
// File utilities

// Returns the canonical absolute path of `path` (as realpath(3)), or a plain
// copy when it cannot be resolved; null (logged) when `path` is null or no
// memory is left. The caller frees the result with free().
QUVAIDX_API char* GetRealPath(const char* path);

// Renames `source` to `destination` without ever replacing a destination:
// when one exists, from the start or appearing meanwhile, nothing is done,
// both files stay and the result is 0. Other failures are retried up to 16
// times. Returns 0; -1 when the source does not exist (not logged), on
// ENOENT during the rename, or after the 16th failed try (both logged).
QUVAIDX_API int RenameFile(const char* source, const char* destination);

// Removes the first `n` lines of the file at `path` (all lines for n beyond
// the end; none for n <= 0): the rest is copied to a temporary file
// "<path>.XXXXXX" beside it, synced, given the file's owner, group and mode,
// and renamed over it. Takes no lock: a caller that trims a spool queue
// holds the queue's exclusive flock around the call. Consumers use
// quvaidx/spool_consumer.h instead, which does not rewrite the queue per
// entry; its RemoveStaleQueueCopies removes a temporary file left by a
// process killed during this call.
// Returns 0, or -1 with the file unchanged (the temporary file removed,
// unless its close or the rename failed).
QUVAIDX_API int FileRemoveHeadingLine(const char* path, int n);

// ---------------------------------------------------------------------------
// Process statistics (from /proc; sizes in kilobytes)

// Returns the number of open descriptors of process `pid` plus one (what a
// long listing of /proc/PID/fd counts with its header line), or 0 when that
// directory cannot be read. Starts no other process.
QUVAIDX_API int GetFileDescriptorNum(int pid);

// Reads VmRSS and VmSize from the first 4096 bytes of /proc/PID/status.
// Both outputs are set to -1 first; a label without a number leaves its
// output at -1 but counts as found. Returns 0 when both labels were found.
QUVAIDX_API int GetMemoryUsagekb(int pid, long& rss, long& vmsize);

// Reads MemTotal from /proc/meminfo into `total` (-1 first). Returns 0 when
// found, else -1.
QUVAIDX_API int GetTotalMemory(long& total);

#endif  // QUVAIDX_SYSTEM_H_
