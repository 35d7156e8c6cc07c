#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

#include "support/fd_check.h"

namespace quvaidx::daemon_test {

bool DaemonProcess::Start(const std::string& program,
                          const std::vector<std::string>& args,
                          const std::string& output_dir,
                          const std::string& name, const std::string& ready) {
  out_ = output_dir + "/" + name + ".out";
  err_ = output_dir + "/" + name + ".err";
  std::vector<std::string> all = {program};
  all.insert(all.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& arg : all) argv.push_back(arg.data());
  argv.push_back(nullptr);
  // Opened here, not in the child, so that no output of an earlier process
  // under the same name is taken for this one's.
  const int out =
      open(out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  const int err =
      open(err_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  pid_ = out < 0 || err < 0 ? -1 : fork();
  if (pid_ == 0) {
    dup2(out, 1);
    dup2(err, 2);
    // The test binary may block signals; the daemon must not inherit that.
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    // The host stand-in's files (boot step, shares) come from the test's
    // directory, never from the machine's /usr/quva/etc.
    setenv("QUVA_HOST_ETC", output_dir.c_str(), 1);
    execv(argv[0], argv.data());
    _exit(127);
  }
  if (out >= 0) close(out);
  if (err >= 0) close(err);
  WaitUntil(10, [&] {
    return Output().find(ready) != std::string::npos || !Running();
  });
  return Running() && Output().find(ready) != std::string::npos;
}

DaemonProcess::~DaemonProcess() {
  if (Signal(SIGKILL)) WaitExit(5, false);
}

std::string DaemonProcess::Output() const { return test::ReadFile(out_); }
std::string DaemonProcess::Errors() const { return test::ReadFile(err_); }

bool DaemonProcess::Signal(int signal) {
  return Running() && kill(pid_, signal) == 0;
}

bool DaemonProcess::WaitExit(double seconds, bool clean) {
  return WaitUntil(seconds, [&] { return !Running(); }) &&
         (!clean || (WIFEXITED(status_) && WEXITSTATUS(status_) == 0));
}

bool DaemonProcess::Running() {
  if (pid_ > 0 && waitpid(pid_, &status_, WNOHANG) == pid_) pid_ = -1;
  return pid_ > 0;
}

bool WaitUntil(double seconds, const std::function<bool()>& done) {
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  for (;;) {
    if (done()) return true;
    if (std::chrono::steady_clock::now() > deadline) return done();
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
}

}  // namespace quvaidx::daemon_test
