// Feeds the consumer side of spool queues arbitrary queue files: what
// ReadQueueHead reads, and what RemoveDoneQueueEntries then removes.
//
// Input: the first byte m gives the number of entries asked for, 1 + m % 64;
// the second byte r (taken modulo 24) puts r * 2731 bytes of filler lines of
// 1 to 97 bytes before the rest, which is the file's tail, so that files
// reach 64 KiB and lines cross the reader's 64 KiB blocks. Checked:
//   - ReadQueueHead returns k <= the count asked for and k entries, each a
//     string of at most kMaxQueueEntry bytes without '\n' or '\0', equal to
//     the model's reading of the first k lines (a line being everything up
//     to its '\n', or the rest of the text; a line that is empty, too long or
//     holds a zero byte reads as ""); k is short of the count only when the
//     text has no more lines;
//   - RemoveDoneQueueEntries of exactly those entries removes k lines, and
//     the file holds the text without its first k lines, with no temporary
//     file left beside it;
//   - a second RemoveDoneQueueEntries of the same entries removes nothing
//     unless the remaining head repeats them.
// A mismatch aborts with a message.
//
// The functions rename a temporary file over the queue, so it lives in a
// private directory of its own (fuzz_scratch_dir.h).
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#include <string>
#include <string_view>
#include <vector>

#include "fuzz_report.h"
#include "fuzz_scratch_dir.h"
#include "queue_filler.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"

namespace {

using fuzz_queue::Filler;
using fuzz_queue::kFillerUnit;

constexpr size_t kMaxInput = 64 * 1024;
constexpr unsigned kFillerUnits = 24;

[[noreturn]] void Fail(const char* what, std::string_view input) {
  FuzzFail("fuzz_spool_consumer", what, input);
}

// The model: the first `max` lines of `text` as entries, and the text that
// follows them.
std::vector<std::string> ModelHead(std::string_view text, size_t max,
                                   std::string_view* rest) {
  std::vector<std::string> lines;
  while (lines.size() < max && !text.empty()) {
    size_t newline = text.find('\n');
    std::string_view line = text.substr(0, newline);
    text = newline == std::string_view::npos ? std::string_view()
                                             : text.substr(newline + 1);
    bool foreign = line.size() > static_cast<size_t>(kMaxQueueEntry) ||
                   line.find('\0') != std::string_view::npos;
    lines.push_back(foreign ? std::string() : std::string(line));
  }
  *rest = text;
  return lines;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2 || size > kMaxInput) return 0;
  const int max = 1 + data[0] % 64;
  std::string file = Filler(kFillerUnit * (data[1] % kFillerUnits));
  file.append(reinterpret_cast<const char*>(data) + 2, size - 2);
  const std::string_view text(file);
  auto& scratch = fuzz_scratch::ScratchDir::Get("fuzz-spool-consumer");
  scratch.Write(text.data(), text.size(), 0600);

  Json::Value entries;
  const int k = ReadQueueHead(scratch.file().c_str(), max, entries);
  std::string_view rest;
  const std::vector<std::string> model =
      ModelHead(text, static_cast<size_t>(max), &rest);
  if (k != static_cast<int>(model.size()) || !entries.isArray() ||
      entries.size() != model.size()) {
    fprintf(stderr, "read %d, model %zu\n", k, model.size());
    Fail("wrong number of entries", text);
  }
  for (Json::ArrayIndex i = 0; i < entries.size(); ++i) {
    if (!entries[i].isString() || entries[i].asString() != model[i]) {
      fprintf(stderr, "entry %u differs\n", i);
      Fail("wrong entry", text);
    }
  }
  const Json::Value none(Json::arrayValue);
  if (RemoveDoneQueueEntries(scratch.file().c_str(), entries, none) != k) {
    Fail("removal did not take the entries read", text);
  }
  const std::string after = scratch.Read();
  if (after != rest) {
    fprintf(stderr, "kept %zu bytes, model %zu\n", after.size(), rest.size());
    Fail("wrong contents after removal", text);
  }
  if (!scratch.Strays().empty()) Fail("temporary file left", text);
  // Again: only a head that repeats the same entries may go.
  std::string_view rest2;
  const std::vector<std::string> next =
      ModelHead(rest, static_cast<size_t>(max), &rest2);
  size_t repeats = 0;
  while (repeats < next.size() && repeats < model.size() &&
         next[repeats] == model[repeats]) {
    ++repeats;
  }
  if (RemoveDoneQueueEntries(scratch.file().c_str(), entries, none) !=
      static_cast<int>(repeats)) {
    Fail("second removal took lines it was not given", text);
  }
  return 0;
}
