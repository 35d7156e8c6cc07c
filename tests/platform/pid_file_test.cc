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
  const struct {
    std::string text;
    int pid;
  } cases[] = {{"123\n", 123},
               {" 42 \r\n", 42},
               {"2147483647", 2147483647},
               {"0", -1},
               {"-5", -1},
               {"1 2", -1},
               {"2147483648", -1},
               {"1" + std::string(100, ' '), -1}};
  for (const auto& c : cases) {
    WriteFile(dir.File("pid"), c.text);
    EXPECT_EQ(QLIBCReadPidFile(dir.File("pid").c_str()), c.pid) << c.text;
  }
  EXPECT_EQ(QLIBCReadPidFile(nullptr), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QLIBCReadPidFile("/nonexistent/x.pid"), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
}

// Writes `pid` to a pid file dated `age` seconds ago, and asks whether its
// writer is alive.
int AliveByPidFile(const TempDir& dir, pid_t pid, time_t age = 0) {
  WriteFile(dir.File("pid"), std::to_string(pid));
  if (age != 0) {
    struct timespec times[2] = {{time(nullptr) - age, 0},
                                {time(nullptr) - age, 0}};
    utimensat(AT_FDCWD, dir.File("pid").c_str(), times, 0);
  }
  return QLIBCProcAliveByPidFile(dir.File("pid").c_str());
}

TEST(ProcAliveTest, LiveWriterOrRecycledPid) {
  TempDir dir;
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    for (;;) pause();
  }
  EXPECT_EQ(AliveByPidFile(dir, child), 1);
  EXPECT_EQ(AliveByPidFile(dir, child, 1), 1) << "clock granularity";
  // Written an hour before the process started: the pid was recycled.
  EXPECT_EQ(AliveByPidFile(dir, child, 3600), 0);
  EXPECT_EQ(QLIBCErrGet(), ESRCH);
  EXPECT_EQ(AliveByPidFile(dir, getpid()), 1);
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
}

TEST(ProcAliveTest, DeadZombieMissingOrBadIsNotAlive) {
  TempDir dir;
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) _exit(0);
  siginfo_t info;  // ended, not reaped
  ASSERT_EQ(waitid(P_PID, pid, &info, WEXITED | WNOWAIT), 0);
  EXPECT_EQ(AliveByPidFile(dir, pid), 0) << "zombie";
  ASSERT_EQ(waitpid(pid, nullptr, 0), pid);
  EXPECT_EQ(AliveByPidFile(dir, pid), 0) << "dead";
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("none").c_str()), 0);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  WriteFile(dir.File("bad"), "abc");
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("bad").c_str()), 0);
  EXPECT_EQ(QLIBCProcAliveByPidFile(nullptr), 0);
}

}  // namespace
}  // namespace quvahost::test
