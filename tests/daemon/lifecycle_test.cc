// A daemon's life with real processes: pid files, detaching, starting
// programs; the boot wait through the fake host.
#include "quvaidx/lifecycle.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fake_host.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::FakeSleep;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;

using quvaidx::test::ReadFile;
using quvaidx::test::WriteFile;

class LifecycleTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string pid_file_ = dir_.File("d.pid");
};

// The pid goes in without a line end, replacing a dead instance's; a live
// instance is refused, its pid file kept, and BecomeDaemon does not detach.
// A pid file that cannot be made is an error; a missing one is deleted.
TEST_F(LifecycleTest, OneInstanceAtATime) {
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  waitpid(dead, nullptr, 0);
  WriteFile(pid_file_, std::to_string(dead) + "\n");
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), -1);
  EXPECT_EQ(BecomeDaemon(pid_file_.c_str()), -1);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(),
            "Daemon alive. No need to start\n"
            "Daemon alive. No need to start\n");
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
  LogCapture log;
  std::string bad = dir_.File("missing/d.pid");
  EXPECT_EQ(BecomeProcess(bad.c_str()), -1);
  EXPECT_EQ(log.Normalized(),
            (std::vector<std::string>{"quvaidx_daemon:N [Error] create " + bad +
                                      " (No such file or directory)"}));
  EXPECT_EQ(DeletePidFile(dir_.File("none").c_str()), 0);  // missing: still 0
}

TEST_F(LifecycleTest, RecycledPidDoesNotLockTheDaemonOut) {
  // The pid file was written an hour ago; the process now holding its pid
  // started after that, so it cannot be the daemon that wrote it.
  pid_t stranger = fork();
  if (stranger == 0) {
    pause();
    _exit(0);
  }
  WriteFile(pid_file_, std::to_string(stranger));
  struct timespec times[2] = {{time(nullptr) - 3600, 0},
                              {time(nullptr) - 3600, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, pid_file_.c_str(), times, 0), 0);
  int result = BecomeProcess(pid_file_.c_str());
  kill(stranger, SIGKILL);
  waitpid(stranger, nullptr, 0);
  EXPECT_EQ(result, 0);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
}

TEST_F(LifecycleTest, DaemonDetachesAndRecordsItsOwnPid) {
  std::string report = dir_.File("report");
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // daemon(0, 0) ends this process; the detached one carries on. The
    // pid file is named relative to the working directory of the caller.
    if (chdir(dir_.path().c_str()) != 0 || BecomeDaemon("d.pid") != 0) {
      _exit(3);
    }
    char cwd[64] = "";
    char in[64] = "";
    (void)!getcwd(cwd, sizeof(cwd));
    (void)!readlink("/proc/self/fd/0", in, sizeof(in) - 1);
    std::ofstream(report + ".tmp") << getpid() << " " << (getsid(0) == getpid())
                                   << " " << cwd << " " << in;
    rename((report + ".tmp").c_str(), report.c_str());
    _exit(0);
  }
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  auto end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  while (access(report.c_str(), F_OK) != 0 &&
         std::chrono::steady_clock::now() < end) {
    usleep(2000);
  }
  std::istringstream fields(ReadFile(report));
  std::string pid, leader, cwd, stdin_target;
  fields >> pid >> leader >> cwd >> stdin_target;
  EXPECT_NE(pid, std::to_string(child));
  EXPECT_EQ(ReadFile(pid_file_), pid);
  EXPECT_EQ(leader, "1");
  EXPECT_EQ(cwd, "/");
  EXPECT_EQ(stdin_target, "/dev/null");
}

// Ready at once, polled every ten seconds, or given up after fifteen
// minutes with a notice that the log level does not hold back.
TEST(BootWaitTest, PollsUntilReadyOrFifteenMinutes) {
  auto wait = [](std::initializer_list<int> steps, int calls, unsigned secs) {
    FakeHost host;
    FakeSleep sleep;
    LogCapture log(0);
    host.Answer(HostOp::kSystemGetBootStep, steps);
    WaitSystemReady();
    EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), calls);
    EXPECT_EQ(sleep.total_seconds(), secs);
    return log.lines();
  };
  EXPECT_TRUE(wait({4}, 1, 0).empty());
  EXPECT_TRUE(wait({1, 2, 3, 4}, 4, 30).empty());
  std::vector<quvaidx::test::LogLine> notice = wait({2}, 91, 900);
  ASSERT_EQ(notice.size(), 1u);
  EXPECT_EQ(notice[0].priority, LOG_ERR);
  EXPECT_EQ(quvaidx::test::NormalizeLine(notice[0].text),
            "quvaidx_system:N [NOTICE] system is not ready? start anyway.");
}

TEST(ForkExecvTest, ChildOnDevNullMissingProgramAbortsNoChildWaitKept) {
  TempDir dir;
  std::string out = dir.File("out");
  // $$ is the shell itself, whose streams are the ones ForkExecv set up.
  std::string script =
      "x=$(readlink /proc/$$/fd/0 /proc/$$/fd/1 /proc/$$/fd/2); "
      "echo \"$x\" > " +
      out;
  char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"),
                  const_cast<char*>(script.c_str()), nullptr};
  int pid = ForkExecv("/bin/sh", argv);
  ASSERT_GT(pid, 0);
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(ReadFile(out), "/dev/null\n/dev/null\n/dev/null\n");
  // A missing program still yields a child, which aborts; a SA_NOCLDWAIT
  // the caller set is in force again afterwards.
  struct sigaction action = {};
  action.sa_handler = SIG_DFL;
  action.sa_flags = SA_NOCLDWAIT;
  argv[0] = const_cast<char*>("nothing");
  argv[1] = nullptr;
  pid = ForkExecv("/nonexistent/program", argv);
  ASSERT_GT(pid, 0);
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGABRT);
  ASSERT_EQ(sigaction(SIGCHLD, &action, nullptr), 0);
  EXPECT_GT(ForkExecv("/bin/true", argv), 0);
  struct sigaction after;
  sigaction(SIGCHLD, nullptr, &after);
  EXPECT_NE(after.sa_flags & SA_NOCLDWAIT, 0);
  action.sa_flags = 0;
  sigaction(SIGCHLD, &action, nullptr);
}

}  // namespace
