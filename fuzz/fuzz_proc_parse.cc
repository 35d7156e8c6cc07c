// Feeds the /proc text parsers arbitrary text: quvaidx::ParseProcStatus
// (VmRSS and VmSize of /proc/PID/status) and quvaidx::ParseMemInfo
// (MemTotal of /proc/meminfo).
//
// Input: the first byte chooses how the rest is read. Even: the rest is the
// text, byte for byte. Odd: the bytes 0x01, 0x02 and 0x03 of the rest stand
// for "VmRSS:", "VmSize:" and "MemTotal:", so that the fuzzer reaches the
// labels without a dictionary. The parsers get a heap copy of exactly the
// text's length with no terminator after it, so a read past the end is
// caught by AddressSanitizer.
//
// Checked against a model written from the parsers' contract: only the
// first 4096 bytes count; lines end at '\n'; a line holds a label when the
// label occurs anywhere in it; its value is what sscanf "%*s %ld" reads
// from the line (up to its first NUL). Outputs start at -1. ParseProcStatus
// reads lines in order until both labels have been seen, the value of each
// line that holds a label and a number replacing the one before;
// ParseMemInfo takes the first line holding "MemTotal:". The results and
// the outputs must equal the model's. A mismatch aborts with a message.
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz_report.h"
#include "util/proc_parse.h"

namespace {

constexpr size_t kReadLimit = 4096;

[[noreturn]] void Fail(const char* what, std::string_view input) {
  FuzzFail("fuzz_proc_parse", what, input);
}

std::string Decode(const uint8_t* data, size_t size) {
  if (size == 0) return "";
  std::string text;
  const bool expand = (data[0] & 1) != 0;
  for (size_t i = 1; i < size; ++i) {
    char c = static_cast<char>(data[i]);
    if (expand && c == 0x01) {
      text += "VmRSS:";
    } else if (expand && c == 0x02) {
      text += "VmSize:";
    } else if (expand && c == 0x03) {
      text += "MemTotal:";
    } else {
      text += c;
    }
  }
  return text;
}

// The lines of the text as the contract reads them: the first kReadLimit
// bytes split at '\n'; a line feed at the very end opens no further line.
std::vector<std::string> Lines(std::string_view text) {
  text = text.substr(0, kReadLimit);
  std::vector<std::string> lines;
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string_view::npos) end = text.size();
    lines.emplace_back(text.substr(start, end - start));
    start = end + 1;
  }
  return lines;
}

// Reads into *value what sscanf "%*s %ld" reads from the line; false, with
// *value untouched, when that reads no number.
bool LineValue(const std::string& line, long* value) {
  long number = 0;
  if (sscanf(line.c_str(), "%*s %ld", &number) != 1) return false;
  *value = number;
  return true;
}

bool Holds(const std::string& line, const char* label) {
  return line.find(label) != std::string::npos;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > 64 * 1024) return 0;
  const std::string text = Decode(data, size);
  // Exactly the text's bytes, nothing readable after them.
  std::unique_ptr<char[]> copy(new char[text.size() + 1]);
  memcpy(copy.get(), text.data(), text.size());
  const char* buffer = copy.get();
  const std::vector<std::string> lines = Lines(text);

  long want_rss = -1;
  long want_vmsize = -1;
  bool have_rss = false;
  bool have_vmsize = false;
  for (const std::string& line : lines) {
    if (have_rss && have_vmsize) break;
    // A line without a number leaves the earlier value.
    if (Holds(line, "VmRSS:")) {
      have_rss = true;
      LineValue(line, &want_rss);
    }
    if (Holds(line, "VmSize:")) {
      have_vmsize = true;
      LineValue(line, &want_vmsize);
    }
  }
  long rss = 12345;
  long vmsize = 12345;
  const bool status =
      quvaidx::ParseProcStatus(buffer, text.size(), &rss, &vmsize);
  if (status != (have_rss && have_vmsize)) {
    fprintf(stderr, "ParseProcStatus %d, model %d\n", status,
            have_rss && have_vmsize);
    Fail("wrong ParseProcStatus result", text);
  }
  if (rss != want_rss || vmsize != want_vmsize) {
    fprintf(stderr, "rss %ld vmsize %ld, model %ld %ld\n", rss, vmsize,
            want_rss, want_vmsize);
    Fail("wrong ParseProcStatus values", text);
  }

  long want_total = -1;
  bool have_total = false;
  for (const std::string& line : lines) {
    if (Holds(line, "MemTotal:")) {
      have_total = true;
      LineValue(line, &want_total);
      break;
    }
  }
  long total = 12345;
  const bool meminfo = quvaidx::ParseMemInfo(buffer, text.size(), &total);
  if (meminfo != have_total || total != want_total) {
    fprintf(stderr, "ParseMemInfo %d total %ld, model %d %ld\n", meminfo, total,
            have_total, want_total);
    Fail("wrong ParseMemInfo", text);
  }
  return 0;
}
