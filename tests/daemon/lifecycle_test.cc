// A daemon's life with real processes: pid files, detaching, starting
// programs, marker files; the boot wait through the fake host.
#include "quvaidx/lifecycle.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/ptrace.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fake_host.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

namespace {

using quvaidx::test::LogCapture;
using quvaidx::test::ReadFile;
using quvaidx::test::WriteFile;
using Lines = std::vector<std::string>;

const std::string kAlive = "Daemon alive. No need to start\n";
const std::string kError = "quvaidx_daemon:N [Error] ";

// Whether nobody holds the lock of the file at `path`.
bool Unlocked(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  bool free = fd >= 0 && flock(fd, LOCK_EX | LOCK_NB) == 0;
  close(fd);
  return free;
}

// The exit status of child `pid`, -1 unless it exited.
int ExitStatus(pid_t pid) {
  int status = 0;
  return waitpid(pid, &status, 0) == pid && WIFEXITED(status)
             ? WEXITSTATUS(status)
             : -1;
}

// Silences the refusal line on standard output.
void Quiet() { dup2(open("/dev/null", O_WRONLY), 1); }

class LifecycleTest : public ::testing::Test {
 protected:
  quvaidx::test::TempDir dir_;
  std::string pid_file_ = dir_.File("d.pid");
};

// The pid goes in without a line end, replacing a dead instance's, mode
// 0644 whatever the umask; a live instance is refused, BecomeDaemon too.
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
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), kAlive + kAlive);
  EXPECT_EQ(ReadFile(pid_file_), std::to_string(getpid()));
  LogCapture log;
  std::string bad = dir_.File("missing/d.pid");
  EXPECT_EQ(BecomeProcess(bad.c_str()), -1);
  EXPECT_EQ(
      log.Count(kError + "create " + bad + " (No such file or directory)"), 1);
  EXPECT_EQ(DeletePidFile(dir_.File("none").c_str()), 0);  // missing: still 0
}

// Anything but a regular file of its own at the pid path is refused at once,
// logged and left alone: no write through links, no hanging on a FIFO.
TEST_F(LifecycleTest, PidPathThatIsNoPlainFileIsRefused) {
  const std::string victim = dir_.File("victim");
  WriteFile(victim, "precious");
  ASSERT_EQ(symlink(victim.c_str(), dir_.File("link").c_str()), 0);
  ASSERT_EQ(symlink("nowhere", dir_.File("dangling").c_str()), 0);
  ASSERT_EQ(mkfifo(dir_.File("fifo").c_str(), 0600), 0);
  ASSERT_EQ(mkdir(dir_.File("dir").c_str(), 0700), 0);
  ASSERT_EQ(link(victim.c_str(), dir_.File("hardlink").c_str()), 0);
  alarm(10);  // an open waiting on the FIFO would end the test here
  for (const char* name : {"link", "dangling", "fifo", "dir", "hardlink"}) {
    SCOPED_TRACE(name);
    const std::string path = dir_.File(name);
    struct stat before, after;
    ASSERT_EQ(lstat(path.c_str(), &before), 0);
    LogCapture log;
    EXPECT_EQ(BecomeProcess(path.c_str()), -1);
    const char* why =
        name[0] == 'h' ? " has 2 names" : " is not a regular file";
    EXPECT_EQ(log.Normalized(),
              Lines{kError + path + why + "; not used as a pid file"});
    ASSERT_EQ(lstat(path.c_str(), &after), 0);
    EXPECT_EQ(after.st_mode, before.st_mode);
  }
  alarm(0);
  EXPECT_EQ(ReadFile(victim), "precious");
  EXPECT_NE(access(dir_.File("nowhere").c_str(), F_OK), 0);
  if (getuid() != 0) return;
  chmod(dir_.path().c_str(), 0755);  // a pid file its user may not write
  EXPECT_EQ(quvaidx::test::RunUnprivileged([&] {
              LogCapture log;
              const std::string line =
                  kError + "create " + victim + " (Permission denied)";
              const bool refused = BecomeProcess(victim.c_str()) == -1;
              return refused && log.Normalized() == Lines{line} ? 0 : 1;
            }),
            0);
}

