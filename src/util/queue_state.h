// The consumer's bookkeeping of a spool queue, kept in a small side file
// "<queue>.consumer" beside the queue. Not exported.
//
// A consumer does not rewrite the queue to remove a finished entry: it
// overwrites the entry's bytes with line feeds, so the queue stays pure
// text (empty lines, which no writer writes and no entry equals). The side
// file remembers where the first line not known to be done begins (the
// head: every byte before it is a line feed), so that the next call does
// not read the blanked part again, and how often the entry at the head was
// attempted, so that an entry that kills its consumer is not retried for
// ever.
//
// The side file is only a hint. Every access to it happens under the
// queue's exclusive flock; it is written without fsync (it survives the
// death of a process, not of the machine), and a side file that is missing,
// torn, foreign or about another file is ignored: the head is then found by
// reading from the start of the queue once.
#ifndef QUVAIDX_UTIL_QUEUE_STATE_H_
#define QUVAIDX_UTIL_QUEUE_STATE_H_

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <string>

namespace quvaidx {

// One queue file: a file put in its place (by compaction, by
// FileRemoveHeadingLine, or deleted and made again) differs in device and
// inode or, where the filesystem records one, in its birth time, so an
// inode number used again is not mistaken for the old file.
struct QueueIdentity {
  uint64_t dev = 0;         // st_dev
  uint64_t ino = 0;         // st_ino
  int64_t birth_sec = 0;    // statx birth time; 0 where not recorded
  uint32_t birth_nsec = 0;  // its nanoseconds
};

bool operator==(const QueueIdentity& a, const QueueIdentity& b);

struct QueueState {
  QueueIdentity file;       // the queue file that `head` is about
  int64_t head = 0;         // offset of the first line not known to be done
  int32_t tries = 0;        // attempts counted for the entry below
  uint32_t entry_size = 0;  // that entry's length in bytes
  uint64_t entry_hash = 0;  // and its EntryHash
};

// Size of the side file's record: one line padded with spaces.
inline constexpr size_t kQueueStateSize = 256;

// The side file of `queue`: queue + ".consumer".
std::string QueueStatePath(const char* queue);

// A 64-bit FNV-1a hash of `entry`, to recognise the entry whose attempts
// are counted without keeping its text.
uint64_t EntryHash(const std::string& entry);

// The identity of the open file `fd`, and its size in *size unless null
// (one statx call). Returns false when that fails (errno set).
bool IdentifyQueue(int fd, QueueIdentity* id, off_t* size = nullptr);

// The record of `state`: exactly kQueueStateSize bytes of text, ending in a
// line feed, with a checksum over its fields.
std::string FormatQueueState(const QueueState& state);

// Parses a record as FormatQueueState writes it. Returns false, with
// *state untouched, for anything else (torn, foreign, bad checksum, numbers
// out of range).
bool ParseQueueState(const char* data, size_t size, QueueState* state);

// Reads the side file of `queue`. Returns false, with *state reset to the
// default, when it is missing, cannot be read or does not parse.
bool LoadQueueState(const char* queue, QueueState* state);

// Writes `state` to the side file of `queue`, made with mode 0666 less the
// umask when missing; never through a link, never into anything but a
// regular file. Not synced. A state with nothing to remember (head 0, no
// attempts) removes the side file instead. Returns false on failure (errno
// set).
bool StoreQueueState(const char* queue, const QueueState& state);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_QUEUE_STATE_H_
