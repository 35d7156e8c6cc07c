// A daemon's life with real processes: pid files, detaching, starting
// programs; the boot wait through the fake host.
#include "quvaidx/lifecycle.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
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

// The pid goes in without a line end, replacing a dead instance's, with
// mode 0644 whatever the umask or the old file's mode; a live instance is
// refused, its pid file kept, and BecomeDaemon does not detach. A pid file
// that cannot be made is an error; a missing one is deleted.
TEST_F(LifecycleTest, OneInstanceAtATime) {
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  waitpid(dead, nullptr, 0);
  WriteFile(pid_file_, std::to_string(dead) + "\n");
  chmod(pid_file_.c_str(), 0666);
  mode_t saved = umask(0);
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
  std::string fresh = dir_.File("fresh.pid");
  ASSERT_EQ(BecomeProcess(fresh.c_str()), 0);
  umask(saved);
  for (const std::string& path : {pid_file_, fresh}) {
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0644u) << path;
  }
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

// Whatever is planted at the pid path other than a regular file of its own
// is refused at once, logged, and left as it was: a root daemon must not
// write its pid through a link or into another name of a file, nor hang on
// a FIFO.
TEST_F(LifecycleTest, PidPathThatIsNoPlainFileIsRefused) {
  const std::string victim = dir_.File("victim");
  WriteFile(victim, "precious");
  ASSERT_EQ(symlink(victim.c_str(), dir_.File("link").c_str()), 0);
  ASSERT_EQ(
      symlink(dir_.File("nowhere").c_str(), dir_.File("dangling").c_str()), 0);
  ASSERT_EQ(mkfifo(dir_.File("fifo").c_str(), 0600), 0);
  ASSERT_EQ(mkdir(dir_.File("dir").c_str(), 0700), 0);
  ASSERT_EQ(link(victim.c_str(), dir_.File("hardlink").c_str()), 0);
  const std::string not_regular =
      " is not a regular file; not used as a pid "
      "file";
  struct Case {
    const char* name;
    std::string line;  // after "quvaidx_daemon:N [Error] " and the path
  } cases[] = {
      {"link", not_regular},
      {"dangling", not_regular},
      {"fifo", not_regular},
      {"dir", not_regular},
      {"hardlink", " has 2 names; not used as a pid file"},
  };
  alarm(10);  // an open waiting on the FIFO would end the test here
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string path = dir_.File(c.name);
    struct stat before;
    ASSERT_EQ(lstat(path.c_str(), &before), 0);
    LogCapture log;
    EXPECT_EQ(BecomeProcess(path.c_str()), -1);
    EXPECT_EQ(
        log.Normalized(),
        std::vector<std::string>{"quvaidx_daemon:N [Error] " + path + c.line});
    struct stat after;
    ASSERT_EQ(lstat(path.c_str(), &after), 0);
    EXPECT_EQ(after.st_mode, before.st_mode);
  }
  alarm(0);
  EXPECT_EQ(ReadFile(victim), "precious");
  EXPECT_NE(access(dir_.File("nowhere").c_str(), F_OK), 0);
}

// Of instances started at the same moment exactly one runs, every time:
// the check of the pid in the file alone lets several through.
TEST_F(LifecycleTest, SimultaneousStartsRunExactlyOne) {
  const int kTries = 50;
  const int kInstances = 3;
  for (int attempt = 0; attempt < kTries; ++attempt) {
    int go[2], results[2], hold[2];
    ASSERT_EQ(pipe(go) | pipe(results) | pipe(hold), 0);
    std::vector<pid_t> instances;
    for (int i = 0; i < kInstances; ++i) {
      pid_t child = fork();
      ASSERT_GE(child, 0);
      if (child == 0) {
        char byte = 0;
        close(go[1]);
        close(hold[1]);
        (void)!read(go[0], &byte, 1);          // all start when go closes
        dup2(open("/dev/null", O_WRONLY), 1);  // the refusal line
        byte = BecomeProcess(pid_file_.c_str()) == 0 ? 'R' : '-';
        (void)!write(results[1], &byte, 1);
        (void)!read(hold[0], &byte, 1);  // a runner lives until all tried
        _exit(0);
      }
      instances.push_back(child);
    }
    close(go[0]);
    close(results[1]);
    close(hold[0]);
    close(go[1]);
    std::string outcome;
    char byte;
    while (outcome.size() < kInstances && read(results[0], &byte, 1) == 1) {
      outcome += byte;
    }
    close(hold[1]);
    close(results[0]);
    for (pid_t child : instances) waitpid(child, nullptr, 0);
    ASSERT_EQ(std::count(outcome.begin(), outcome.end(), 'R'), 1)
        << "attempt " << attempt << ": " << outcome;
  }
}

// DeletePidFile removes a stale pid file and this process's own, never that
// of another live instance.
TEST_F(LifecycleTest, DeletePidFileSparesALiveInstance) {
  int hold[2];
  ASSERT_EQ(pipe(hold), 0);
  pid_t other = fork();
  ASSERT_GE(other, 0);
  if (other == 0) {
    close(hold[1]);
    char byte = 0;
    if (BecomeProcess(pid_file_.c_str()) != 0) _exit(3);
    (void)!read(hold[0], &byte, 1);  // lives until the pipe closes
    _exit(0);
  }
  close(hold[0]);
  auto end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  while (ReadFile(pid_file_) != std::to_string(other)) {
    ASSERT_LT(std::chrono::steady_clock::now(), end);
    usleep(2000);
  }
  {
    LogCapture log;
    EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);
    EXPECT_EQ(log.Normalized(), std::vector<std::string>{
                                    "quvaidx_daemon:N [Error] " + pid_file_ +
                                    " names live process " +
                                    std::to_string(other) + "; not removed"});
  }
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(other));
  close(hold[1]);
  waitpid(other, nullptr, 0);
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);  // stale now
  EXPECT_NE(access(pid_file_.c_str(), F_OK), 0);
  quvaidx::test::FdLeakCheck leaks;
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);  // our own
  EXPECT_NE(access(pid_file_.c_str(), F_OK), 0);
  EXPECT_TRUE(leaks.NoLeak());  // and its lock released
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

// The detached process also keeps the lock taken before detaching: a second
// instance is refused even when the pid in the file misleads the check.
TEST_F(LifecycleTest, DaemonDetachesAndRecordsItsOwnPid) {
  std::string report = dir_.File("report");
  std::string stop = dir_.File("stop");
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
    for (int i = 0; i < 200 && access(stop.c_str(), F_OK) != 0; ++i) {
      usleep(25 * 1000);
    }
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
  WriteFile(pid_file_, "4000000");  // same file, a pid that is not alive
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), -1);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(),
            "Daemon alive. No need to start\n");
  WriteFile(stop, "");
  // Ended: a zombie its new parent has not reaped yet counts.
  auto running = [&] {
    std::string stat = ReadFile("/proc/" + pid + "/stat");
    size_t close = stat.rfind(')');
    return close != std::string::npos && stat.compare(close, 3, ") Z") != 0;
  };
  end = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (running() && std::chrono::steady_clock::now() < end) usleep(2000);
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), 0);  // the lock went with it
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
