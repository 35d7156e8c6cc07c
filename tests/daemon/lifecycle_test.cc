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

std::string ReadFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream(path) << text;
}

// Waits up to two seconds for `path` to hold something.
std::string AwaitFile(const std::string& path) {
  auto end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  std::string text;
  while ((text = ReadFile(path)).empty() &&
         std::chrono::steady_clock::now() < end) {
    usleep(2000);
  }
  return text;
}

// A pid that no process has: a child that has been reaped.
pid_t DeadPid() {
  pid_t child = fork();
  if (child == 0) _exit(0);
  waitpid(child, nullptr, 0);
  return child;
}

class LifecycleTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string pid_file_ = dir_.File("d.pid");
};

TEST_F(LifecycleTest, ForegroundProcessWritesItsPidWithoutLineEnd) {
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
}

TEST_F(LifecycleTest, LiveInstanceIsRefusedAndItsPidFileKept) {
  WriteFile(pid_file_, std::to_string(getpid()));
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), -1);
  EXPECT_EQ(BecomeDaemon(pid_file_.c_str()), -1);  // and does not detach
  EXPECT_EQ(::testing::internal::GetCapturedStdout(),
            "Daemon alive. No need to start\n"
            "Daemon alive. No need to start\n");
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
}

TEST_F(LifecycleTest, DeadInstanceIsReplaced) {
  WriteFile(pid_file_, std::to_string(DeadPid()) + "\n");
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
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
  std::string text = AwaitFile(report);
  std::istringstream fields(text);
  std::string pid, leader, cwd, stdin_target;
  fields >> pid >> leader >> cwd >> stdin_target;
  EXPECT_NE(pid, std::to_string(child));
  EXPECT_EQ(ReadFile(pid_file_), pid);
  EXPECT_EQ(leader, "1");
  EXPECT_EQ(cwd, "/");
  EXPECT_EQ(stdin_target, "/dev/null");
}

TEST_F(LifecycleTest, UncreatablePidFileFails) {
  LogCapture log;
  std::string bad = dir_.File("missing/d.pid");
  EXPECT_EQ(BecomeProcess(bad.c_str()), -1);
  EXPECT_EQ(log.Normalized(),
            (std::vector<std::string>{"quvaidx_daemon:N [Error] create " + bad +
                                      " (No such file or directory)"}));
}

TEST_F(LifecycleTest, PidAndMarkerFileRemoval) {
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);  // missing: still 0
  EXPECT_EQ(CheckOut(pid_file_.c_str()), -1);
  std::string marker = dir_.File("marker");
  WriteFile(marker, "left over");
  EXPECT_EQ(CheckIn(marker.c_str()), 0);
  EXPECT_EQ(ReadFile(marker), "");
  EXPECT_EQ(CheckOut(marker.c_str()), 0);
  EXPECT_NE(access(marker.c_str(), F_OK), 0);
  EXPECT_EQ(CheckIn(dir_.File("no/such/dir").c_str()), -1);
}

TEST_F(LifecycleTest, ExecutionTimeOfAFile) {
  EXPECT_EQ(GetExecutionTime(dir_.File("missing").c_str()), 0);
  WriteFile(pid_file_, "1");
  int age = GetExecutionTime(pid_file_.c_str());
  EXPECT_GE(age, 0);
  EXPECT_LE(age, 1);
}

TEST(BootWaitTest, ReadyAtOnce) {
  FakeHost host;
  FakeSleep sleep;
  host.Answer(HostOp::kSystemGetBootStep, {4});
  WaitSystemReady();
  EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), 1);
  EXPECT_EQ(sleep.calls(), 0);
}

TEST(BootWaitTest, PollsEveryTenSeconds) {
  FakeHost host;
  FakeSleep sleep;
  host.Answer(HostOp::kSystemGetBootStep, {1, 2, 3, 4});
  WaitSystemReady();
  EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), 4);
  EXPECT_EQ(sleep.total_seconds(), 30u);
}

TEST(BootWaitTest, GivesUpAfterFifteenMinutesWithANotice) {
  FakeHost host;
  FakeSleep sleep;
  LogCapture log(0);  // the notice is not held back by the log level
  host.Answer(HostOp::kSystemGetBootStep, {2});
  WaitSystemReady();
  EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), 91);
  EXPECT_EQ(sleep.total_seconds(), 900u);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(log.lines()[0].priority, LOG_ERR);
  EXPECT_EQ(log.Normalized()[0],
            "quvaidx_system:N [NOTICE] system is not ready? start anyway.");
}

TEST(ForkExecvTest, ChildRunsWithStreamsOnDevNull) {
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
}

TEST(ForkExecvTest, MissingProgramStillYieldsAChildThatAborts) {
  char* argv[] = {const_cast<char*>("nothing"), nullptr};
  int pid = ForkExecv("/nonexistent/program", argv);
  ASSERT_GT(pid, 0);
  int status = 0;
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFSIGNALED(status));
  EXPECT_EQ(WTERMSIG(status), SIGABRT);
}

TEST(ForkExecvTest, NoChildWaitFlagIsRestored) {
  struct sigaction action = {};
  action.sa_handler = SIG_DFL;
  action.sa_flags = SA_NOCLDWAIT;
  ASSERT_EQ(sigaction(SIGCHLD, &action, nullptr), 0);
  char* argv[] = {const_cast<char*>("true"), nullptr};
  EXPECT_GT(ForkExecv("/bin/true", argv), 0);
  struct sigaction after;
  sigaction(SIGCHLD, nullptr, &after);
  EXPECT_NE(after.sa_flags & SA_NOCLDWAIT, 0);
  action.sa_flags = 0;
  sigaction(SIGCHLD, &action, nullptr);
}

}  // namespace
