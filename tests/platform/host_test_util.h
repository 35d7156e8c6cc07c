// A temporary host directory and file helpers for the tests of the host
// stand-in.
#ifndef QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_
#define QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_

#include <fstream>
#include <sstream>
#include <string>

#include "quvahost/quvahost.h"
#include "support/fd_check.h"

namespace quvahost::test {

using quvaidx::test::TempDir;

// $QUVA_HOST_ETC points at this directory while it lives.
class HostEtc : public TempDir {
 public:
  HostEtc() {
    if (const char* old = getenv(QUVA_HOST_ETC_ENV)) old_ = old;
    setenv(QUVA_HOST_ETC_ENV, path().c_str(), 1);
  }
  ~HostEtc() {
    if (old_.empty())
      unsetenv(QUVA_HOST_ETC_ENV);
    else
      setenv(QUVA_HOST_ETC_ENV, old_.c_str(), 1);
  }

 private:
  std::string old_;
};

using quvaidx::test::ReadFile;
using quvaidx::test::WriteFile;

}  // namespace quvahost::test

#endif  // QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_
