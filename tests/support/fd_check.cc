#include "support/fd_check.h"

#include <dirent.h>
#include <stdlib.h>

#include <filesystem>
#include <string>

namespace quvaidx::test {

int OpenDescriptorCount() {
  DIR* dir = opendir("/proc/self/fd");
  if (dir == nullptr) return -1;
  int count = 0;
  while (struct dirent* entry = readdir(dir)) {
    if (entry->d_name[0] != '.') ++count;
  }
  closedir(dir);
  return count - 1;  // the directory stream's own descriptor
}

FdLeakCheck::FdLeakCheck() : before_(OpenDescriptorCount()) {}

bool FdLeakCheck::NoLeak() const { return OpenDescriptorCount() == before_; }

TempDir::TempDir() {
  char templ[] = "/tmp/quvaidx-test-XXXXXX";
  const char* made = mkdtemp(templ);
  path_ = made != nullptr ? made : "/tmp";
}

TempDir::~TempDir() {
  std::error_code ignored;
  if (path_ != "/tmp") std::filesystem::remove_all(path_, ignored);
}

}  // namespace quvaidx::test
