// Descriptor-leak checking: counts the entries of /proc/self/fd.
#ifndef QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_
#define QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_

#include <string>

namespace quvaidx::test {

// Number of descriptors open in this process.
int OpenDescriptorCount();

// Records the count at construction; NoLeak() compares it with the count now.
class FdLeakCheck {
 public:
  FdLeakCheck();
  bool NoLeak() const;
  int before() const { return before_; }

 private:
  int before_;
};

// A unique socket path in a fresh temporary directory, removed by the
// destructor together with whatever is left in it.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_FD_CHECK_H_
