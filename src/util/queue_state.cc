// The side file of a spool queue's consumer: its record, and reading and
// writing it.
#include "util/queue_state.h"

#include <errno.h>
#include <fcntl.h>
#include <inttypes.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <string_view>

namespace quvaidx {
namespace {

constexpr char kMagic[] = "quvaidx-queue-state";
constexpr char kVersion[] = "1";
constexpr char kSumField[] = " sum=";

uint32_t Fnv1a32(std::string_view text) {
  uint32_t hash = 2166136261u;
  for (unsigned char c : text) {
    hash ^= c;
    hash *= 16777619u;
  }
  return hash;
}

// Parses `text`, all decimal digits (at most 20), into *out; false when it
// is empty, holds anything else or exceeds `max`.
bool ParseDecimal(std::string_view text, uint64_t max, uint64_t* out) {
  if (text.empty() || text.size() > 20) return false;
  uint64_t value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return false;
    const uint64_t digit = static_cast<uint64_t>(c - '0');
    if (value > (max - digit) / 10) return false;
    value = value * 10 + digit;
  }
  *out = value;
  return true;
}

// Parses exactly 16 lowercase hexadecimal digits.
bool ParseHash(std::string_view text, uint64_t* out) {
  if (text.size() != 16) return false;
  uint64_t value = 0;
  for (char c : text) {
    int digit;
    if (c >= '0' && c <= '9') {
      digit = c - '0';
    } else if (c >= 'a' && c <= 'f') {
      digit = c - 'a' + 10;
    } else {
      return false;
    }
    value = value << 4 | static_cast<uint64_t>(digit);
  }
  *out = value;
  return true;
}

// Takes the next space-separated field of *text, which must begin with
// `key`, and returns what follows the key; false when it does not.
bool TakeField(std::string_view* text, std::string_view key,
               std::string_view* value) {
  const size_t space = text->find(' ');
  std::string_view field = text->substr(0, space);
  *text = space == std::string_view::npos ? std::string_view()
                                          : text->substr(space + 1);
  if (field.substr(0, key.size()) != key) return false;
  *value = field.substr(key.size());
  return true;
}

// Reads whatever the file `fd` holds, up to kQueueStateSize + 1 bytes.
ssize_t ReadRecord(int fd, char* buffer) {
  size_t have = 0;
  while (have < kQueueStateSize + 1) {
    ssize_t got = pread(fd, buffer + have, kQueueStateSize + 1 - have,
                        static_cast<off_t>(have));
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got < 0) return -1;
    if (got == 0) break;
    have += static_cast<size_t>(got);
  }
  return static_cast<ssize_t>(have);
}

}  // namespace

bool operator==(const QueueIdentity& a, const QueueIdentity& b) {
  return a.dev == b.dev && a.ino == b.ino && a.birth_sec == b.birth_sec &&
         a.birth_nsec == b.birth_nsec;
}

std::string QueueStatePath(const char* queue) {
  return std::string(queue) + ".consumer";
}

uint64_t EntryHash(const std::string& entry) {
  uint64_t hash = 14695981039346656037ull;
  for (unsigned char c : entry) {
    hash ^= c;
    hash *= 1099511628211ull;
  }
  return hash;
}

bool IdentifyQueue(int fd, QueueIdentity* id, off_t* size) {
  struct statx stx;
  if (statx(fd, "", AT_EMPTY_PATH, STATX_INO | STATX_SIZE | STATX_BTIME,
            &stx) != 0) {
    return false;
  }
  *id = QueueIdentity();
  id->dev = makedev(stx.stx_dev_major, stx.stx_dev_minor);
  id->ino = stx.stx_ino;
  if ((stx.stx_mask & STATX_BTIME) != 0) {
    id->birth_sec = stx.stx_btime.tv_sec;
    id->birth_nsec = stx.stx_btime.tv_nsec;
  }
  if (size != nullptr) *size = static_cast<off_t>(stx.stx_size);
  return true;
}

std::string FormatQueueState(const QueueState& s) {
  char fields[kQueueStateSize];
  const int n = snprintf(
      fields, sizeof(fields),
      "%s %s dev=%" PRIu64 " ino=%" PRIu64 " birth=%" PRId64 ".%09" PRIu32
      " head=%" PRId64 " tries=%" PRId32 " entry=%" PRIu32 ":%016" PRIx64,
      kMagic, kVersion, s.file.dev, s.file.ino, s.file.birth_sec,
      s.file.birth_nsec, s.head, s.tries, s.entry_size, s.entry_hash);
  std::string record(fields, static_cast<size_t>(n));
  char sum[32];
  snprintf(sum, sizeof(sum), "%s%08" PRIx32, kSumField, Fnv1a32(record));
  record += sum;
  record.resize(kQueueStateSize - 1, ' ');
  record += '\n';
  return record;
}

