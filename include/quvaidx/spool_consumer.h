// Serving a spool queue: the consumer's side of the queue files that
// WriteIndexQueue and WriteThumbQueue (quvaidx/system.h) append to.
//
// A queue is a text file of one entry per line; writers append under the
// file's exclusive flock. The daemon that serves a queue reads entries from
// its head, does their work, and only then removes them, so that an entry
// leaves the queue once its work is done: a consumer killed in the middle of
// an entry finds it again at the head when it restarts, and redoes at most
// the entries it had not yet removed. The lock is held only while the file is
// read or its bookkeeping done, never during the work, so writers are not
// kept waiting:
//
//   RemoveStaleQueueCopies(queue);  // once, at start
//   Json::Value entries;
//   int n = ReadQueueHead(queue, 8, entries);
//   for (int i = 0; i < n; ++i) {
//     if (CountQueueAttempt(queue, entries[i].asCString()) > 3) {
//       ... log it and skip its work: it killed us three times ...
//     } else {
//       ... do the work of entries[i] ...
//     }
//     Json::Value done(Json::arrayValue);
//     done.append(entries[i]);
//     RemoveDoneQueueEntries(queue, done, Json::Value(Json::arrayValue));
//   }
//
// Every call opens the queue and takes its exclusive flock (waiting for it
// as long as another process holds it), and when the file was replaced
// meanwhile (compacted by another consumer, or trimmed with
// FileRemoveHeadingLine), locks the file that is at the path now. A queue
// that is not a regular file (a FIFO, a directory) is refused without
// blocking.
//
// Bookkeeping. Finishing an entry does not rewrite the queue: the entry's
// bytes are overwritten in place, first with zero bytes and then with line
// feeds, so the file stays text that writers append to as before, and a
// writer's duplicate test (which reads the whole file, without the lock)
// never finds a finished entry, nor a part of one, as a line. Where the
// first unfinished entry begins, and how often the head entry was
// attempted, is kept in a small side file "<queue>.consumer" (there only
// while there is something to remember; written
// under the queue's lock, not synced: a hint that survives the death of
// its process; one that is missing, damaged or about another file is
// ignored, and the head is then found by reading from the start once). A
// queue left without entries is cut to nothing in place; one whose blanked
// part is at least 1 MiB and outweighs the rest is compacted: the rest is
// copied to a new file (unnamed until just before it is renamed over the
// queue, so a killed consumer leaves no copy but in that moment),
// which keeps the queue's owner, group and read and write bits. So a queue
// drains in time linear in its size, in constant memory, and writers wait
// for the lock no longer than one entry's bookkeeping, or one compaction.
//
// Lines. A line ends with a line feed; a last line without one counts as a
// line. Empty lines are not entries (finished entries become empty lines):
// they are skipped, and go when the queue is cut or compacted. Lines that
// WriteIndexQueue never writes (longer than kMaxQueueEntry bytes, holding a
// zero byte) are read as the empty entry, so that a consumer skips their
// work and still has them removed; nothing longer than kMaxQueueEntry bytes
// is ever held in memory.
//
// Results are counts (0 or more) on success and -1 on failure; failures are
// written to the system log at error priority, whatever g_log_level, with
// module name "quvaidx_system". Calls on one queue serialise on its lock,
// also across processes.
//
// These names are exported with their parameter types (C++ linkage).
#ifndef QUVAIDX_SPOOL_CONSUMER_H_
#define QUVAIDX_SPOOL_CONSUMER_H_

#include <json/json.h>

#include "quvaidx/export.h"

// Replaces `entries` with an array of the first `max_entries` entries of
// `queue` (fewer when the queue is shorter), in queue order, as strings
// without their line feeds. A missing queue reads as empty.
// Returns the number of entries read; -1 with `entries` unchanged when
// `queue` is null, max_entries < 1, or the queue cannot be opened, locked or
// read, or is not a regular file.
QUVAIDX_API int ReadQueueHead(const char* queue, int max_entries,
                              Json::Value& entries);

// Removes finished entries from the head of `queue`, under its lock:
// the first entry goes when it equals done[0], the next when it equals
// done[1], and so on; the first entry that differs ends the removal, and it
// and every later entry stay. So nothing is removed that the caller did not
// name, even when another process trimmed the head meanwhile (the caller's
// entries that are gone already are simply not found). `done` is an array
// of strings in queue order, as ReadQueueHead gave them.
// Before the removal, every string of the array `requeue` is appended to the
// queue as a line of its own, whether or not an equal line is there (and
// synced): the way to send an entry whose input changed while its work ran
// to the back of the queue. A consumer that dies between the two steps
// leaves the entry twice, never lost. Strings that are empty, hold a line
// feed or a zero byte, or are longer than kMaxQueueEntry bytes are not
// appended. A queue made here has mode 0666 less the umask.
// Removing the entry whose attempts CountQueueAttempt counts resets its
// count.
// Returns the number of entries removed (0 when the queue is missing and
// nothing is to be appended); -1 when an argument is null or not an array of
// strings, or the queue cannot be opened for writing, locked, read,
// appended to or blanked (the queue then holds every entry it held before;
// one whose blanking failed half-way reads as "").
QUVAIDX_API int RemoveDoneQueueEntries(const char* queue,
                                       const Json::Value& done,
                                       const Json::Value& requeue);

// Removes the first `n` entries of `queue` (all of them when n is beyond
// the end; none for n <= 0) under its lock, as RemoveDoneQueueEntries
// removes entries: for an operator who drops entries by hand. Resets the
// attempt count.
// Returns 0; -1 when `queue` is null, missing, not a regular file, or
// cannot be opened for writing, locked or blanked (logged).
QUVAIDX_API int TrimQueueHead(const char* queue, int n);

// Counts an attempt at `entry`, the head entry of `queue` that the caller
// is about to work on, and returns the number of this attempt: 1 the first
// time, one more on each later call for the same entry, so that an entry
// that kills its consumer is seen again after the restart with a higher
// number and can be skipped after a few (log it, then remove it with
// RemoveDoneQueueEntries). The count starts at 1 again when the entry
// differs from the one counted last, and after RemoveDoneQueueEntries or
// TrimQueueHead removed the counted entry. It is kept in the queue's side
// file under the queue's lock, without fsync: it survives the death of the
// consumer, not of the machine.
// Returns the attempt number; -1 when an argument is null, or the queue
// cannot be opened or locked, or the count cannot be stored (logged).
QUVAIDX_API int CountQueueAttempt(const char* queue, const char* entry);

// Removes what a rewrite of `queue` killed half-way left behind: regular
// files beside it named "<queue>.XXXXXX" (a dot and exactly six letters or
// digits, as FileRemoveHeadingLine and compaction name their copies),
// under the queue's lock (without it when the queue is missing), each
// logged at warning priority. Nothing else is touched, the side file
// "<queue>.consumer" included. For a daemon to call at start.
// Returns the number of files removed; -1 when `queue` is null, or the
// queue cannot be locked or its folder read (logged).
QUVAIDX_API int RemoveStaleQueueCopies(const char* queue);

#endif  // QUVAIDX_SPOOL_CONSUMER_H_
