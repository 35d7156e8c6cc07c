// Single instance, detaching and the pid file; marker files.
#include "quvaidx/lifecycle.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>

#include "quvahost/quvahost.h"
#include "quvaidx/log.h"

namespace {

constexpr char kModule[] = "quvaidx_daemon";

// Prints the refusal and returns true when another instance is alive.
bool AnotherInstanceAlive(const char* pid_file) {
  if (QLIBCProcAliveByPidFile(pid_file) == 0) return false;
  printf("Daemon alive. No need to start\n");
  fflush(stdout);
  return true;
}

// Writes the calling process's id into pid_file, created or truncated.
int WritePidFile(const char* pid_file) {
  int fd = open(pid_file, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
  if (fd < 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] create %s (%s)", kModule, __LINE__, pid_file,
                strerror(err));
    return -1;
  }
  char text[32];
  int length = snprintf(text, sizeof(text), "%d", static_cast<int>(getpid()));
  ssize_t written = write(fd, text, static_cast<size_t>(length));
  if (written != length) {
    int err = written < 0 ? errno : EIO;
    AppLogError(3, "%s:%d [Error] write pid into pid file (%s)", kModule,
                __LINE__, strerror(err));
    close(fd);
    return -1;
  }
  close(fd);
  return 0;
}

}  // namespace

int BecomeDaemon(const char* pid_file) {
  if (AnotherInstanceAlive(pid_file)) return -1;
  // Detaching moves to /, so a relative pid-file path must be resolved
  // first or the pid would be written somewhere else.
  std::string absolute = pid_file;
  if (pid_file[0] != '/') {
    char* cwd = getcwd(nullptr, 0);
    if (cwd != nullptr) {
      absolute = std::string(cwd) + "/" + pid_file;
      free(cwd);
    }
  }
  if (daemon(0, 0) != 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] become a daemon (%s)", kModule, __LINE__,
                strerror(err));
    return -1;
  }
  return WritePidFile(absolute.c_str());
}

int BecomeProcess(const char* pid_file) {
  if (AnotherInstanceAlive(pid_file)) return -1;
  return WritePidFile(pid_file);
}

int DeletePidFile(const char* path) {
  unlink(path);  // don't care if this fails
  return 0;
}

int CheckIn(const char* path) {
  int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
  if (fd < 0) return -1;
  close(fd);
  return 0;
}

int CheckOut(const char* path) { return unlink(path) == 0 ? 0 : -1; }

int GetExecutionTime(const char* path) {
  time_t now = time(nullptr);
  struct stat st;
  if (stat(path, &st) != 0) return 0;
  return static_cast<int>(now - st.st_ctime);
}
