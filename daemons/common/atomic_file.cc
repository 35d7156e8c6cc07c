#include "atomic_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

namespace quvaidx_daemons {
namespace {

// Writes all of `data` to `fd`. Returns 0 or the errno of the failure.
int WriteAll(int fd, const void* data, size_t length) {
  const char* bytes = static_cast<const char*>(data);
  size_t done = 0;
  while (done < length) {
    ssize_t wrote = write(fd, bytes + done, length - done);
    if (wrote < 0) {
      if (errno == EINTR) continue;  // Retry
      return errno;
    }
    done += static_cast<size_t>(wrote);
  }
  return 0;
}

// Six characters for a temporary name; unpredictable where the kernel
// gives random bytes, else at least different from try to try.
std::string RandomSuffix() {
  static const char kChars[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  unsigned char bytes[6];
  if (getrandom(bytes, sizeof(bytes), GRND_NONBLOCK) !=
      static_cast<ssize_t>(sizeof(bytes))) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    static unsigned long counter = 0;
    unsigned long mix = static_cast<unsigned long>(now.tv_nsec) ^
                        (static_cast<unsigned long>(getpid()) << 20) ^
                        (++counter * 2654435761UL);
    for (unsigned char& byte : bytes) {
      byte = static_cast<unsigned char>(mix);
      mix = mix * 6364136223846793005UL + 1442695040888963407UL;
    }
  }
  std::string suffix;
  for (unsigned char byte : bytes)
    suffix += kChars[byte % (sizeof(kChars) - 1)];
  return suffix;
}

}  // namespace

std::string WriteAtomicallyAt(int dir_fd, const std::string& name,
                              const std::string& temp_suffix, const void* data,
                              size_t length, const PrepareFile& prepare,
                              bool sync, const std::string& what) {
  struct stat st;
  if (fstatat(dir_fd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
      S_ISLNK(st.st_mode)) {
    return "cannot write " + what + ": a symbolic link is in its place";
  }
  std::string temp;
  int fd = -1;
  for (int attempt = 0; attempt < 100 && fd < 0; ++attempt) {
    temp = name + temp_suffix + RandomSuffix();
    fd = openat(dir_fd, temp.c_str(),
                O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0 && errno != EEXIST) break;
  }
  if (fd < 0) return "cannot create " + what + ": " + strerror(errno);
  int err = WriteAll(fd, data, length);
  std::string problem;
  if (err == 0 && prepare) problem = prepare(fd);
  if (err == 0 && problem.empty() && sync && fsync(fd) != 0) err = errno;
  if (close(fd) != 0 && err == 0) err = errno;
  if (err == 0 && problem.empty() &&
      renameat(dir_fd, temp.c_str(), dir_fd, name.c_str()) != 0) {
    err = errno;
  }
  if (err != 0 || !problem.empty()) {
    unlinkat(dir_fd, temp.c_str(), 0);  // ours: made with O_EXCL above
    return "cannot write " + what + ": " +
           (problem.empty() ? strerror(err) : problem);
  }
  return "";
}

}  // namespace quvaidx_daemons
