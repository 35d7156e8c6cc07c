#include "quvaidx/ea_file.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <initializer_list>

#include "file/file_common.h"
#include "quvahost/quvahost.h"
#include "quvaidx/path_rules.h"
#include "util/log_internal.h"

using quvaidx::file::ComposePath;
using quvaidx::file::kPathBufferSize;
using quvaidx::file::Printable;

namespace {

constexpr char kModule[] = "quvaidx_eafile";

// Items smaller than this hold nothing usable for the callers that report
// presence.
constexpr int64_t kMinUsableItemSize = 2;

// Makes `path` a directory unless it is one already (a link to a directory
// counts). An entry in the way that is not a directory is unlinked first:
// unlink(2) removes a link itself, never its target, and refuses
// directories, so nothing but that entry can be lost. Returns 0 or an errno
// value.
int EnsureDirectory(const char* path) {
  struct stat st;
  if (stat(path, &st) == 0 && S_ISDIR(st.st_mode)) return 0;
  if (lstat(path, &st) == 0 && !S_ISDIR(st.st_mode)) {
    unlink(path);  // if this fails, mkdir below reports why
  }
  if (mkdir(path, 0777) == 0) return 0;
  const int err = errno;
  // Another process made it between our test and mkdir: it exists now.
  if (err == EEXIST && stat(path, &st) == 0 && S_ISDIR(st.st_mode)) return 0;
  return err;
}

// Asks the host for the EA directory of `file_path` into dir[size]; logs the
// host's last error on failure.
bool EADirOf(const char* file_path, char* dir, int size) {
  if (QUVAEADirPath(0, file_path, dir, size) == 0) return true;
  quvaidx::LogDirect(LOG_ERR, "%s:%d QUVAEADirPath error [0x%04X %s:%d] on %s",
                     kModule, __LINE__, QLIBCErrGet(), QLIBCErrorGetFile(),
                     QLIBCErrorGetLine(), Printable(file_path));
  return false;
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

extern "C" {

int MakeEADir(const char* file_path, char* buffer, int size) {
  if (file_path == nullptr || buffer == nullptr || size < 1) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Bad parameters.", kModule, __LINE__);
    return -1;
  }
  if (!EADirOf(file_path, buffer, size)) return -1;
  buffer[size - 1] = '\0';

  // The metadata directory: the EA directory path up to its last '/'.
  const char* slash = strrchr(buffer, '/');
  if (slash != nullptr) {
    char parent[kPathBufferSize];
    const int length = static_cast<int>(slash - buffer);
    int err;
    if (length >= kPathBufferSize) {
      err = ENAMETOOLONG;
    } else if (length == 0) {
      err = 0;  // the root directory
    } else {
      memcpy(parent, buffer, length);
      parent[length] = '\0';
      err = EnsureDirectory(parent);
    }
    if (err != 0) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d Cannot mkdir %.*s, error:%d", kModule,
                         __LINE__, length, buffer, err);
      return -1;
    }
  }
  const int err = EnsureDirectory(buffer);
  if (err != 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Cannot mkdir %s, error:%d", kModule,
                       __LINE__, buffer, err);
    return -1;
  }
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
  if (IsDirExist(buffer)) return 0;
  if (QUVAEAMKDir(1, buffer) != 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Make ea dir path error. eaDir path: %s",
                       kModule, __LINE__, buffer);
    return -1;
  }
  return 0;
}

int RemoveEAFile(const char* ea_dir, const char* name1, const char* name2) {
  if (ea_dir == nullptr) return 0;
  int removed = 0;
  for (const char* name : {name1, name2}) {
    char path[kPathBufferSize];
    if (name != nullptr && ComposePath(path, sizeof(path), ea_dir, "/", name) &&
        unlink(path) == 0) {
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
  for (const char* name : {name1, name2}) {
    char path[kPathBufferSize];
    if (name != nullptr && ComposePath(path, sizeof(path), ea_dir, "/", name) &&
        IsFileExist(path, size)) {
      return name;
    }
  }
  return nullptr;
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
