// Feeds the host's pid-file readers arbitrary file contents:
// QLIBCReadPidFile and QLIBCProcAliveByPidFile.
//
// The input is the pid file, byte for byte. Checked:
//   - QLIBCReadPidFile returns the pid exactly when the file holds one
//     decimal number from 1 to INT_MAX with nothing around it but blanks
//     (space, tab) and line ends ('\n', '\r'), as a model reading that
//     format decides; otherwise -1 with EINVAL in errno and on the error
//     stack (the file itself is always readable);
//   - QLIBCProcAliveByPidFile returns 0 or 1, and 0 for every file that
//     holds no pid; for this process's own pid it returns 1, since the
//     process began before it wrote the file.
// A mismatch aborts with a message.
#include <errno.h>
#include <limits.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include "fuzz_host_scratch_file.h"
#include "fuzz_report.h"
#include "quvahost/quvahost.h"

namespace {

constexpr size_t kMaxInput = 64 * 1024;

[[noreturn]] void Fail(const char* what, std::string_view input) {
  FuzzFail("fuzz_host_pid_file", what, input);
}

bool IsBlankOrLineEnd(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

// The pid the file holds, or -1 when it holds anything else.
int ModelPid(std::string_view text) {
  if (text.size() > 64) return -1;  // longer pid files are refused
  size_t begin = 0;
  size_t end = text.size();
  while (begin < end && IsBlankOrLineEnd(text[begin])) ++begin;
  while (end > begin && IsBlankOrLineEnd(text[end - 1])) --end;
  if (begin == end) return -1;
  long long number = 0;
  for (size_t i = begin; i < end; ++i) {
    char c = text[i];
    if (c < '0' || c > '9') return -1;
    number = number * 10 + (c - '0');
    if (number > INT_MAX) return -1;
  }
  return number >= 1 ? static_cast<int>(number) : -1;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return 0;
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  fuzz_host::ScratchFile::Write(data, size);
  const char* file = fuzz_host::ScratchFile::Path();

  const int want = ModelPid(text);
  errno = 0;
  const int pid = QLIBCReadPidFile(file);
  const int error = errno;
  if (pid != want) {
    fprintf(stderr, "QLIBCReadPidFile %d, model %d\n", pid, want);
    Fail("wrong pid", text);
  }
  if (pid == -1 && (error != EINVAL || QLIBCErrGet() != EINVAL)) {
    fprintf(stderr, "errno %d, error stack %d\n", error, QLIBCErrGet());
    Fail("bad pid file not reported as EINVAL", text);
  }

  const int alive = QLIBCProcAliveByPidFile(file);
  if (alive != 0 && alive != 1) Fail("alive is neither 0 nor 1", text);
  if (want == -1 && alive != 0) Fail("alive without a pid", text);
  if (want == getpid() && alive != 1) Fail("this process not alive", text);
  return 0;
}
