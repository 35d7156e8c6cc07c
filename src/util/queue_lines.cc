// Reading entry lines from a queue's head; blanking finished lines.
#include "util/queue_lines.h"

#include <errno.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>

#include "quvaidx/system.h"

namespace quvaidx {
namespace {

constexpr size_t kFirstBlock = 4 * 1024;
constexpr size_t kLargestBlock = 64 * 1024;
// Bytes before a remembered head that must all be line feeds.
constexpr off_t kHeadCheckBytes = 1024;

ssize_t PreadRetry(int fd, char* buf, size_t n, off_t offset) {
  for (;;) {
    ssize_t got = pread(fd, buf, n, offset);
    if (got >= 0 || errno != EINTR) return got;  // Retry on EINTR
  }
}

bool PwriteAll(int fd, const char* buf, size_t n, off_t offset) {
  while (n > 0) {
    ssize_t done = pwrite(fd, buf, n, offset);
    if (done < 0) {
      if (errno == EINTR) continue;  // Retry
      return false;
    }
    buf += done;
    n -= static_cast<size_t>(done);
    offset += done;
  }
  return true;
}

// True when the `n` bytes of `fd` at `offset` can be read and are all line
// feeds.
bool AllLineFeeds(int fd, off_t offset, size_t n) {
  char buf[kHeadCheckBytes];
  if (n > sizeof(buf) ||
      PreadRetry(fd, buf, n, offset) != static_cast<ssize_t>(n)) {
    return false;
  }
  return std::all_of(buf, buf + n, [](char c) { return c == '\n'; });
}

}  // namespace

QueueLineReader::QueueLineReader(int fd, off_t offset)
    : fd_(fd), block_offset_(offset), next_size_(kFirstBlock) {}

bool QueueLineReader::Refill() {
  block_offset_ += static_cast<off_t>(len_);
  pos_ = 0;
  len_ = 0;
  if (block_.size() < next_size_) block_.resize(next_size_);
  ssize_t got = PreadRetry(fd_, block_.data(), next_size_, block_offset_);
  if (got < 0) {
    failed_ = true;
    return false;
  }
  len_ = static_cast<size_t>(got);
  next_size_ = std::min(next_size_ * 2, kLargestBlock);
  return got > 0;
}

int QueueLineReader::Next(QueueLine* line) {
  line->text.clear();
  // Skip empty lines.
  for (;;) {
    while (pos_ < len_ && block_[pos_] == '\n') ++pos_;
    if (pos_ < len_) break;
    if (!Refill()) return failed_ ? -1 : 0;
  }
  line->start = offset();
  bool foreign = false;
  for (;;) {
    const char* start = block_.data() + pos_;
    const size_t available = len_ - pos_;
    const void* newline = memchr(start, '\n', available);
    const size_t length = newline != nullptr
                              ? static_cast<const char*>(newline) - start
                              : available;
    if (!foreign) {
      if (line->text.size() + length > static_cast<size_t>(kMaxQueueEntry) ||
          memchr(start, '\0', length) != nullptr) {
        foreign = true;  // the rest of the line is skipped, not kept
        line->text.clear();
      } else {
        line->text.append(start, length);
      }
    }
    pos_ += length + (newline != nullptr ? 1 : 0);
    if (newline != nullptr) break;
    if (!Refill()) {
      if (failed_) return -1;
      break;  // a last line without its line feed
    }
  }
  line->end = offset();
  return 1;
}

off_t TrustedHead(int fd, const QueueIdentity& id, off_t size,
                  const QueueState& state) {
  const off_t head = static_cast<off_t>(state.head);
  if (!(state.file == id) || head <= 0 || head > size) return 0;
  const off_t checked = std::min(head, kHeadCheckBytes);
  if (!AllLineFeeds(fd, head - checked, static_cast<size_t>(checked)) ||
      (head > checked && !AllLineFeeds(fd, 0, 1))) {
    return 0;
  }
  return head;
}

bool BlankRange(int fd, off_t start, off_t end) {
  std::vector<char> buf(
      static_cast<size_t>(std::min<off_t>(end - start, kLargestBlock)));
  for (char fill : {'\0', '\n'}) {
    for (off_t at = start; at < end;) {
      const size_t n =
          static_cast<size_t>(std::min<off_t>(end - at, kLargestBlock));
      const ssize_t got = PreadRetry(fd, buf.data(), n, at);
      if (got <= 0) {
        if (got == 0) errno = EIO;  // the range was read before: cut meanwhile
        return false;
      }
      bool changed = false;
      for (ssize_t i = 0; i < got; ++i) {
        // The first pass keeps the line feeds, so lines keep their bounds.
        if (buf[i] != '\n' && buf[i] != fill) {
          buf[i] = fill;
          changed = true;
        }
      }
      if (changed && !PwriteAll(fd, buf.data(), static_cast<size_t>(got), at)) {
        return false;
      }
      at += got;
    }
  }
  return true;
}

}  // namespace quvaidx
