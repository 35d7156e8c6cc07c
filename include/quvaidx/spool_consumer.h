// Serving a spool queue: the consumer's side of the queue files that
// WriteIndexQueue and WriteThumbQueue (quvaidx/system.h) append to.
//
// A queue is a text file of one entry per line; writers append under the
// file's exclusive flock. The daemon that serves a queue reads entries from
// its head, does their work, and only then removes them, so that an entry
// leaves the queue once its work is done: a consumer killed in the middle of
// an entry finds it again at the head when it restarts, and redoes at most
// the entries it had not yet removed. The lock is held only while the file is
// read or rewritten, never during the work, so writers are not kept waiting:
//
//   Json::Value entries;
//   int n = ReadQueueHead(queue, 8, entries);
//   for (int i = 0; i < n; ++i) {
//     ... do the work of entries[i] ...
//     Json::Value done(Json::arrayValue);
//     done.append(entries[i]);
//     RemoveDoneQueueEntries(queue, done, Json::Value(Json::arrayValue));
//   }
//
// Every call opens the queue and takes its exclusive flock (waiting for it
// as long as another process holds it), and when the file was replaced
// meanwhile (another consumer trimmed it), locks the file that is at the path
// now. Removal goes through FileRemoveHeadingLine, which writes the rest to a
// new file and renames it over the queue under the lock; writers waiting for
// the old file's lock then append to the new one, so no entry appended
// meanwhile is lost. A queue that is not a regular file (a FIFO, a
// directory) is refused without blocking.
//
// Lines. A line ends with a line feed; a last line without one counts as a
// line. Lines that WriteIndexQueue never writes (empty, longer than
// kMaxQueueEntry bytes, holding a zero byte) are read as the empty entry, so
// that a consumer skips them and still has them removed; nothing longer than
// kMaxQueueEntry bytes is ever held in memory.
//
// Results are counts (0 or more) on success and -1 on failure; failures are
// written to the system log at error priority, whatever g_log_level, with
// module name "quvaidx_system". No state is kept between calls; calls on one
// queue serialise on its lock, also across processes.
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
// the first line goes when it equals done[0], the next when it equals
// done[1], and so on; the first line that differs ends the removal, and it
// and every later line stay. So nothing is removed that the caller did not
// name, even when another process trimmed the head meanwhile (the caller's
// entries that are gone already are simply not found). `done` is an array
// of strings in queue order, as ReadQueueHead gave them.
// Before the removal, every string of the array `requeue` is appended to the
// queue as a line of its own, whether or not an equal line is there: the
// way to send an entry whose input changed while its work ran to the back of
// the queue. A consumer that dies between the two steps leaves the entry
// twice, never lost. Strings that are empty, hold a line feed or a zero
// byte, or are longer than kMaxQueueEntry bytes are not appended.
// Returns the number of lines removed (0 when the queue is missing and
// nothing is to be appended); -1 when an argument is null or not an array of
// strings, or the queue cannot be opened, locked, read, appended to or
// rewritten (the queue then holds at least every line it held before, and
// FileRemoveHeadingLine's temporary file may be left beside it).
QUVAIDX_API int RemoveDoneQueueEntries(const char* queue,
                                       const Json::Value& done,
                                       const Json::Value& requeue);

// Removes the first `n` lines of `queue` (all of them when n is beyond the
// end; none for n <= 0) under its lock, as FileRemoveHeadingLine does:
// for an operator who drops entries by hand.
// Returns 0; -1 when `queue` is null, missing, not a regular file, or
// cannot be locked or rewritten (logged).
QUVAIDX_API int TrimQueueHead(const char* queue, int n);

#endif  // QUVAIDX_SPOOL_CONSUMER_H_