// Runs BecomeProcess in `count` children at the same moment; returns a
// letter each (R runs, - refused). They live until *hold is closed.
std::string StartTogether(const std::string& pid_file, int count,
                          std::vector<pid_t>* pids, int* hold) {
  int go[2], report[2], held[2];
  if (pipe(go) != 0 || pipe(report) != 0 || pipe(held) != 0) return "";
  for (int i = 0; i < count; ++i) {
    pids->push_back(fork());
    if (pids->back() != 0) continue;
    char byte = 0;
    close(go[1]);
    close(held[1]);
    (void)!read(go[0], &byte, 1);  // all start when go closes
    Quiet();
    byte = BecomeProcess(pid_file.c_str()) == 0 ? 'R' : '-';
    (void)!write(report[1], &byte, 1);
    (void)!read(held[0], &byte, 1);  // a runner lives until *hold closes
    _exit(0);
  }
  for (int end : {go[0], report[1], held[0], go[1]}) close(end);
  std::string outcome;
  char byte;
  while (outcome.size() < pids->size() && read(report[0], &byte, 1) == 1) {
    outcome += byte;
  }
  close(report[0]);
  *hold = held[1];
  return outcome;
}

// Ends the instances of StartTogether.
void EndAll(std::vector<pid_t>* pids, int hold) {
  close(hold);
  for (pid_t pid : *pids) waitpid(pid, nullptr, 0);
  pids->clear();
}

// Of instances started at the same moment exactly one runs, every time:
// the check of the pid in the file alone lets several through.
TEST_F(LifecycleTest, SimultaneousStartsRunExactlyOne) {
  for (int attempt = 0; attempt < 50; ++attempt) {
    std::vector<pid_t> pids;
    int hold = -1;
    std::string outcome = StartTogether(pid_file_, 3, &pids, &hold);
    EndAll(&pids, hold);
    ASSERT_EQ(std::count(outcome.begin(), outcome.end(), 'R'), 1)
        << "attempt " << attempt << ": " << outcome;
  }
}

// DeletePidFile removes a stale pid file and its own, never a live one's. A
// pid that cannot be written fails the start and leaves the file unlocked.
TEST_F(LifecycleTest, DeletePidFileSparesALiveInstance) {
  ASSERT_EQ(BecomeProcess(dir_.File("own.pid").c_str()), 0);  // held too
  std::vector<pid_t> other;
  int hold = -1;
  ASSERT_EQ(StartTogether(pid_file_, 1, &other, &hold), "R");
  const std::string pid = std::to_string(other[0]);
  LogCapture log;
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);
  EXPECT_EQ(log.Count(kError + pid_file_ + " names live process " + pid +
                      "; not removed"),
            1);
  EXPECT_EQ(ReadFile(pid_file_), pid);
  EndAll(&other, hold);
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);  // stale now
  EXPECT_NE(access(pid_file_.c_str(), F_OK), 0);
  auto refused_unlocked = [&] {  // 0 when refused, the file left unlocked
    return BecomeProcess(pid_file_.c_str()) == -1 && Unlocked(pid_file_) ? 0
                                                                         : 1;
  };
  EXPECT_EQ(quvaidx::test::RunWithFileSizeLimit(0, refused_unlocked), 0);
  quvaidx::test::FdLeakCheck leaks;
  ASSERT_EQ(BecomeProcess(pid_file_.c_str()), 0);
  EXPECT_FALSE(Unlocked(pid_file_));
  EXPECT_EQ(DeletePidFile(pid_file_.c_str()), 0);  // our own
  EXPECT_NE(access(pid_file_.c_str(), F_OK), 0);
  EXPECT_TRUE(leaks.NoLeak());  // and its lock released
}

