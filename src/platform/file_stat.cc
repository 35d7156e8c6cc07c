// The extended status record: statx(2) for the birth time, stat(2) where
// statx is not available.
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"

namespace quvahost {
namespace {

static_assert(sizeof(QLIBCFileStatRecord) == 128,
              "the status record is 128 bytes");

// Fills `out` from stat(2): no birth time, so the status-change time
// stands in for it. Returns 0 or an errno value.
int StatFallback(const char* path, QLIBCFileStatRecord* out) {
  struct stat st;
  if (RetryOnEintr([&] { return stat(path, &st); }) != 0) return errno;
  out->uMode = st.st_mode;
  out->llSize = st.st_size;
  out->llMTime = st.st_mtime;
  out->llChangeTime = st.st_ctime;
  out->llCTime = st.st_ctime;
  out->llATime = st.st_atime;
  out->uUid = st.st_uid;
  out->uGid = st.st_gid;
  out->ullInode = st.st_ino;
  out->ullDevice = st.st_dev;
  return 0;
}

}  // namespace

int FileStatImpl(const char* path, int option, QLIBCFileStatRecord* record) {
  if (path == nullptr || record == nullptr || option != QLIBC_STAT_TIMES) {
    return HOST_FAIL(EINVAL);
  }
  QLIBCFileStatRecord out;
  memset(&out, 0, sizeof out);
  struct statx stx;
  int rc = RetryOnEintr([&] {
    return statx(AT_FDCWD, path, AT_STATX_SYNC_AS_STAT,
                 STATX_BASIC_STATS | STATX_BTIME, &stx);
  });
  if (rc != 0 && errno != ENOSYS && errno != EPERM) return HOST_FAIL(errno);
  if (rc != 0) {
    // Kernel or sandbox without statx.
    int error = StatFallback(path, &out);
    if (error != 0) return HOST_FAIL(error);
  } else {
    out.uMode = stx.stx_mode;
    out.llSize = static_cast<int64_t>(stx.stx_size);
    out.llMTime = stx.stx_mtime.tv_sec;
    out.llChangeTime = stx.stx_ctime.tv_sec;
    out.llATime = stx.stx_atime.tv_sec;
    out.uUid = stx.stx_uid;
    out.uGid = stx.stx_gid;
    out.ullInode = stx.stx_ino;
    out.ullDevice = makedev(stx.stx_dev_major, stx.stx_dev_minor);
    if ((stx.stx_mask & STATX_BTIME) != 0) {
      out.llCTime = stx.stx_btime.tv_sec;
      out.uFlags |= QLIBC_STAT_FLAG_BIRTH_TIME;
    } else {
      out.llCTime = stx.stx_ctime.tv_sec;  // filesystem without birth time
    }
  }
  *record = out;
  return 0;
}

}  // namespace quvahost
