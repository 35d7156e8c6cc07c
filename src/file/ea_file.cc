// Metadata side directories, reached without following links.
//
// Sections: walking a path's last components without links; the exported
// functions.
//
// A user owns the folder of a media file and may plant anything in its
// metadata directory; a root daemon that follows a link there would read,
// write or remove another user's files. So every function here opens the
// metadata directory and the EA directory one component at a time with
// O_NOFOLLOW|O_DIRECTORY from their parent's descriptor, and works on
// items relative to the EA directory's descriptor. A link found there is
// refused and logged, never followed and never removed.
#include "quvaidx/ea_file.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <initializer_list>
#include <string>
#include <string_view>

#include "file/file_common.h"
#include "quvahost/quvahost.h"
#include "util/log_internal.h"

using quvaidx::file::ComposePath;
using quvaidx::file::kPathBufferSize;
using quvaidx::file::Printable;

namespace {

constexpr char kModule[] = "quvaidx_eafile";

// Items smaller than this hold nothing usable for the callers that report
// presence.
constexpr int64_t kMinUsableItemSize = 2;

// How often one component is looked at again when it changes between our
// test and our open (made, removed or replaced by another process).
constexpr int kComponentAttempts = 4;

constexpr int kDirOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Closes a descriptor when it goes out of scope.
class ScopedFd {
 public:
  explicit ScopedFd(int fd = -1) : fd_(fd) {}
  ~ScopedFd() {
    if (fd_ >= 0) close(fd_);
  }
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;
  int get() const { return fd_; }
  int release() {
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  void reset(int fd) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }

