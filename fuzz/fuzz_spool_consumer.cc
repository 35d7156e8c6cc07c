// Feeds the consumer side of spool queues arbitrary queue files and side
// files: what ReadQueueHead reads, what RemoveDoneQueueEntries then blanks,
// and the side file's record.
//
// Input: byte 0 gives the number of entries asked for, 1 + m % 64; byte 1
// (modulo 24) puts that many 2731-byte units of filler lines of 1 to 97
// bytes before the rest, so that files reach 64 KiB and lines cross the
// reader's blocks; byte 2 picks the side file (bits 0-1: none, the next
// data[3] bytes of the input as they are, a record for this file with the
// head data[3] + 256 * data[4] bytes in, or a record with the head where
// the file's leading line feeds end) and a run of line feeds put first
// (bits 2-3: none, 100, 1,500 or 70,000 bytes: within and beyond the
// checked kilobyte, and beyond the step at which a reader stores the head).
// The rest is the file's tail. Checked:
//   - ReadQueueHead returns k <= the count asked for, each entry a string
//     of at most kMaxQueueEntry bytes without '\n' or '\0', equal to the
//     model's reading: the non-empty lines from the start (a line being
//     everything up to its '\n', or the rest of the text; one that is too
//     long or holds a zero byte reads as ""), or from the recorded head
//     when the record is about this file and the bytes the library checks
//     before the head (the first byte and the kilobyte before it) are all
//     line feeds; k is short of the count only when no entry is left;
//   - RemoveDoneQueueEntries of those entries removes k, leaving exactly
//     the text with those entries turned into line feeds, or nothing when
//     no entry is left after them; no zero byte appears and nothing but the
//     side file is left beside the queue;
//   - a second RemoveDoneQueueEntries of the same entries removes only as
//     many as the next entries repeat them;
//   - a record made from input bytes parses back to itself.
// A mismatch aborts with a message.
//
// The queue may be compacted into a new file renamed over it, so it lives
// in a private directory of its own (fuzz_scratch_dir.h).
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>
#include <string_view>
#include <vector>

#include "fuzz_report.h"
#include "fuzz_scratch_dir.h"
#include "queue_filler.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"
#include "util/queue_state.h"

