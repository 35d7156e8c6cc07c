// Helpers for the tests of the host stand-in: a temporary directory that
// serves as the host directory ($QUVA_HOST_ETC) and small file helpers.
#ifndef QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_
#define QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_

#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "quvahost/quvahost.h"

namespace quvahost::test {

// A fresh directory under /tmp, removed with its contents at the end.
class TempDir {
 public:
  TempDir() {
    char templ[] = "/tmp/quvahost-test-XXXXXX";
    const char* made = mkdtemp(templ);
    path_ = made != nullptr ? made : "";
  }
  ~TempDir() {
    std::error_code ignored;
    if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// A temporary host directory: QUVA_HOST_ETC points at it while the object
// lives, and the previous value comes back after.
class HostEtc : public TempDir {
 public:
  HostEtc() {
    const char* old = getenv(QUVA_HOST_ETC_ENV);
    had_old_ = old != nullptr;
    if (had_old_) old_ = old;
    setenv(QUVA_HOST_ETC_ENV, path().c_str(), 1);
  }
  ~HostEtc() {
    if (had_old_) {
      setenv(QUVA_HOST_ETC_ENV, old_.c_str(), 1);
    } else {
      unsetenv(QUVA_HOST_ETC_ENV);
    }
  }

 private:
  bool had_old_ = false;
  std::string old_;
};

inline void WriteFile(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
}

inline std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

}  // namespace quvahost::test

#endif  // QUVAIDX_TESTS_PLATFORM_HOST_TEST_UTIL_H_
