// Pid files and the liveness test with its guard against recycled pids.
//
// A pid names the writer of the pid file only if that process already ran
// when the file was last written. The process start time is read from
// /proc/PID/stat (clock ticks after boot) and turned into wall-clock time
// with the boot time of /proc/stat; both are coarse (whole seconds of boot
// time, clock ticks), so a process counts as recycled only when it started
// more than kStartSlackSeconds after the pid file's modification time.
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"

namespace quvahost {
namespace {

// Tolerance for the coarse clocks compared (boot time in whole seconds,
// clock ticks, file timestamps of coarse filesystems).
constexpr double kStartSlackSeconds = 2.0;

// Boot time in seconds since the epoch, from the "btime" line of
// /proc/stat; -1 when unreadable.
long long BootTime() {
  std::string text;
  if (ReadWholeFile("/proc/stat", 1 << 20, &text) != 0) return -1;
  size_t pos = text.find("\nbtime ");
  if (pos == std::string::npos) return -1;
  return strtoll(text.c_str() + pos + 7, nullptr, 10);
}

struct ProcState {
  char state = '?';          // R, S, D, Z, X, ...
  double start_seconds = 0;  // start time, seconds since the epoch
};

// Reads the state and start time of `pid`. Returns false when
// /proc/PID/stat cannot be read or understood.
bool ReadProcState(int pid, ProcState* out) {
  std::string text;
  std::string path = "/proc/" + std::to_string(pid) + "/stat";
  if (ReadWholeFile(path.c_str(), 4096, &text) != 0) return false;
  // The command name in parentheses may hold blanks and ')': the fields
  // start after the last ')'.
  size_t close = text.rfind(')');
  if (close == std::string::npos) return false;
  const char* p = text.c_str() + close + 1;
  // Field 3 is the state, field 22 the start time.
  char* end = nullptr;
  for (int field = 3; field <= 22; ++field) {
    while (*p == ' ') ++p;
    if (*p == '\0') return false;
    if (field == 3) out->state = *p;
    if (field == 22) {
      unsigned long long ticks = strtoull(p, &end, 10);
      if (end == p) return false;
      long hz = sysconf(_SC_CLK_TCK);
      long long boot = BootTime();
      if (hz <= 0 || boot < 0) return false;
      out->start_seconds =
          static_cast<double>(boot) + static_cast<double>(ticks) / hz;
      return true;
    }
    while (*p != ' ' && *p != '\0') ++p;
  }
  return false;
}

bool ProcessExists(int pid) { return kill(pid, 0) == 0 || errno == EPERM; }

}  // namespace

int ReadPidFileImpl(const char* pid_file) {
  if (pid_file == nullptr) return HOST_FAIL(EINVAL);
  std::string text;
  int error = ReadWholeFile(pid_file, 64, &text);
  if (error == EFBIG) error = EINVAL;
  if (error != 0) return HOST_FAIL(error);
  int pid = 0;
  if (!ParseDecimalText(text, &pid) || pid < 1) return HOST_FAIL(EINVAL);
  return pid;
}

int ProcAliveByPidFileImpl(const char* pid_file) {
  int pid = ReadPidFileImpl(pid_file);
  if (pid <= 0) return 0;
  struct stat st;
  if (stat(pid_file, &st) != 0) {
    HOST_FAIL(errno);
    return 0;
  }
  if (!ProcessExists(pid)) {
    HOST_FAIL(ESRCH);
    return 0;
  }
  ProcState proc;
  if (!ReadProcState(pid, &proc)) {
    // Hidden or vanished: trust the existence test, asked once more.
    if (ProcessExists(pid)) return 1;
    HOST_FAIL(ESRCH);
    return 0;
  }
  if (proc.state == 'Z' || proc.state == 'X') {
    HOST_FAIL(ESRCH);  // ended, only not yet reaped
    return 0;
  }
  double written = static_cast<double>(st.st_mtim.tv_sec) +
                   static_cast<double>(st.st_mtim.tv_nsec) / 1e9;
  if (proc.start_seconds > written + kStartSlackSeconds) {
    HOST_FAIL(ESRCH);  // pid recycled by a later process
    return 0;
  }
  return 1;
}

}  // namespace quvahost
