#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

namespace quvaidx::daemon_test {
namespace {

std::string Slurp(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path).rdbuf();
  return text.str();
}

}  // namespace

bool DaemonProcess::Start(const std::string& program,
                          const std::vector<std::string>& args,
                          const std::string& output_dir,
                          const std::string& name) {
  out_ = output_dir + "/" + name + ".out";
  err_ = output_dir + "/" + name + ".err";
  std::vector<std::string> all = {program};
  all.insert(all.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& arg : all) argv.push_back(arg.data());
  argv.push_back(nullptr);
  pid_ = fork();
  if (pid_ < 0) return false;
  if (pid_ == 0) {
    int out = open(out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    int err = open(err_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (out < 0 || err < 0) _exit(126);
    dup2(out, 1);
    dup2(err, 2);
    // The test binary may ignore or block signals; the daemon must not
    // inherit that.
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    // The host stand-in's files (boot step, shares) come from the test's
    // directory, never from the machine's /usr/quva/etc.
    setenv("QUVA_HOST_ETC", output_dir.c_str(), 1);
    execv(argv[0], argv.data());
    _exit(127);
  }
  return true;
}

DaemonProcess::~DaemonProcess() {
  if (pid_ > 0 && Running()) {
    kill(pid_, SIGKILL);
    int status;
    WaitExit(5, &status);
  }
}

std::string DaemonProcess::Output() const { return Slurp(out_); }
std::string DaemonProcess::Errors() const { return Slurp(err_); }

bool DaemonProcess::Signal(int signal) {
  return pid_ > 0 && kill(pid_, signal) == 0;
}

bool DaemonProcess::WaitExit(double seconds, int* status) {
  if (pid_ <= 0) return false;
  bool ended = WaitUntil(
      seconds, [&] { return waitpid(pid_, status, WNOHANG) == pid_; });
  if (ended) pid_ = -1;
  return ended;
}

bool DaemonProcess::Running() {
  if (pid_ <= 0) return false;
  int status;
  if (waitpid(pid_, &status, WNOHANG) == pid_) {
    pid_ = -1;
    return false;
  }
  return true;
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