 private:
  int fd_;  // owned descriptor, or -1
};

// ---------------------------------------------------------------------------
// Walking a path's last components without links

void LogRefusedLink(std::string_view path) {
  quvaidx::LogDirect(LOG_ERR,
                     "%s:%d Refused symbolic link at %.*s (not followed, not "
                     "removed)",
                     kModule, __LINE__, static_cast<int>(path.size()),
                     path.data());
}

void LogRefusedSpecial(std::string_view path) {
  quvaidx::LogDirect(LOG_ERR,
                     "%s:%d Refused %.*s: neither a directory nor a regular "
                     "file (not opened, not removed)",
                     kModule, __LINE__, static_cast<int>(path.size()),
                     path.data());
}

// `path` without its final slashes; "/" stays.
std::string_view StripFinalSlashes(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return path;
}

// A single directory entry name that leads nowhere but into its parent's
// own entries.
bool IsPlainName(std::string_view name) {
  return !name.empty() && name != "." && name != ".." &&
         name.find('/') == std::string_view::npos;
}

// The outcome of opening a path's last components.
struct Walk {
  int fd = -1;           // the last directory, owned by the caller; or -1
  int error = 0;         // errno value when fd is -1
  bool refused = false;  // a link or special file stood in the way (logged)
  std::string failed;    // the path of the component that failed
};

// Opens the directory `name` inside `parent_fd` without following a link;
// `shown` is its path, for the log. With `create`, a missing directory is
// made (mode 0777 less the umask) and a regular file in its place is
// unlinked first; a link or special file is refused in every case.
// Returns the descriptor, or -1 with walk->error (and walk->refused) set.
int OpenComponent(int parent_fd, const char* name, std::string_view shown,
                  bool create, Walk* walk) {
  for (int attempt = 0; attempt < kComponentAttempts; ++attempt) {
    const int fd = openat(parent_fd, name, kDirOpenFlags);
    if (fd >= 0) return fd;
    int err = errno;
    if (err == ENOTDIR) {
      // O_DIRECTORY|O_NOFOLLOW answers ENOTDIR for links as well: see what
      // is really there.
      struct stat st;
      if (fstatat(parent_fd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
        if (errno == ENOENT) continue;  // gone meanwhile: look again
        walk->error = errno;
        return -1;
      }
      if (S_ISDIR(st.st_mode)) continue;  // made meanwhile
      if (S_ISLNK(st.st_mode)) {
        LogRefusedLink(shown);
        walk->refused = true;
        walk->error = ELOOP;
        return -1;
      }
      if (!S_ISREG(st.st_mode)) {
        LogRefusedSpecial(shown);
        walk->refused = true;
        walk->error = ENOTDIR;
        return -1;
      }
      if (!create) {
        walk->error = ENOTDIR;
        return -1;
      }
      // unlinkat never removes a directory (flags 0) nor a link's target;
      // if it fails, mkdirat below reports why.
      unlinkat(parent_fd, name, 0);
      err = ENOENT;
    }
    if (err != ENOENT || !create) {
      walk->error = err;
      return -1;
    }
    if (mkdirat(parent_fd, name, 0777) != 0 && errno != EEXIST) {
      walk->error = errno;
      return -1;
    }
    // Made by us or by another process: open it on the next turn, where a
    // link swapped in meanwhile is refused.
  }
  walk->error = EAGAIN;
  return -1;
}

// Opens the last `count` components of `path` (at most 2) without links,
// starting at `base_fd`, the directory `path` holds before them, or at that
// directory opened by its path when base_fd is -1 (links before the last
// components are the caller's business). Components "." and ".." are
// opened as they are: neither can be a link.
Walk WalkTail(std::string_view path, int count, int base_fd, bool create) {
  Walk walk;
  std::string_view names[2];
  size_t ends[2];  // where each component ends in `path`
  int first = count;
  std::string_view rest = StripFinalSlashes(path);
  while (first > 0 && !rest.empty() && rest != "/") {
    const size_t slash = rest.rfind('/');
    --first;
    ends[first] = rest.size();
    names[first] =
        slash == std::string_view::npos ? rest : rest.substr(slash + 1);
    rest = StripFinalSlashes(slash == std::string_view::npos
                                 ? std::string_view()
                                 : rest.substr(0, slash + 1));
  }
  if (first == count) {
    walk.error = path.empty() ? ENOENT : EINVAL;
    walk.failed = std::string(path);
    return walk;
  }
  ScopedFd dir;
  if (base_fd >= 0) {
    dir.reset(fcntl(base_fd, F_DUPFD_CLOEXEC, 0));
  } else {
    const std::string prefix = rest.empty() ? "." : std::string(rest);
    dir.reset(open(prefix.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  if (dir.get() < 0) {
    walk.error = errno;
    walk.failed = std::string(path.substr(0, ends[first]));
    return walk;
  }
  for (int i = first; i < count; ++i) {
    const std::string name(names[i]);
    const std::string_view shown = path.substr(0, ends[i]);
    const int fd = OpenComponent(dir.get(), name.c_str(), shown, create, &walk);
    if (fd < 0) {
      walk.failed = std::string(shown);
      return walk;
    }
    dir.reset(fd);
  }
  walk.fd = dir.release();
  return walk;
}

// The part of `file_path` up to and including its last '/' (final slashes
// ignored), as the host cuts it: "" for a bare name.
std::string_view FolderOf(std::string_view file_path) {
  file_path = StripFinalSlashes(file_path);
  const size_t slash = file_path.rfind('/');
  return slash == std::string_view::npos ? std::string_view()
                                         : file_path.substr(0, slash + 1);
}

// True when `ea_dir` is `folder` followed by exactly two plain names: the
// metadata directory and the EA directory, both inside the file's folder.
bool IsInsideFolder(std::string_view ea_dir, std::string_view folder) {
  if (ea_dir.substr(0, folder.size()) != folder) return false;
  const std::string_view rest = ea_dir.substr(folder.size());
  const size_t slash = rest.find('/');
  return slash != std::string_view::npos &&
         IsPlainName(rest.substr(0, slash)) &&
         IsPlainName(rest.substr(slash + 1));
}

// Asks the host for the EA directory of `file_path` into dir[size]; logs the
// host's last error on failure.
bool EADirOf(const char* file_path, char* dir, int size) {
  if (QUVAEADirPath(0, file_path, dir, size) == 0) {
    dir[size - 1] = '\0';
    return true;
  }
  quvaidx::LogDirect(LOG_ERR, "%s:%d QUVAEADirPath error [0x%04X %s:%d] on %s",
                     kModule, __LINE__, QLIBCErrGet(), QLIBCErrorGetFile(),
                     QLIBCErrorGetLine(), Printable(file_path));
  return false;
}

// What stands at `name` in the EA directory `ea_fd`, never through a link.
enum class Item { kAbsent, kRegular, kOther };

// Looks at the item `name` of the EA directory `ea_fd` (path `ea_dir`).
// Names that do not fit a path buffer with the directory, or that hold a
// '/', name no item. A link is logged and is not an item.
Item LookAtItem(int ea_fd, const char* ea_dir, const char* name,
                struct stat* st) {
  char path[kPathBufferSize];
  if (name == nullptr || strchr(name, '/') != nullptr ||
      !ComposePath(path, sizeof(path), ea_dir, "/", name) ||
      fstatat(ea_fd, name, st, AT_SYMLINK_NOFOLLOW) != 0) {
    return Item::kAbsent;
  }
  if (S_ISLNK(st->st_mode)) {
    LogRefusedLink(path);
    return Item::kOther;
  }
  return S_ISREG(st->st_mode) ? Item::kRegular : Item::kOther;
}

// IsEAFileExist on an open EA directory.
const char* FindItem(int ea_fd, const char* ea_dir, int64_t* size,
                     const char* name1, const char* name2) {
  for (const char* name : {name1, name2}) {
    struct stat st;
    if (LookAtItem(ea_fd, ea_dir, name, &st) == Item::kRegular) {
      if (size != nullptr) *size = static_cast<int64_t>(st.st_size);
      return name;
    }
  }
  return nullptr;
}

// The found item of IsEAFileExist, if it has at least kMinUsableItemSize
// bytes; else null.
const char* UsableItem(const char* ea_dir, const char* name1,
                       const char* name2) {
  int64_t size = 0;
  const char* found = IsEAFileExist(ea_dir, &size, name1, name2);
  return found != nullptr && size >= kMinUsableItemSize ? found : nullptr;
}

}  // namespace

// ---------------------------------------------------------------------------
// The exported functions

extern "C" {

int OpenEADir(const char* file_path, int folder_fd, int create) {
  if (file_path == nullptr || folder_fd < -1) {
    errno = EINVAL;
    return -1;
  }
  char ea_dir[kPathBufferSize];
  if (!EADirOf(file_path, ea_dir, sizeof(ea_dir))) {
    errno = EINVAL;
    return -1;
  }
  if (!IsInsideFolder(ea_dir, FolderOf(file_path))) {
    quvaidx::LogDirect(LOG_ERR,
                       "%s:%d EA directory %s of %s is not inside the file's "
                       "folder",
                       kModule, __LINE__, ea_dir, file_path);
    errno = EINVAL;
    return -1;
  }
  Walk walk = WalkTail(ea_dir, 2, folder_fd, create != 0);
  if (walk.fd < 0) errno = walk.error;
  return walk.fd;
}

int MakeEADir(const char* file_path, char* buffer, int size) {
  if (file_path == nullptr || buffer == nullptr || size < 1) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Bad parameters.", kModule, __LINE__);
    return -1;
  }
  if (!EADirOf(file_path, buffer, size)) return -1;
  // The metadata directory is the parent of the EA directory (none when
  // the host answers a single name).
  Walk walk = WalkTail(buffer, 2, -1, true);
  if (walk.fd < 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Cannot mkdir %s, error:%d", kModule,
                       __LINE__, walk.failed.c_str(), walk.error);
    return -1;
  }
  close(walk.fd);
  return 0;
}

int GetEADirPath(const char* file_path, char* buffer, int size) {
  if (file_path == nullptr || buffer == nullptr || size < 1) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Bad parameters.", kModule, __LINE__);
    return -1;
  }
  memset(buffer, 0, static_cast<size_t>(size));
  if (QUVAEADirPath(0, file_path, buffer, size) != 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Get ea dir path error. file path: %s",
                       kModule, __LINE__, file_path);
    return -1;
  }
  buffer[size - 1] = '\0';
  Walk walk = WalkTail(buffer, 2, -1, false);
  // The host makes what is missing; a link or special file in the way is
  // never handed to it, and what it made is checked the same way.
  if (walk.fd < 0 && !walk.refused && QUVAEAMKDir(1, buffer) == 0) {
    walk = WalkTail(buffer, 2, -1, false);
  }
  if (walk.fd < 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Make ea dir path error. eaDir path: %s",
                       kModule, __LINE__, buffer);
    return -1;
  }
  close(walk.fd);
  return 0;
}