bool ParseQueueState(const char* data, size_t size, QueueState* state) {
  std::string_view text(data, size);
  const size_t newline = text.find('\n');
  if (newline == std::string_view::npos) return false;
  text = text.substr(0, newline);
  while (!text.empty() && text.back() == ' ') text.remove_suffix(1);
  const size_t sum_at = text.rfind(kSumField);
  if (sum_at == std::string_view::npos) return false;
  const std::string_view fields = text.substr(0, sum_at);
  uint64_t sum;
  const std::string_view sum_text = text.substr(sum_at + strlen(kSumField));
  if (sum_text.size() != 8 ||
      !ParseHash(std::string(8, '0') + std::string(sum_text), &sum) ||
      sum != Fnv1a32(fields)) {
    return false;
  }
  QueueState parsed;
  std::string_view rest = fields, value;
  uint64_t number;
  if (!TakeField(&rest, kMagic, &value) || !value.empty()) return false;
  if (!TakeField(&rest, kVersion, &value) || !value.empty()) return false;
  if (!TakeField(&rest, "dev=", &value) ||
      !ParseDecimal(value, UINT64_MAX, &parsed.file.dev)) {
    return false;
  }
  if (!TakeField(&rest, "ino=", &value) ||
      !ParseDecimal(value, UINT64_MAX, &parsed.file.ino)) {
    return false;
  }
  if (!TakeField(&rest, "birth=", &value)) return false;
  const bool negative = !value.empty() && value[0] == '-';
  if (negative) value.remove_prefix(1);
  const size_t dot = value.find('.');
  if (dot == std::string_view::npos || value.size() - dot - 1 != 9 ||
      !ParseDecimal(value.substr(0, dot), INT64_MAX, &number)) {
    return false;
  }
  parsed.file.birth_sec =
      negative ? -static_cast<int64_t>(number) : static_cast<int64_t>(number);
  if (!ParseDecimal(value.substr(dot + 1), 999999999, &number)) return false;
  parsed.file.birth_nsec = static_cast<uint32_t>(number);
  if (!TakeField(&rest, "head=", &value) ||
      !ParseDecimal(value, INT64_MAX, &number)) {
    return false;
  }
  parsed.head = static_cast<int64_t>(number);
  if (!TakeField(&rest, "tries=", &value) ||
      !ParseDecimal(value, INT32_MAX, &number)) {
    return false;
  }
  parsed.tries = static_cast<int32_t>(number);
  if (!TakeField(&rest, "entry=", &value)) return false;
  const size_t colon = value.find(':');
  if (colon == std::string_view::npos ||
      !ParseDecimal(value.substr(0, colon), UINT32_MAX, &number) ||
      !ParseHash(value.substr(colon + 1), &parsed.entry_hash) ||
      !rest.empty()) {
    return false;
  }
  parsed.entry_size = static_cast<uint32_t>(number);
  *state = parsed;
  return true;
}

bool LoadQueueState(const char* queue, QueueState* state) {
  *state = QueueState();
  const std::string path = QueueStatePath(queue);
  const int fd =
      open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) return false;
  // Anything but a regular file there fails to be read (a FIFO, a
  // directory) or to parse (a device).
  char buffer[kQueueStateSize + 1];
  const ssize_t got = ReadRecord(fd, buffer);
  close(fd);
  return got > 0 && ParseQueueState(buffer, static_cast<size_t>(got), state);
}

bool StoreQueueState(const char* queue, const QueueState& state) {
  const std::string path = QueueStatePath(queue);
  if (state.head == 0 && state.tries == 0) {
    // Nothing to remember: a queue without bookkeeping has no side file.
    return unlink(path.c_str()) == 0 || errno == ENOENT;
  }
  const int fd =
      open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK,
           0666);
  if (fd < 0) return false;
  const std::string record = FormatQueueState(state);
  struct stat st;
  bool ok = fstat(fd, &st) == 0 && S_ISREG(st.st_mode);
  if (!ok) errno = EINVAL;
  ok = ok && pwrite(fd, record.data(), record.size(), 0) ==
                 static_cast<ssize_t>(record.size());
  // One record and nothing after it, so a longer file left by anyone else
  // cannot change what is read back.
  if (ok && st.st_size > static_cast<off_t>(record.size())) {
    ok = ftruncate(fd, static_cast<off_t>(record.size())) == 0;
  }
  const int err = errno;
  close(fd);
  errno = err;
  return ok;
}

}  // namespace quvaidx
