// Boot wait and program start.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <syslog.h>
#include <unistd.h>

#include "quvahost/quvahost.h"
#include "quvaidx/system.h"
#include "util/hooks.h"
#include "util/log_internal.h"

namespace {

constexpr char kModule[] = "quvaidx_system";
constexpr int kBootedStep = 4;
constexpr unsigned kBootPollSeconds = 10;
constexpr unsigned kBootWaitLimitSeconds = 900;

// Sets or clears SA_NOCLDWAIT in SIGCHLD's disposition. Returns whether it
// was set before.
bool SetNoChildWait(bool on) {
  struct sigaction action;
  if (sigaction(SIGCHLD, nullptr, &action) != 0) return false;
  bool was_on = (action.sa_flags & SA_NOCLDWAIT) != 0;
  if (on) {
    action.sa_flags |= SA_NOCLDWAIT;
  } else {
    action.sa_flags &= ~SA_NOCLDWAIT;
  }
  sigaction(SIGCHLD, &action, nullptr);
  return was_on;
}

}  // namespace

void WaitSystemReady() {
  for (unsigned waited = 0;; waited += kBootPollSeconds) {
    if (QUVASystemGetBootStep() == kBootedStep) return;
    if (waited >= kBootWaitLimitSeconds) {
      quvaidx::LogDirect(LOG_ERR,
                         "%s:%d [NOTICE] system is not ready? start anyway.",
                         kModule, __LINE__);
      return;
    }
    quvaidx::SleepSeconds(kBootPollSeconds);
  }
}

int ForkExecv(const char* path, char* const argv[]) {
  bool had_no_child_wait = SetNoChildWait(false);
  pid_t pid = fork();
  if (pid == 0) {
    // Only async-signal-safe calls from here on.
    int null_fd = open("/dev/null", O_RDWR);
    if (null_fd >= 0) {
      dup2(null_fd, STDIN_FILENO);
      dup2(null_fd, STDOUT_FILENO);
      dup2(null_fd, STDERR_FILENO);
      if (null_fd > STDERR_FILENO) close(null_fd);
    }
    execv(path, argv);
    abort();
  }
  if (had_no_child_wait) SetNoChildWait(true);
  return pid;
}
