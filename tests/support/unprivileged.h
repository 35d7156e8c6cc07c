// Runs a check in a child process with less than this process may do: as
// an unprivileged user, so that permission failures happen even when the
// tests run as root; with a file-size limit, so that writes fail as on a
// full disk; or with chosen system calls failing, as on kernels and
// filesystems without them.
#ifndef QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_
#define QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_

#include <functional>
#include <utility>
#include <vector>

namespace quvaidx::test {

// The user and group a root test drops to.
constexpr unsigned kNobody = 65534;

// Runs `check` in a child process that, when this process is root, first
// becomes user and group kNobody. Returns the value `check` returned, or -1
// when the child could not run it.
int RunUnprivileged(const std::function<int()>& check);

// Runs `check` in a child process as this process is. Returns the value
// `check` returned (0 to 254), or -1 when the child did not finish.
int RunInChildProcess(const std::function<int()>& check);

// Runs `check` in a child process that first becomes user `uid` with
// primary group `gid` and supplementary groups `groups` (real, effective and
// saved ids alike), which needs root. Returns the value `check` returned, or
// -1 when the child could not become that user or did not finish.
int RunAsUser(unsigned uid, unsigned gid, const std::vector<unsigned>& groups,
              const std::function<int()>& check);

// Runs `check` in a child process whose files cannot grow beyond `bytes`
// (RLIMIT_FSIZE, with SIGXFSZ ignored): a write that crosses the limit
// comes back short, the next one fails with EFBIG. The child is killed
// after `seconds`, so a check that retries a failed write for ever ends.
// Returns the value `check` returned, or -1 when the child did not finish.
int RunWithFileSizeLimit(long bytes, const std::function<int()>& check,
                         unsigned seconds = 5);

// Runs `check` in a child process in which every call of each system call
// number of `failures` fails at once with its errno value (a seccomp filter),
// as on a filesystem or kernel without that call. Returns the value `check`
// returned, or -1 when the child could not run it.
int RunWithSyscallsFailing(const std::vector<std::pair<long, int>>& failures,
                           const std::function<int()>& check);

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_