int RemoveEAFile(const char* ea_dir, const char* name1, const char* name2) {
  if (ea_dir == nullptr) return 0;
  ScopedFd dir(WalkTail(ea_dir, 2, -1, false).fd);
  if (dir.get() < 0) return 0;
  int removed = 0;
  for (const char* name : {name1, name2}) {
    struct stat st;
    if (LookAtItem(dir.get(), ea_dir, name, &st) != Item::kAbsent &&
        !S_ISLNK(st.st_mode) && unlinkat(dir.get(), name, 0) == 0) {
      ++removed;
    }
  }
  return removed;
}

int RemoveEAFile2(const char* file_path, const char* name1, const char* name2) {
  char dir[kPathBufferSize];
  if (!EADirOf(file_path, dir, sizeof(dir))) return -1;
  return RemoveEAFile(dir, name1, name2);
}

const char* IsEAFileExist(const char* ea_dir, int64_t* size, const char* name1,
                          const char* name2) {
  if (ea_dir == nullptr) return nullptr;
  ScopedFd dir(WalkTail(ea_dir, 2, -1, false).fd);
  if (dir.get() < 0) return nullptr;
  return FindItem(dir.get(), ea_dir, size, name1, name2);
}

int GetEAFilePath(const char* file_path, const char* name1, const char* name2,
                  char* out, int out_size) {
  if (out == nullptr || out_size < 1) return -1;
  char dir[kPathBufferSize];
  if (!EADirOf(file_path, dir, sizeof(dir))) return -1;
  const char* found = UsableItem(dir, name1, name2);
  if (found == nullptr) return -1;
  snprintf(out, static_cast<size_t>(out_size), "%s/%s", dir, found);
  return 0;
}

int IsEAFileExist2(const char* file_path, const char* name1,
                   const char* name2) {
  char dir[kPathBufferSize];
  if (!EADirOf(file_path, dir, sizeof(dir))) return -1;
  return UsableItem(dir, name1, name2) != nullptr ? 1 : 0;
}

}  // extern "C"
