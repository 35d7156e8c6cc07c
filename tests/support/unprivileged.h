// Runs a check as an unprivileged user, so that permission failures happen
// even when the tests run as root.
#ifndef QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_
#define QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_

#include <functional>

namespace quvaidx::test {

// The user and group a root test drops to.
constexpr unsigned kNobody = 65534;

// Runs `check` in a child process that, when this process is root, first
// becomes user and group kNobody. Returns the value `check` returned, or -1
// when the child could not run it.
int RunUnprivileged(const std::function<int()>& check);

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_UNPRIVILEGED_H_
