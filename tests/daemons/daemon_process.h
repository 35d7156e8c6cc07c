// A reference daemon run as a real process by a test: started in the
// foreground with its output in files, watched, signalled, waited for. The
// destructor kills it (SIGKILL) when the test has not ended it.
#ifndef QUVAIDX_TESTS_DAEMONS_DAEMON_PROCESS_H_
#define QUVAIDX_TESTS_DAEMONS_DAEMON_PROCESS_H_

#include <sys/stat.h>
#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace quvaidx::daemon_test {

class DaemonProcess {
 public:
  // Starts `program` with `args`; its standard output and error go to
  // `output_dir`/<name>.out and .err, and the host stand-in reads its files
  // from `output_dir` (QUVA_HOST_ETC). Then waits (10 s at most) until its
  // standard output holds `ready`. False when it did not get that far.
  bool Start(const std::string& program, const std::vector<std::string>& args,
             const std::string& output_dir, const std::string& name,
             const std::string& ready);
  ~DaemonProcess();

  // Standard output and error so far.
  std::string Output() const;
  std::string Errors() const;

  // Sends `signal`; false when the process is gone.
  bool Signal(int signal);
  // Waits until the process has ended, at most `seconds`. True when it did,
  // with exit status 0 when `clean`.
  bool WaitExit(double seconds, bool clean = true);
  // True when the process has not ended.
  bool Running();

 private:
  pid_t pid_ = -1;
  int status_ = 0;
  std::string out_;
  std::string err_;
};

// True when `path` names anything, a link too (not followed).
inline bool Exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

// Calls `done` every 10 ms until it is true or `seconds` have passed;
// returns its last result.
bool WaitUntil(double seconds, const std::function<bool()>& done);

}  // namespace quvaidx::daemon_test

#endif  // QUVAIDX_TESTS_DAEMONS_DAEMON_PROCESS_H_
