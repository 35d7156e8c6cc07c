#include "support/fd_check.h"

#include <dirent.h>

namespace quvaidx::test {

int OpenDescriptorCount() {
  DIR* dir = opendir("/proc/self/fd");
  if (dir == nullptr) return -1;
  int count = 0;
  while (struct dirent* entry = readdir(dir)) count += entry->d_name[0] != '.';
  closedir(dir);
  return count - 1;  // the directory stream's own descriptor
}

}  // namespace quvaidx::test
