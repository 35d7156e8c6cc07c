#include "quvaidx/path_rules.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>

#include "file/file_common.h"
#include "quvahost/quvahost.h"
#include "util/log_internal.h"

using quvaidx::file::Printable;

namespace {

constexpr char kModule[] = "quvaidx_file";

// A user-space filesystem: its data may come from anywhere, so it is
// treated like a network filesystem by every mount test.
constexpr int kUserSpaceFsType = 12;

constexpr char kRecycleBin[] = "#recycle";  // 8 characters
constexpr size_t kRecycleBinLength = sizeof(kRecycleBin) - 1;

// Writes `t` as time text (local time) into buf[size] when there is room
// for anything. Returns the length of the whole text.
int FormatTimeText(time_t t, char* buf, int size) {
  struct tm local;
  char text[64];
  int n;
  if (localtime_r(&t, &local) == nullptr) {
    n = snprintf(text, sizeof(text), "0000-00-00 00:00:00");
  } else {
    n = snprintf(text, sizeof(text), "%04i-%02i-%02i %02i:%02i:%02i",
                 local.tm_year + 1900, local.tm_mon + 1, local.tm_mday,
                 local.tm_hour, local.tm_min, local.tm_sec);
  }
  if (buf != nullptr && size > 0) snprintf(buf, size, "%s", text);
  return n;
}

}  // namespace

extern "C" {

int EntryNameShouldIndex(const char* name) {
  if (name == nullptr) return 0;
  if (strcmp(name, ".") == 0 || strcmp(name, "..") == 0) return 0;
  if (name[0] == '.' && name[1] == '_') return 0;
  if (strcmp(name, "#recycle") == 0 || strcmp(name, "#snapshot") == 0) {
    return 0;
  }
  if (QUVAEAIsHiddenDir(name)) return 0;
  const char* dot = strrchr(name, '.');
  if (dot != nullptr && strcmp(dot, ".app") == 0) return 0;
  return 1;
}

int QUVAPathUnderRecyle(const char* path) {
  if (path == nullptr) return 0;
  // The third '/': for /vol/share/rest the one after the share name.
  const char* t = path;
  for (int seen = 0; seen < 3; ++seen) {
    t = strchr(seen == 0 ? t : t + 1, '/');
    if (t == nullptr) return 0;
  }
  if (strncmp(t + 1, kRecycleBin, kRecycleBinLength) != 0) return 0;
  const char after = t[1 + kRecycleBinLength];
  return after == '\0' || after == '/' ? 1 : 0;
}

int IndexIsPathRemoteMount(const char* path) {
  const int type = QUVAGetFSType(path, 0);
  if (type == -1) {
    const int err = errno;
    quvaidx::LogDirect(LOG_DEBUG, "%s:%d failed to statfs %s, reason=[(%d)%s]",
                       kModule, __LINE__, Printable(path), err, strerror(err));
    return 0;
  }
  if (QUVAFSIsRemoteFS(type)) return 1;
  return type == kUserSpaceFsType ? 1 : 0;
}

int IndexIsPathRemoteOrImageMount(const char* path) {
  const int type = QUVAGetFSType(path, 0);
  if (type == -1) {
    const int err = errno;
    quvaidx::LogDirect(LOG_DEBUG, "%s:%d failed to statfs %s, reason=[(%d)%s]",
                       kModule, __LINE__, Printable(path), err, strerror(err));
    return 0;
  }
  if (QUVAFSIsRemoteFS(type) || QUVAFSIsImageFS(type)) return 1;
  return type == kUserSpaceFsType ? 1 : 0;
}

int IndexIsPathSupportEAWrite(const char* path) {
  const int type = QUVAGetFSType(path, 0);
  if (type == -1) {
    const int err = errno;
    quvaidx::LogDirect(LOG_DEBUG, "%s:%d failed to statfs, reason=[(%d)%s]: %s",
                       kModule, __LINE__, err, strerror(err), Printable(path));
    return 1;
  }
  if (QUVAFSIsRemoteFS(type) || QUVAFSIsImageFS(type)) return 0;
  return type == kUserSpaceFsType ? 0 : 1;
}

int QUVAIndexCTimeMTimeGet(const char* path, char* ctime_buf, int ctime_size,
                           char* mtime_buf, int mtime_size) {
  QLIBCFileStatRecord record;
  memset(&record, 0, sizeof(record));
  const int rc = QLIBCFileStat(path, QLIBC_STAT_TIMES, &record);
  if (rc < 0) return rc;
  FormatTimeText(static_cast<time_t>(record.llCTime), ctime_buf, ctime_size);
  return FormatTimeText(static_cast<time_t>(record.llMTime), mtime_buf,
                        mtime_size);
}

time_t QUVAIndexModifyTimeGet(const char* path) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0) return 0;
  return st.st_mtime;
}

int IsDirExist(const char* path) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0) return 0;
  return S_ISDIR(st.st_mode) ? 1 : 0;
}

int IsFileExist(const char* path, int64_t* size) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0 || !S_ISREG(st.st_mode)) {
    return 0;
  }
  if (size != nullptr) *size = static_cast<int64_t>(st.st_size);
  return 1;
}

}  // extern "C"
