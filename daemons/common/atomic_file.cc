#include "atomic_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

namespace quvaidx_daemons {

std::string WriteAtomically(const std::string& path,
                            const std::string& temp_suffix, const void* data,
                            size_t length, mode_t mode, bool sync,
                            const std::string& what) {
  std::string temp = path + temp_suffix + "XXXXXX";
  int fd = mkostemp(&temp[0], O_CLOEXEC);
  if (fd < 0) return std::string("cannot create a file: ") + strerror(errno);
  const char* bytes = static_cast<const char*>(data);
  size_t done = 0;
  int err = 0;
  while (done < length) {
    ssize_t wrote = write(fd, bytes + done, length - done);
    if (wrote < 0) {
      if (errno == EINTR) continue;  // Retry
      err = errno;
      break;
    }
    done += static_cast<size_t>(wrote);
  }
  // mkstemp makes the file private; the caller says how readable it is.
  if (err == 0 && fchmod(fd, mode) != 0) err = errno;
  if (err == 0 && sync && fsync(fd) != 0) err = errno;
  if (close(fd) != 0 && err == 0) err = errno;
  if (err == 0 && rename(temp.c_str(), path.c_str()) != 0) err = errno;
  if (err != 0) {
    unlink(temp.c_str());
    return "cannot write " + what + ": " + strerror(err);
  }
  return "";
}

}  // namespace quvaidx_daemons
