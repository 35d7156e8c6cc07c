// Compacting a spool queue into a new file renamed over it.
#include "util/queue_compact.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "util/file_io.h"

namespace quvaidx {
namespace {

constexpr size_t kCopyBlock = 64 * 1024;
constexpr int kNameAttempts = 64;
constexpr char kNameLetters[] =
    "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";

// The directory part of `path`: "." for a bare name, "/" for "/name".
std::string DirectoryOf(const char* path) {
  const char* slash = strrchr(path, '/');
  if (slash == nullptr) return ".";
  if (slash == path) return "/";
  return std::string(path, static_cast<size_t>(slash - path));
}

bool IsLetterOrDigit(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
         (c >= '0' && c <= '9');
}

// "<path>." and six random letters or digits, as mkstemp names its files.
std::string CopyName(const char* path) {
  unsigned char random[6];
  if (getrandom(random, sizeof(random), GRND_NONBLOCK) !=
      static_cast<ssize_t>(sizeof(random))) {
    // Only the name's uniqueness depends on this; linkat refuses a taken
    // name and the caller draws again.
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    unsigned long mix = static_cast<unsigned long>(now.tv_nsec) ^
                        (static_cast<unsigned long>(getpid()) << 20);
    for (unsigned char& byte : random) {
      byte = static_cast<unsigned char>(mix);
      mix = mix * 6364136223846793005ul + 1442695040888963407ul;
    }
  }
  std::string name = std::string(path) + ".";
  for (unsigned char byte : random) {
    name += kNameLetters[byte % (sizeof(kNameLetters) - 1)];
  }
  return name;
}

// Gives the unnamed file `fd` a fresh copy name beside `path`. Returns the
// name, or "" with errno.
std::string LinkUnnamed(int fd, const char* path) {
  char proc_path[64];
  snprintf(proc_path, sizeof(proc_path), "/proc/self/fd/%d", fd);
  for (int attempt = 0; attempt < kNameAttempts; ++attempt) {
    std::string name = CopyName(path);
    if (linkat(AT_FDCWD, proc_path, AT_FDCWD, name.c_str(),
               AT_SYMLINK_FOLLOW) == 0) {
      return name;
    }
    if (errno == ENOENT) {
      // No /proc: a process with CAP_DAC_READ_SEARCH may link the
      // descriptor itself.
      if (linkat(fd, "", AT_FDCWD, name.c_str(), AT_EMPTY_PATH) == 0) {
        return name;
      }
    }
    if (errno != EEXIST) return "";
  }
  return "";
}

// Copies the bytes of `in` from `from` to its end into `out`.
bool CopyFrom(int in, off_t from, int out) {
  std::vector<char> block(kCopyBlock);
  for (off_t at = from;;) {
    ssize_t got = pread(in, block.data(), block.size(), at);
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got < 0) return false;
    if (got == 0) return true;
    if (!WriteAll(out, block.data(), static_cast<size_t>(got))) return false;
    at += got;
  }
}

// Gives `out` the owner and group of `st`, and its read and write bits.
bool TakeOwnerAndMode(int out, const struct stat& st) {
  struct stat now;
  if (fstat(out, &now) != 0) return false;
  if ((now.st_uid != st.st_uid || now.st_gid != st.st_gid) &&
      fchown(out, st.st_uid, st.st_gid) != 0) {
    return false;
  }
  return fchmod(out, st.st_mode & 0666) == 0;
}

}  // namespace

bool IsQueueCopyName(const char* name, const char* base) {
  const size_t base_length = strlen(base);
  if (strlen(name) != base_length + 7 ||
      strncmp(name, base, base_length) != 0 || name[base_length] != '.') {
    return false;
  }
  for (const char* c = name + base_length + 1; *c != '\0'; ++c) {
    if (!IsLetterOrDigit(*c)) return false;
  }
  return true;
}

int RemoveQueueCopies(const char* path,
                      void (*removed)(const char* name, const char* path)) {
  const char* slash = strrchr(path, '/');
  const char* base = slash != nullptr ? slash + 1 : path;
  const int dir_fd =
      open(DirectoryOf(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir_fd < 0) return -1;
  DIR* dir = fdopendir(dir_fd);
  if (dir == nullptr) {
    const int err = errno;
    close(dir_fd);
    errno = err;
    return -1;
  }
  int count = 0;
  while (struct dirent* entry = readdir(dir)) {
    struct stat st;
    if (IsQueueCopyName(entry->d_name, base) &&
        fstatat(dir_fd, entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
        S_ISREG(st.st_mode) && unlinkat(dir_fd, entry->d_name, 0) == 0) {
      ++count;
      removed(entry->d_name, path);
    }
  }
  closedir(dir);
  return count;
}

int CompactQueue(const char* path, int fd, off_t from) {
  struct stat st;
  if (fstat(fd, &st) != 0) return -1;
  const std::string directory = DirectoryOf(path);
  std::string name;  // the copy's name, once it has one
  int out = open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
  if (out < 0) {
    if (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL) return -1;
    // No unnamed files here: a named copy, removed at the next start if
    // this process dies before the rename.
    name = std::string(path) + ".XXXXXX";
    out = mkostemp(&name[0], O_CLOEXEC);
    if (out < 0) return -1;
  }
  // Nobody else knows the file yet, so the lock is ours at once; held from
  // before the rename, it keeps every other process out of the new queue
  // until the caller is done with it.
  bool ok = flock(out, LOCK_EX | LOCK_NB) == 0 && TakeOwnerAndMode(out, st) &&
            CopyFrom(fd, from, out) && fsync(out) == 0;
  if (ok && name.empty()) {
    name = LinkUnnamed(out, path);
    ok = !name.empty();
  }
  ok = ok && rename(name.c_str(), path) == 0;
  if (!ok) {
    const int err = errno;
    if (!name.empty()) unlink(name.c_str());  // don't care if this fails
    close(out);
    errno = err;
    return -1;
  }
  return out;
}

}  // namespace quvaidx
