// Descriptor-leak checking (entries of /proc/self/fd) and temporary
// directories.
#ifndef QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_
#define QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

namespace quvaidx::test {

// Number of descriptors open in this process.
int OpenDescriptorCount();

// Records the count at construction; NoLeak() compares it with the count now.
class FdLeakCheck {
 public:
  FdLeakCheck() : before_(OpenDescriptorCount()) {}
  bool NoLeak() const { return OpenDescriptorCount() == before_; }

 private:
  int before_;
};

// A fresh temporary directory, removed with its contents by the destructor.
// Header-only, so the host tests can use it without the library.
class TempDir {
 public:
  TempDir() {
    char templ[] = "/tmp/quvaidx-test-XXXXXX";
    path_ = mkdtemp(templ) != nullptr ? templ : "/tmp";
  }
  ~TempDir() {
    std::error_code ignored;
    if (path_ != "/tmp") std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// Whole-file helpers for tests: the file's bytes ("" when it cannot be
// read), and replacing a file's contents.
inline std::string ReadFile(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

inline void WriteFile(const std::string& path, const std::string& content) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
}

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_
