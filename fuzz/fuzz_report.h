// How a fuzz target reports a broken promise: one line naming the target,
// what went wrong and (the start of) the input, with bytes that do not
// print escaped, then abort() so that libFuzzer keeps the input.
#ifndef QUVAIDX_FUZZ_FUZZ_REPORT_H_
#define QUVAIDX_FUZZ_FUZZ_REPORT_H_

#include <stdio.h>
#include <stdlib.h>

#include <string_view>

[[noreturn]] inline void FuzzFail(const char* target, const char* what,
                                  std::string_view input) {
  fprintf(stderr, "%s: %s; input (%zu bytes): \"", target, what, input.size());
  for (unsigned char c : input.substr(0, 300)) {
    if (c >= 0x20 && c < 0x7f && c != '"' && c != '\\') {
      fputc(c, stderr);
    } else {
      fprintf(stderr, "\\x%02x", c);
    }
  }
  fprintf(stderr, "%s\"\n", input.size() > 300 ? "..." : "");
  abort();
}

#endif  // QUVAIDX_FUZZ_FUZZ_REPORT_H_
