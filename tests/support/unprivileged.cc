#include "support/unprivileged.h"

#include <grp.h>
#include <sys/wait.h>
#include <unistd.h>

namespace quvaidx::test {

int RunUnprivileged(const std::function<int()>& check) {
  pid_t child = fork();
  if (child < 0) return -1;
  if (child == 0) {
    if (getuid() == 0 && (setgroups(0, nullptr) != 0 || setgid(kNobody) != 0 ||
                          setuid(kNobody) != 0)) {
      _exit(255);
    }
    _exit(check() & 0xff);
  }
  int status = 0;
  if (waitpid(child, &status, 0) != child || !WIFEXITED(status)) return -1;
  int code = WEXITSTATUS(status);
  return code == 255 ? -1 : code;
}

}  // namespace quvaidx::test