namespace {

using fuzz_queue::Filler;
using fuzz_queue::kFillerUnit;

constexpr size_t kMaxInput = 64 * 1024;
constexpr unsigned kFillerUnits = 24;
constexpr size_t kLeadingBlanks[] = {0, 100, 1500, 70000};
constexpr size_t kCheckedBytes = 1024;  // as the library checks a head

[[noreturn]] void Fail(const char* what, std::string_view input) {
  FuzzFail("fuzz_spool_consumer", what, input);
}

struct ModelLine {
  size_t start, end;  // as in the file; end is past the line feed
  std::string entry;  // "" for a foreign line
};

// The model: the first `max` entry lines of `text` from `from`.
std::vector<ModelLine> ModelHead(std::string_view text, size_t from,
                                 size_t max) {
  std::vector<ModelLine> lines;
  size_t at = from;
  while (lines.size() < max && at < text.size()) {
    if (text[at] == '\n') {
      ++at;
      continue;
    }
    size_t newline = text.find('\n', at);
    size_t end = newline == std::string_view::npos ? text.size() : newline;
    std::string_view line = text.substr(at, end - at);
    bool foreign = line.size() > static_cast<size_t>(kMaxQueueEntry) ||
                   line.find('\0') != std::string_view::npos;
    size_t next = newline == std::string_view::npos ? end : end + 1;
    lines.push_back({at, next, foreign ? std::string() : std::string(line)});
    at = next;
  }
  return lines;
}

bool AllLineFeeds(std::string_view text) {
  return text.find_first_not_of('\n') == std::string_view::npos;
}

// Where reading starts for a record about this file with head `head`.
size_t StartFor(std::string_view text, uint64_t head) {
  if (head == 0 || head > text.size()) return 0;
  const size_t checked = head < kCheckedBytes ? head : kCheckedBytes;
  if (!AllLineFeeds(text.substr(head - checked, checked))) return 0;
  if (head > checked && text[0] != '\n') return 0;
  return head;
}

// A record of this file's identity, with `head`.
std::string RecordFor(const std::string& queue, uint64_t head) {
  quvaidx::QueueState state;
  const int fd = open(queue.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0 || !quvaidx::IdentifyQueue(fd, &state.file)) abort();
  close(fd);
  state.head = static_cast<int64_t>(head);
  return quvaidx::FormatQueueState(state);
}

void WriteSide(const std::string& path, std::string_view bytes) {
  FILE* side = fopen(path.c_str(), "wb");
  if (side == nullptr) abort();
  fwrite(bytes.data(), 1, bytes.size(), side);
  fclose(side);
}

// A record from 36 input bytes parses back to itself.
void CheckRecordRoundTrip(const uint8_t* bytes, std::string_view input) {
  uint64_t words[4];
  memcpy(words, bytes, sizeof(words));
  uint32_t small;
  memcpy(&small, bytes + sizeof(words), sizeof(small));
  quvaidx::QueueState state;
  state.file.dev = words[0];
  state.file.ino = words[1];
  state.file.birth_sec = static_cast<int64_t>(words[2] >> 1);
  state.file.birth_nsec = small % 1000000000u;
  state.head = static_cast<int64_t>(words[3] >> 1);
  state.tries = static_cast<int32_t>(small >> 1);
  state.entry_size = small;
  state.entry_hash = words[0] ^ words[3];
  const std::string record = quvaidx::FormatQueueState(state);
  quvaidx::QueueState parsed;
  if (record.size() != quvaidx::kQueueStateSize ||
      !quvaidx::ParseQueueState(record.data(), record.size(), &parsed) ||
      !(parsed.file == state.file) || parsed.head != state.head ||
      parsed.tries != state.tries || parsed.entry_size != state.entry_size ||
      parsed.entry_hash != state.entry_hash) {
    Fail("a record does not parse back to itself", input);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 5 || size > kMaxInput) return 0;
  const std::string_view input(reinterpret_cast<const char*>(data), size);
  const size_t max = 1 + data[0] % 64;
  const int side_kind = data[2] & 3;
  std::string file(kLeadingBlanks[(data[2] >> 2) & 3], '\n');
  file += Filler(kFillerUnit * (data[1] % kFillerUnits));
  std::string_view rest = input.substr(5);
  std::string_view side_bytes;
  if (side_kind == 1) {
    side_bytes = rest.substr(0, data[3]);
    rest.remove_prefix(side_bytes.size());
  }
  file.append(rest);
  const std::string_view text(file);

  auto& scratch = fuzz_scratch::ScratchDir::Get("fuzz-spool-consumer");
  scratch.Write(text.data(), text.size(), 0600);
  const std::string side = quvaidx::QueueStatePath(scratch.file().c_str());
  uint64_t head = 0;
  if (side_kind == 1) WriteSide(side, side_bytes);
  if (side_kind == 2) head = data[3] + 256u * data[4];
  if (side_kind == 3) head = text.find_first_not_of('\n');
  if (head == std::string_view::npos) head = text.size();
  if (side_kind >= 2) WriteSide(side, RecordFor(scratch.file(), head));
  const size_t start = side_kind >= 2 ? StartFor(text, head) : 0;
  // Entries the library may skip, trusting a record over unchecked bytes.
  const bool hidden = !AllLineFeeds(text.substr(0, start));

  Json::Value entries;
  const int k =
      ReadQueueHead(scratch.file().c_str(), static_cast<int>(max), entries);
  const std::vector<ModelLine> model = ModelHead(text, start, max);
  if (k != static_cast<int>(model.size()) || !entries.isArray() ||
      entries.size() != model.size()) {
    fprintf(stderr, "read %d, model %zu\n", k, model.size());
    Fail("wrong number of entries", input);
  }
  for (Json::ArrayIndex i = 0; i < entries.size(); ++i) {
    if (!entries[i].isString() || entries[i].asString() != model[i].entry) {
      fprintf(stderr, "entry %u differs\n", i);
      Fail("wrong entry", input);
    }
  }

  const Json::Value none(Json::arrayValue);
  if (RemoveDoneQueueEntries(scratch.file().c_str(), entries, none) != k) {
    Fail("removal did not take the entries read", input);
  }
  std::string expected;
  const size_t end = model.empty() ? text.size() : model.back().end;
  if (end < text.size()) {
    expected = file;
    const size_t first = model.empty() ? end : model.front().start;
    expected.replace(first, end - first, end - first, '\n');
  }
  const std::string after = scratch.Read();
  if (after != expected) {
    fprintf(stderr, "kept %zu bytes, model %zu\n", after.size(),
            expected.size());
    Fail("wrong contents after removal", input);
  }
  unlink(side.c_str());  // kept or not, the bookkeeping is a hint
  const std::string strays = scratch.Strays();
  if (!strays.empty()) {
    fprintf(stderr, "left: %s\n", strays.c_str());
    Fail("a file left beside the queue", input);
  }

  // Again, with the side file gone: only a head that repeats the same
  // entries may go.
  if (!hidden) {
    const std::vector<ModelLine> next = ModelHead(after, 0, max);
    size_t repeats = 0;
    while (repeats < next.size() && repeats < model.size() &&
           next[repeats].entry == model[repeats].entry) {
      ++repeats;
    }
    if (RemoveDoneQueueEntries(scratch.file().c_str(), entries, none) !=
        static_cast<int>(repeats)) {
      Fail("second removal took entries it was not given", input);
    }
    unlink(side.c_str());  // don't care if there is none
  }
  if (size >= 5 + 36) CheckRecordRoundTrip(data + 5, input);
  return 0;
}
