// Feeds FileRemoveHeadingLine arbitrary file contents and line counts.
//
// Input: the first two bytes (little-endian) give the count n, mapped onto
// -2 .. 60000; the third byte r (taken modulo 48) puts r * 2731 bytes of
// filler lines of 1 to 97 bytes before the rest, which is the file's tail;
// the filler's last line may be cut, so it joins the tail's first line.
// Files thus reach 128 KiB, beyond the function's 64 KiB copy blocks, with
// lines across the block boundary. Checked after each call:
//   - the result is 0 and the file holds what a model leaves: the text
//     without its first n lines, a line being everything up to and with a
//     '\n', or the rest of the text when no '\n' follows (so the last line
//     counts without one); the whole text for n <= 0, nothing for n beyond
//     the last line;
//   - the file keeps its mode, and no temporary file is left beside it.
// A mismatch aborts with a message.
//
// The function renames a temporary file over the path, so the file lives in
// a private directory of its own (fuzz_scratch_dir.h).
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include "fuzz_report.h"
#include "fuzz_scratch_dir.h"
#include "queue_filler.h"
#include "quvaidx/system.h"

namespace {

constexpr size_t kMaxInput = 64 * 1024;
constexpr int kMinCount = -2;
constexpr int kMaxCount = 60000;
constexpr mode_t kMode = 0640;

using fuzz_queue::Filler;
using fuzz_queue::kFillerUnit;
using fuzz_scratch::Die;
using Scratch = fuzz_scratch::ScratchDir;

[[noreturn]] void Fail(const char* what, int n, std::string_view text) {
  std::string message = std::string(what) + "; n " + std::to_string(n);
  FuzzFail("fuzz_trim", message.c_str(), text);
}

constexpr unsigned kFillerUnits = 48;

// The text without its first n lines.
std::string_view Model(std::string_view text, int n) {
  for (int i = 0; i < n && !text.empty(); ++i) {
    size_t newline = text.find('\n');
    text = newline == std::string_view::npos ? std::string_view()
                                             : text.substr(newline + 1);
  }
  return text;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3 || size > kMaxInput) return 0;
  const unsigned raw = data[0] | (static_cast<unsigned>(data[1]) << 8);
  const int n = kMinCount + static_cast<int>(raw % (kMaxCount - kMinCount + 1));
  std::string file = Filler(kFillerUnit * (data[2] % kFillerUnits));
  file.append(reinterpret_cast<const char*>(data) + 3, size - 3);
  const std::string_view text(file);
  Scratch& scratch = Scratch::Get("fuzz-trim");
  scratch.Write(text.data(), text.size(), kMode);

  if (FileRemoveHeadingLine(scratch.file().c_str(), n) != 0) {
    Fail("FileRemoveHeadingLine failed", n, text);
  }
  const std::string after = scratch.Read();
  if (after != Model(text, n)) {
    fprintf(stderr, "kept %zu bytes, model %zu\n", after.size(),
            Model(text, n).size());
    Fail("wrong contents", n, text);
  }
  struct stat st;
  if (stat(scratch.file().c_str(), &st) != 0) Die("stat");
  if ((st.st_mode & 07777) != kMode) {
    fprintf(stderr, "mode %o\n", static_cast<unsigned>(st.st_mode & 07777));
    Fail("mode changed", n, text);
  }
  const std::string strays = scratch.Strays();
  if (!strays.empty()) {
    fprintf(stderr, "left behind: %s\n", strays.c_str());
    Fail("temporary file left", n, text);
  }
  return 0;
}