// A pid file replaced between a start's open and its flock (made certain by
// ptrace): the start follows the path, refused while another holds it.
TEST_F(LifecycleTest, PidFileReplacedBetweenOpenAndLockIsNotTaken) {
  for (bool held : {true, false}) {
    WriteFile(pid_file_, "");
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      ptrace(PTRACE_TRACEME, 0, nullptr, nullptr);
      raise(SIGSTOP);
      Quiet();
      _exit(BecomeProcess(pid_file_.c_str()) == 0 ? 1 : 0);
    }
    int status = 0, successor = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ptrace(PTRACE_SETOPTIONS, child, nullptr, PTRACE_O_TRACESYSGOOD);
    for (int stops = 0; stops < 10000; ++stops) {
      if (ptrace(PTRACE_SYSCALL, child, nullptr, nullptr) != 0 ||
          waitpid(child, &status, 0) != child || !WIFSTOPPED(status)) {
        break;
      }
      struct __ptrace_syscall_info info = {};
      if (successor < 0 &&
          ptrace(PTRACE_GET_SYSCALL_INFO, child, sizeof(info), &info) > 0 &&
          info.op == PTRACE_SYSCALL_INFO_ENTRY && info.entry.nr == SYS_flock) {
        unlink(pid_file_.c_str());  // the stale file goes, a new one comes
        successor = open(pid_file_.c_str(), O_WRONLY | O_CREAT, 0644);
        ASSERT_EQ(held ? flock(successor, LOCK_EX) : 0, 0);
      }
    }
    if (successor < 0) {
      kill(child, SIGKILL);
      waitpid(child, nullptr, 0);
      GTEST_SKIP() << "no ptrace here";
    }
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == (held ? 0 : 1))
        << (held ? "a second instance runs" : "the start was refused");
    EXPECT_EQ(ReadFile(pid_file_), held ? "" : std::to_string(child));
    close(successor);
  }
}

// The detached process (a session leader in /, input /dev/null) records its
// pid and keeps the lock: a second is refused whatever the file says.
TEST_F(LifecycleTest, DaemonDetachesAndRecordsItsOwnPid) {
  std::string report = dir_.File("report"), stop = dir_.File("stop");
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // The detached process carries on; the pid file is relative to the cwd.
    if (chdir(dir_.path().c_str()) != 0 || BecomeDaemon("d.pid")) _exit(3);
    char cwd[64] = "", in[64] = "";
    (void)!getcwd(cwd, sizeof(cwd));
    (void)!readlink("/proc/self/fd/0", in, sizeof(in) - 1);
    WriteFile(report + ".tmp", std::to_string(getpid()) + " " +
                                   std::to_string(getsid(0) == getpid()) + " " +
                                   cwd + " " + in);
    rename((report + ".tmp").c_str(), report.c_str());
    for (int i = 0; i < 200 && access(stop.c_str(), F_OK); ++i) usleep(25000);
    _exit(0);
  }
  EXPECT_EQ(ExitStatus(child), 0);
  for (int i = 0; i < 2500 && access(report.c_str(), F_OK); ++i) usleep(2000);
  std::istringstream fields(ReadFile(report));
  std::string pid, leader, cwd, stdin_target;
  fields >> pid >> leader >> cwd >> stdin_target;
  EXPECT_NE(pid, std::to_string(child));
  EXPECT_EQ(ReadFile(pid_file_), pid);
  EXPECT_EQ(leader + " " + cwd + " " + stdin_target, "1 / /dev/null");
  WriteFile(pid_file_, "4000000");  // same file, a pid that is not alive
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), -1);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), kAlive);
  EXPECT_EQ(quvaidx::test::RunInChildProcess([&] {
              Quiet();  // 7 when refused; detaching would end it with 0
              return BecomeDaemon(pid_file_.c_str()) == -1 ? 7 : 1;
            }),
            7);
  WriteFile(stop, "");  // once it ends, its lock goes with it
  for (int i = 0; i < 2500 && !Unlocked(pid_file_); ++i) usleep(2000);
  EXPECT_EQ(BecomeProcess(pid_file_.c_str()), 0);
}

