#include "support/unprivileged.h"

#include <grp.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <stddef.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

namespace quvaidx::test {

namespace {

// Runs `check` in a child after `restrict` (false: could not, exit 255).
int RunInChild(const std::function<bool()>& restrict,
               const std::function<int()>& check) {
  pid_t child = fork();
  if (child < 0) return -1;
  if (child == 0) {
    if (!restrict()) _exit(255);
    _exit(check() & 0xff);
  }
  int status = 0;
  if (waitpid(child, &status, 0) != child || !WIFEXITED(status)) return -1;
  int code = WEXITSTATUS(status);
  return code == 255 ? -1 : code;
}

}  // namespace

int RunInChildProcess(const std::function<int()>& check) {
  return RunInChild([] { return true; }, check);
}

int RunUnprivileged(const std::function<int()>& check) {
  return RunInChild(
      [] {
        return getuid() != 0 || (setgroups(0, nullptr) == 0 &&
                                 setgid(kNobody) == 0 && setuid(kNobody) == 0);
      },
      check);
}

int RunAsUser(unsigned uid, unsigned gid, const std::vector<unsigned>& groups,
              const std::function<int()>& check) {
  return RunInChild(
      [&] {
        const std::vector<gid_t> held(groups.begin(), groups.end());
        return setgroups(held.size(), held.data()) == 0 &&
               setresgid(gid, gid, gid) == 0 && setresuid(uid, uid, uid) == 0;
      },
      check);
}

int RunWithFileSizeLimit(long bytes, const std::function<int()>& check,
                         unsigned seconds) {
  return RunInChild(
      [&] {
        struct rlimit limit = {static_cast<rlim_t>(bytes),
                               static_cast<rlim_t>(bytes)};
        alarm(seconds);
        return signal(SIGXFSZ, SIG_IGN) != SIG_ERR &&
               setrlimit(RLIMIT_FSIZE, &limit) == 0;
      },
      check);
}

int RunWithSyscallsFailing(const std::vector<std::pair<long, int>>& failures,
                           const std::function<int()>& check) {
  return RunInChild(
      [&] {
        std::vector<sock_filter> program = {BPF_STMT(
            BPF_LD | BPF_W | BPF_ABS, offsetof(struct seccomp_data, nr))};
        for (const auto& [number, error] : failures) {
          program.push_back(BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K,
                                     static_cast<__u32>(number), 0, 1));
          program.push_back(
              BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | (error & 0xffff)));
        }
        program.push_back(BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW));
        sock_fprog filter = {static_cast<unsigned short>(program.size()),
                             program.data()};
        return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
               prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
      },
      check);
}

}  // namespace quvaidx::test
