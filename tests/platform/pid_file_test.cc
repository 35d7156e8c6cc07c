#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <string>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(ReadPidFileTest, Contents) {
  TempDir dir;
  struct Case {
    const char* text;
    int pid;
  } cases[] = {
      {"123", 123},
      {"123\n", 123},
      {" 42 \r\n", 42},
      {"2147483647", 2147483647},
      {"0", -1},
      {"-5", -1},
      {"", -1},
      {"\n", -1},
      {"12a", -1},
      {"1 2", -1},
      {"2147483648", -1},
      {"0x10", -1},
      {"99999999999999999999", -1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.text);
    WriteFile(dir.File("pid"), c.text);
    EXPECT_EQ(QLIBCReadPidFile(dir.File("pid").c_str()), c.pid);
    if (c.pid < 0) {
      EXPECT_EQ(QLIBCErrGet(), EINVAL);
    }
  }
}

TEST(ReadPidFileTest, OverlongFileIsRejected) {
  TempDir dir;
  WriteFile(dir.File("pid"), "1" + std::string(100, ' '));
  EXPECT_EQ(QLIBCReadPidFile(dir.File("pid").c_str()), -1);
}

TEST(ReadPidFileTest, MissingFileOrNull) {
  EXPECT_EQ(QLIBCReadPidFile("/nonexistent/x.pid"), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(QLIBCReadPidFile(nullptr), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// A child that sleeps until killed.
class Child {
 public:
  Child() {
    pid_ = fork();
    if (pid_ == 0) {
      for (;;) pause();
    }
  }
  ~Child() {
    if (pid_ > 0) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
  }
  pid_t pid() const { return pid_; }

 private:
  pid_t pid_;
};

void WritePidFile(const std::string& path, pid_t pid, time_t mtime = 0) {
  WriteFile(path, std::to_string(pid));
  if (mtime != 0) {
    struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    utimensat(AT_FDCWD, path.c_str(), times, 0);
  }
}

TEST(ProcAliveTest, LiveChildWithPidFileWrittenAfterItStarted) {
  TempDir dir;
  Child child;
  ASSERT_GT(child.pid(), 0);
  WritePidFile(dir.File("pid"), child.pid());
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 1);
}

TEST(ProcAliveTest, OwnProcessIsAlive) {
  TempDir dir;
  WritePidFile(dir.File("pid"), getpid());
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 1);
}

// The pid file was written an hour before the process with that pid
// started: the process cannot be its writer, the pid was recycled.
TEST(ProcAliveTest, ProcessStartedAfterPidFileIsRecycledPid) {
  TempDir dir;
  Child child;
  ASSERT_GT(child.pid(), 0);
  WritePidFile(dir.File("pid"), child.pid(), time(nullptr) - 3600);
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 0);
  EXPECT_EQ(QLIBCErrGet(), ESRCH);
}

// Timestamps and boot time are coarse: a pid file whose time lies just
// before the start of its writer still counts.
TEST(ProcAliveTest, ClockGranularityIsTolerated) {
  TempDir dir;
  Child child;
  ASSERT_GT(child.pid(), 0);
  WritePidFile(dir.File("pid"), child.pid(), time(nullptr) - 1);
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 1);
}

TEST(ProcAliveTest, DeadPidIsNotAlive) {
  TempDir dir;
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) _exit(0);
  ASSERT_EQ(waitpid(pid, nullptr, 0), pid);
  WritePidFile(dir.File("pid"), pid);
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 0);
}

TEST(ProcAliveTest, ZombieIsNotAlive) {
  TempDir dir;
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) _exit(0);
  // Wait until the child has ended without reaping it.
  siginfo_t info;
  ASSERT_EQ(waitid(P_PID, pid, &info, WEXITED | WNOWAIT), 0);
  WritePidFile(dir.File("pid"), pid);
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("pid").c_str()), 0);
  waitpid(pid, nullptr, 0);
}

TEST(ProcAliveTest, MissingOrBadPidFileIsNotAlive) {
  TempDir dir;
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("none").c_str()), 0);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  WriteFile(dir.File("bad"), "abc");
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("bad").c_str()), 0);
  EXPECT_EQ(QLIBCProcAliveByPidFile(nullptr), 0);
}

}  // namespace
}  // namespace quvahost::test
