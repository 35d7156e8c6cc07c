// The text utilities on arbitrary bytes and sizes, checked against each
// other and against simple reference versions.
//
// Input layout: bytes 0-1, a signed 16-bit size (little-endian) for
// ShortenString and EscapePercentSign; the rest, the text (up to its first
// zero byte). Checks:
//   - TryUTF8ToUTF16 accepts nothing that IsUnicodeString rejects;
//   - ShortenString writes a prefix shorter than the size, nothing beyond
//     dst[size - 1]; when the text is UTF-8 the prefix is UTF-8 (strictly
//     so when the text is) and the next character would not have fitted;
//     otherwise it is the plain byte cut;
//   - StringTrim matches a reference trim;
//   - EscapePercentSign writes the reference escape cut to size - 1 bytes.
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "quvaidx/text.h"
#include "util/hooks.h"

namespace {

constexpr char kGuard = '\x5A';
constexpr size_t kSlack = 16;

[[noreturn]] void Fail(const char* what) {
  fprintf(stderr, "fuzz_text: %s\n", what);
  abort();
}

void DiscardLogLine(int, const char*) {}

bool Continuation(char c) {
  return (static_cast<unsigned char>(c) & 0xC0) == 0x80;
}

void CheckShorten(const std::string& src, int size) {
  std::vector<char> dst(size > 0 ? static_cast<size_t>(size) + kSlack : kSlack,
                        kGuard);
  ShortenString(src.c_str(), dst.data(), size);
  if (src.empty() || size < 1) {
    for (char c : dst) {
      if (c != kGuard) Fail("ShortenString wrote for bad arguments");
    }
    return;
  }
  for (size_t i = static_cast<size_t>(size); i < dst.size(); ++i) {
    if (dst[i] != kGuard) Fail("ShortenString wrote beyond size");
  }
  if (memchr(dst.data(), '\0', static_cast<size_t>(size)) == nullptr) {
    Fail("ShortenString result not terminated");
  }
  std::string out(dst.data());
  const size_t limit = static_cast<size_t>(size) - 1;
  if (out.size() > limit) Fail("ShortenString result too long");
  if (src.compare(0, out.size(), out) != 0) Fail("not a prefix");
  if (src.size() <= limit) {
    if (out != src) Fail("fitting text changed");
    return;
  }
  if (IsUnicodeString(src.c_str()) == 1) {
    if (IsUnicodeString(out.c_str()) != 1) Fail("UTF-8 prefix not UTF-8");
    if (TryUTF8ToUTF16(src.c_str()) == 1 && TryUTF8ToUTF16(out.c_str()) != 1) {
      Fail("strict UTF-8 prefix not strict UTF-8");
    }
    // Longest: the character after the prefix does not fit.
    size_t next = out.size() + 1;
    while (next < src.size() && Continuation(src[next])) ++next;
    if (next <= limit) Fail("ShortenString prefix not the longest");
  } else if (out.size() != limit) {
    Fail("non-UTF-8 text not cut at size - 1");
  }
}

void CheckTrim(const std::string& text) {
  std::string expected = text;
  size_t start = expected.find_first_not_of(' ');
  if (start != std::string::npos) {
    size_t end = expected.find_last_not_of(' ');
    expected = expected.substr(start, end - start + 1);
  }
  std::vector<char> buffer(text.begin(), text.end());
  buffer.push_back('\0');
  StringTrim(buffer.data());
  if (expected != buffer.data()) Fail("StringTrim differs from reference");
}

void CheckEscape(const std::string& src, int size) {
  std::vector<char> dst(size > 0 ? static_cast<size_t>(size) + kSlack : kSlack,
                        kGuard);
  int result = EscapePercentSign(src.c_str(), dst.data(), size);
  if (size == 0) {
    if (result != -1 || dst[0] != kGuard) Fail("size 0 not refused");
    return;
  }
  if (size < 0) {
    if (result != 0 || dst[0] != '\0' || dst[1] != kGuard) {
      Fail("negative size not a lone terminator");
    }
    return;
  }
  std::string escaped;
  for (char c : src) {
    escaped += c;
    if (c == '%') escaped += '%';
  }
  size_t expected = escaped.size() < static_cast<size_t>(size) - 1
                        ? escaped.size()
                        : static_cast<size_t>(size) - 1;
  if (result != static_cast<int>(expected)) Fail("EscapePercentSign result");
  if (escaped.compare(0, expected, dst.data(), expected) != 0 ||
      dst[expected] != '\0') {
    Fail("EscapePercentSign text");
  }
  for (size_t i = static_cast<size_t>(size); i < dst.size(); ++i) {
    if (dst[i] != kGuard) Fail("EscapePercentSign wrote beyond size");
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  quvaidx::SetLogSink(DiscardLogLine);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2 || size > 16 * 1024) return 0;
  int16_t raw_size = static_cast<int16_t>(data[0] | (data[1] << 8));
  std::string text(reinterpret_cast<const char*>(data + 2), size - 2);
  text.resize(strlen(text.c_str()));

  if (TryUTF8ToUTF16(text.c_str()) == 1 && IsUnicodeString(text.c_str()) != 1) {
    Fail("strict test accepts what the structural one rejects");
  }
  CheckShorten(text, raw_size);
  CheckTrim(text);
  CheckEscape(text, raw_size);
  return 0;
}
