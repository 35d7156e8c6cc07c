// Reading the entry lines of a locked spool queue from its head, and
// blanking finished ones in place. Not exported.
//
// A queue file is text: lines end with a line feed, and a last line without
// one counts as a line. Empty lines are not entries (they are what a
// finished entry becomes) and are skipped. A line that no writer of the
// library writes (longer than kMaxQueueEntry bytes, holding a zero byte)
// is an entry that reads as "", so that a consumer skips its work and still
// has it removed. Nothing longer than kMaxQueueEntry bytes of a line is
// ever held in memory.
#ifndef QUVAIDX_UTIL_QUEUE_LINES_H_
#define QUVAIDX_UTIL_QUEUE_LINES_H_

#include <sys/types.h>

#include <string>
#include <vector>

#include "util/queue_state.h"

namespace quvaidx {

// One entry line of a queue file.
struct QueueLine {
  off_t start = 0;   // offset of its first byte
  off_t end = 0;     // offset just past its line feed (or the end of file)
  std::string text;  // without the line feed; "" for a foreign line
};

// Reads the entry lines of `fd` from `offset` on, with pread (the file
// offset is not used), in blocks that start small, since the head of a
// queue is usually wanted a few lines at a time, and grow while empty lines
// are skipped.
class QueueLineReader {
 public:
  QueueLineReader(int fd, off_t offset);

  // Stores the next entry line in *line. Returns 1 for a line, 0 at the end
  // of the file, -1 when reading fails (errno set).
  int Next(QueueLine* line);

  // Where reading goes on: past the last line returned and the empty lines
  // after it that were already read.
  off_t offset() const { return block_offset_ + static_cast<off_t>(pos_); }

 private:
  // Reads the next block; false at the end of the file or on failure
  // (failed_ set).
  bool Refill();

  int fd_;
  std::vector<char> block_;
  off_t block_offset_;  // file offset of block_[0]
  size_t pos_ = 0;      // next unread byte of block_
  size_t len_ = 0;      // bytes held in block_
  size_t next_size_;    // size of the next read
  bool failed_ = false;
};

// Where the head of the locked queue `fd` (of identity `id`, `size` bytes)
// begins according to `state`: its head when it is about this file, lies
// within it, and the bytes before it that are checked (the first byte and
// up to a kilobyte before the head) are all line feeds; else 0, the start.
// A queue truncated or made anew in place thus never has entries skipped.
off_t TrustedHead(int fd, const QueueIdentity& id, off_t size,
                  const QueueState& state);

// Turns the bytes of [start, end) of `fd` into line feeds, in two passes:
// first every other byte becomes a zero byte, then line feeds. A writer
// scanning the queue without the lock (the duplicate test) thus never sees
// part of a line as a line of its own: at any moment each line is whole,
// holds a zero byte, or is empty. Returns false when reading or writing
// fails (errno set); the range then holds lines that read as "".
bool BlankRange(int fd, off_t start, off_t end);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_QUEUE_LINES_H_