// A marker file is made (or emptied) and removed; its age is the time since
// its status changed, 0 without one.
TEST_F(LifecycleTest, MarkerFilesAndTheirAge) {
  quvaidx::test::FdLeakCheck leaks;
  const std::string marker = dir_.File("marker");
  WriteFile(marker, "old");
  ASSERT_EQ(CheckIn(marker.c_str()), 0);
  EXPECT_EQ(ReadFile(marker), "");
  EXPECT_LE(GetExecutionTime(marker.c_str()), 1);
  EXPECT_GT(GetExecutionTime("/"), 1);  // older than this test
  EXPECT_EQ(CheckOut(marker.c_str()), 0);
  EXPECT_EQ(CheckOut(marker.c_str()), -1);
  EXPECT_EQ(GetExecutionTime(marker.c_str()), 0);
  EXPECT_EQ(CheckIn(dir_.File("missing/marker").c_str()), -1);
  EXPECT_TRUE(leaks.NoLeak());
}

// Ready at once, polled every ten seconds, or given up after fifteen
// minutes with a notice the log level does not hold back.
TEST(BootWaitTest, PollsUntilReadyOrFifteenMinutes) {
  using quvahost::test::HostOp;
  auto wait = [](std::initializer_list<int> steps, int calls, unsigned secs) {
    quvahost::test::FakeHost host;
    quvaidx::test::FakeSleep sleep;
    LogCapture log(0);
    host.Answer(HostOp::kSystemGetBootStep, steps);
    WaitSystemReady();
    EXPECT_EQ(host.Calls(HostOp::kSystemGetBootStep), calls);
    EXPECT_EQ(sleep.total_seconds(), secs);
    return log.Normalized();
  };
  EXPECT_TRUE(wait({4}, 1, 0).empty());
  EXPECT_TRUE(wait({1, 2, 3, 4}, 4, 30).empty());
  EXPECT_EQ(wait({2}, 91, 900),
            Lines{"quvaidx_system:N [NOTICE] system is not ready? start "
                  "anyway."});
}

// A started program's standard streams are /dev/null; a program that cannot
// run ends its child with an abort; the caller's SA_NOCLDWAIT survives.
TEST(ForkExecvTest, ChildOnDevNullMissingProgramAbortsNoChildWaitKept) {
  quvaidx::test::TempDir dir;
  std::string out = dir.File("out");
  // $$ is the shell itself, whose streams are the ones ForkExecv set up.
  std::string script =
      "readlink /proc/$$/fd/0 /proc/$$/fd/1 /proc/$$/fd/2 | tr '\\n' ' ' > " +
      out;
  char* argv[] = {const_cast<char*>("sh"), const_cast<char*>("-c"),
                  const_cast<char*>(script.c_str()), nullptr};
  for (bool stdin_closed : {false, true}) {  // then /dev/null opens as 0
    EXPECT_EQ(quvaidx::test::RunInChildProcess([&] {
                if (stdin_closed) close(0);
                return ExitStatus(ForkExecv("/bin/sh", argv));
              }),
              0);
    EXPECT_EQ(ReadFile(out), "/dev/null /dev/null /dev/null ");
  }
  argv[1] = nullptr;
  int status = 0, pid = ForkExecv("/nonexistent/program", argv);
  ASSERT_GT(pid, 0);
  ASSERT_EQ(waitpid(pid, &status, 0), pid);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGABRT);
  struct sigaction action = {}, after;
  action.sa_handler = SIG_DFL;
  action.sa_flags = SA_NOCLDWAIT;
  ASSERT_EQ(sigaction(SIGCHLD, &action, nullptr), 0);
  EXPECT_GT(ForkExecv("/bin/true", argv), 0);
  sigaction(SIGCHLD, nullptr, &after);
  EXPECT_NE(after.sa_flags & SA_NOCLDWAIT, 0);
  action.sa_flags = 0;
  sigaction(SIGCHLD, &action, nullptr);
}

}  // namespace
