// Single instance, detaching and the pid file; marker files.
//
// A daemon's pid file stays open and exclusively locked (flock) for the
// life of the process: the lock, not only the pid written in the file, is
// what refuses a second instance, so two instances started at the same
// moment cannot both run.
#include "quvaidx/lifecycle.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <vector>

#include "quvahost/quvahost.h"
#include "quvaidx/log.h"
#include "util/file_io.h"

namespace {

using quvaidx::SameFile;

constexpr char kModule[] = "quvaidx_daemon";
constexpr mode_t kPidFileMode = 0644;
// No link is followed (a planted one would have the pid written over its
// target) and no FIFO is waited on.
constexpr int kPidFileOpenFlags =
    O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
// Opens retried when a pid file is replaced between its open and its lock.
constexpr int kLockTries = 3;

// Descriptors of the pid files this process holds locked, open until it
// ends or deletes them.
std::vector<int>& HeldPidFiles() {
  static std::vector<int>* held = new std::vector<int>();
  return *held;
}

void PrintAlive() {
  printf("Daemon alive. No need to start\n");
  fflush(stdout);
}

// Prints the refusal and returns true when another instance is alive.
bool AnotherInstanceAlive(const char* pid_file) {
  if (QLIBCProcAliveByPidFile(pid_file) == 0) return false;
  PrintAlive();
  return true;
}

// Opens pid_file for writing, created with kPidFileMode if missing, and
// refuses anything but a regular file of one name. Returns the descriptor,
// or -1 (logged).
int OpenPidFile(const char* pid_file) {
  int fd = open(pid_file, kPidFileOpenFlags, kPidFileMode);
  int err = errno;
  struct stat st;
  bool examined = fd >= 0 ? fstat(fd, &st) == 0 : lstat(pid_file, &st) == 0;
  if (fd >= 0 && examined && S_ISREG(st.st_mode) && st.st_nlink == 1) {
    return fd;
  }
  if (fd >= 0) close(fd);
  if (examined && !S_ISREG(st.st_mode)) {
    AppLogError(3,
                "%s:%d [Error] %s is not a regular file; not used as a "
                "pid file",
                kModule, __LINE__, pid_file);
  } else if (examined && fd >= 0) {
    // Another name of the same file could be anything, /etc/passwd included.
    AppLogError(3, "%s:%d [Error] %s has %d names; not used as a pid file",
                kModule, __LINE__, pid_file, static_cast<int>(st.st_nlink));
  } else {
    AppLogError(3, "%s:%d [Error] create %s (%s)", kModule, __LINE__, pid_file,
                strerror(fd >= 0 ? errno : err));
  }
  return -1;
}

// Opens pid_file and takes its exclusive lock. Returns the descriptor; -1
// when another instance holds the lock (the refusal printed, as for a live
// instance) or on failure (logged).
int LockPidFile(const char* pid_file) {
  for (int tries = 1;; ++tries) {
    int fd = OpenPidFile(pid_file);
    if (fd < 0) return -1;
    if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
      int err = errno;
      close(fd);
      if (err == EWOULDBLOCK) {
        PrintAlive();
      } else {
        AppLogError(3, "%s:%d [Error] lock %s (%s)", kModule, __LINE__,
                    pid_file, strerror(err));
      }
      return -1;
    }
    // A stale file removed between the open and the lock may already have a
    // successor, locked by another instance: the lock must be on the file
    // the path names now.
    struct stat locked;
    struct stat named;
    if (fstat(fd, &locked) == 0 && lstat(pid_file, &named) == 0 &&
        SameFile(locked, named)) {
      if ((locked.st_mode & 07777) != kPidFileMode) {
        fchmod(fd, kPidFileMode);  // someone else's file keeps its mode
      }
      return fd;
    }
    close(fd);
    if (tries == kLockTries) {
      AppLogError(3, "%s:%d [Error] create %s (%s)", kModule, __LINE__,
                  pid_file, "replaced while being locked");
      return -1;
    }
  }
}

// Replaces the contents of the open pid file with this process's id. The
// new id is written over the old one before the rest is cut, so the file is
// never empty. Returns 0, or -1 (logged).
int WritePid(int fd) {
  char text[32];
  int length = snprintf(text, sizeof(text), "%d", static_cast<int>(getpid()));
  ssize_t written = pwrite(fd, text, static_cast<size_t>(length), 0);
  if (written != length || ftruncate(fd, length) != 0) {
    int err = written < 0 || written == length ? errno : EIO;
    AppLogError(3, "%s:%d [Error] write pid into pid file (%s)", kModule,
                __LINE__, strerror(err));
    return -1;
  }
  return 0;
}

// Writes the pid into the locked pid file and keeps it for the process's
// life. Returns 0, or -1 with the file closed (and so unlocked).
int RecordPid(int fd) {
  if (WritePid(fd) != 0) {
    close(fd);
    return -1;
  }
  HeldPidFiles().push_back(fd);
  return 0;
}

// The index in HeldPidFiles() of the descriptor of the file `st`
// describes, or -1.
int HeldIndex(const struct stat& st) {
  const std::vector<int>& held = HeldPidFiles();
  for (size_t i = 0; i < held.size(); ++i) {
    struct stat open_file;
    if (fstat(held[i], &open_file) == 0 && SameFile(open_file, st)) {
      return static_cast<int>(i);
    }
  }
  return -1;
}

}  // namespace

int BecomeDaemon(const char* pid_file) {
  if (AnotherInstanceAlive(pid_file)) return -1;
  // Locked before detaching: a refusal still reaches the terminal, and the
  // detached process inherits the descriptor and with it the lock. (The
  // path is resolved now, against the caller's working directory.)
  int fd = LockPidFile(pid_file);
  if (fd < 0) return -1;
  if (WritePid(fd) != 0) {
    close(fd);
    return -1;
  }
  if (daemon(0, 0) != 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] become a daemon (%s)", kModule, __LINE__,
                strerror(err));
    close(fd);
    return -1;
  }
  return RecordPid(fd);
}

int BecomeProcess(const char* pid_file) {
  if (AnotherInstanceAlive(pid_file)) return -1;
  int fd = LockPidFile(pid_file);
  if (fd < 0) return -1;
  return RecordPid(fd);
}

int DeletePidFile(const char* path) {
  struct stat named;
  int held = lstat(path, &named) == 0 ? HeldIndex(named) : -1;
  if (held < 0) {
    int pid = QLIBCReadPidFile(path);
    if (pid > 0 && pid != static_cast<int>(getpid()) &&
        QLIBCProcAliveByPidFile(path) == 1) {
      AppLogError(3, "%s:%d [Error] %s names live process %d; not removed",
                  kModule, __LINE__, path, pid);
      return 0;
    }
  }
  unlink(path);  // don't care if this fails
  if (held >= 0) {
    // Unlocked only now that the path is free: a new instance makes a new
    // file, which nobody removes by mistake.
    std::vector<int>& files = HeldPidFiles();
    close(files[static_cast<size_t>(held)]);
    files.erase(files.begin() + held);
  }
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
