#include "quvaidx/share_folder.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <time.h>

#include "file/file_common.h"
#include "quvahost/quvahost.h"
#include "util/log_internal.h"

using quvaidx::file::Printable;

namespace {

constexpr char kModule[] = "quvaidx_folder";

// Brings the indexed mark of share `name` to `indexed`.
int SetIndexedMark(const char* name, bool indexed) {
  ShareRecord* record = nullptr;
  if (QUVAShareGet(name, &record) != 0) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d QUVAShareGet failed: %s", kModule,
                       __LINE__, Printable(name));
    QUVAShareFree(record);  // a host may hand one out even on failure
    return -1;
  }
  const bool marked = (record->uStatus & QUVA_SHARE_STATUS_INDEXED) != 0;
  if (marked != indexed) {
    if (indexed) {
      record->uStatus |= QUVA_SHARE_STATUS_INDEXED;
    } else {
      record->uStatus &= ~QUVA_SHARE_STATUS_INDEXED;
    }
    if (QUVAShareUpdate(record) < 0) {
      // Reported, not returned: the share exists, and the next scan asks
      // again.
      quvaidx::LogDirect(LOG_ERR, "%s:%d QUVAShareUpdate failed[%X]", kModule,
                         __LINE__, static_cast<unsigned>(QLIBCErrGet()));
    }
  }
  QUVAShareFree(record);
  return 0;
}

// ASCII case-insensitive equality; `lower` is lowercase.
bool EqualsFolded(const char* text, const char* lower) {
  for (;; ++text, ++lower) {
    unsigned char c = static_cast<unsigned char>(*text);
    if (c >= 'A' && c <= 'Z') c = static_cast<unsigned char>(c + ('a' - 'A'));
    if (c != static_cast<unsigned char>(*lower)) return false;
    if (c == '\0') return true;
  }
}

// ctime(3) text of `t` into out[size]; empty when it cannot be represented.
// ctime_r, not strftime: the text must not follow the caller's locale.
void CTimeText(int64_t t, char* out, size_t size) {
  const time_t when = static_cast<time_t>(t);
  char text[64];  // ctime_r needs 26; glibc refuses what would not fit
  if (ctime_r(&when, text) == nullptr) text[0] = '\0';
  snprintf(out, size, "%s", text);
}

}  // namespace

extern "C" {

int ShareIndexStatusSet(const char* name) { return SetIndexedMark(name, true); }

int ShareIndexStatusClear(const char* name) {
  return SetIndexedMark(name, false);
}

int IsDefaultShare(const char* name) {
  if (name == nullptr) return 0;
  return EqualsFolded(name, "photo") || EqualsFolded(name, "music") ||
                 EqualsFolded(name, "video")
             ? 1
             : 0;
}

int QUVAIndexSharePathGet(const char* path, char* out, int out_size) {
  // Only a share-relative path has a share name to look up.
  if (path == nullptr || path[0] != '/' || out == nullptr || out_size < 1) {
    return -1;
  }
  char* copy = strdup(path);
  if (copy == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Out of memory", kModule, __LINE__);
    return -1;
  }
  char* name = copy + 1;
  char* rest = strchr(name, '/');
  if (rest != nullptr) *rest = '\0';
  ShareRecord* record = nullptr;
  if (QUVAShareGet(name, &record) != 0) {
    QUVAShareFree(record);
    free(copy);
    return -1;
  }
  // The rest from the path's second '/', in the original text.
  const char* tail = rest != nullptr ? path + (rest - copy) : "";
  snprintf(out, static_cast<size_t>(out_size), "%s%s", record->szPath, tail);
  const size_t length = strlen(out);
  if (length > 0 && out[length - 1] == '/') out[length - 1] = '\0';
  QUVAShareFree(record);
  free(copy);
  return 0;
}

int GetDirInfo(const char* path, DirInfo* info) {
  if (path == nullptr || info == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s:%d Bad parameter.", kModule, __LINE__);
    return -1;
  }
  snprintf(info->szPath, sizeof(info->szPath), "%s", path);
  QLIBCFileStatRecord stat_record;
  memset(&stat_record, 0, sizeof(stat_record));
  if (QLIBCFileStat(path, QLIBC_STAT_TIMES, &stat_record) != 0 ||
      !S_ISDIR(stat_record.uMode)) {
    return -1;
  }
  CTimeText(stat_record.llCTime, info->szCTime, sizeof(info->szCTime));
  CTimeText(stat_record.llMTime, info->szMTime, sizeof(info->szMTime));
  const char* slash = strrchr(path, '/');
  if (slash == nullptr) {
    quvaidx::LogDirect(LOG_ERR, "%s (%d) Failed to get dir path of %s", kModule,
                       __LINE__, path);
    return -1;
  }
  snprintf(info->szName, sizeof(info->szName), "%s", slash + 1);
  ShareRecord* record = nullptr;
  if (QUVAShareGetByAttrStr(path, QUVA_SHARE_ATTR_PATH, &record) == 0) {
    QLIBCFileGetSectionValue(QUVAIDX_SHARE_RIGHT_MAP, record->szName, "guid",
                             info->szGuid, sizeof(info->szGuid));
  }
  QUVAShareFree(record);
  return 0;
}

}  // extern "C"
