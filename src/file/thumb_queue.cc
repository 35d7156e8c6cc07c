// Queueing preview work for the thumbnail and web-video daemons.
#include <libgen.h>
#include <limits.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>

#include "file/spool_paths.h"
#include "quvahost/quvahost.h"
#include "quvaidx/log.h"
#include "quvaidx/media_type.h"
#include "quvaidx/paths.h"
#include "quvaidx/system.h"

namespace {

constexpr char kModule[] = "quvaidx_system";

// One kind of preview work: where it is queued, who serves it, and which
// files it wants.
struct PreviewQueue {
  const char* queue;
  const char* pid_file;
  const char* daemon_name;
  const char* queue_name;
  int (*wants_file)(const char* path);
  bool queues_parent;  // a wanted file queues its folder, not itself
};

using quvaidx::kFlvSpoolQueue;
using quvaidx::kThumbSpoolQueue;

constexpr quvaidx::SpoolPaths kWellKnownSpoolPaths = {
    kThumbSpoolQueue.queue, kFlvSpoolQueue.queue, kThumbSpoolQueue.pid_file,
    kFlvSpoolQueue.pid_file};

quvaidx::SpoolPaths g_spool_paths = kWellKnownSpoolPaths;

const char* OrDefault(const char* path, const char* well_known) {
  return path != nullptr ? path : well_known;
}

}  // namespace

namespace quvaidx {

SpoolPaths SetSpoolPaths(const SpoolPaths& paths) {
  SpoolPaths previous = g_spool_paths;
  const SpoolPaths& known = kWellKnownSpoolPaths;
  g_spool_paths = {OrDefault(paths.thumb_queue, known.thumb_queue),
                   OrDefault(paths.flv_queue, known.flv_queue),
                   OrDefault(paths.thumb_pid_file, known.thumb_pid_file),
                   OrDefault(paths.flv_pid_file, known.flv_pid_file)};
  return previous;
}

}  // namespace quvaidx

int WriteThumbQueue(const char* path, _tag_THUMB_TYPE_ type) {
  struct stat st;
  if (path == nullptr || stat(path, &st) != 0 ||
      !(S_ISDIR(st.st_mode) || S_ISREG(st.st_mode))) {
    return -1;
  }
  const quvaidx::SpoolPaths& paths = g_spool_paths;
  PreviewQueue work;
  if (type == THUMB_TYPE_PHOTO) {
    work = {paths.thumb_queue,           paths.thumb_pid_file,
            kThumbSpoolQueue.daemon,     "thumb",
            BlQUVAIndexIsPhotoOnWebFile, true};
  } else if (type == THUMB_TYPE_VIDEO) {
    work = {paths.flv_queue, paths.flv_pid_file,          kFlvSpoolQueue.daemon,
            "flv",           BlQUVAIndexIsVideoOnWebFile, false};
  } else {
    return 0;
  }

  // A pid file naming a dead or recycled pid counts as no daemon: SIGUSR1
  // would end whatever unrelated process holds that pid now.
  int pid = QLIBCReadPidFile(work.pid_file);
  if (pid <= 0 || QLIBCProcAliveByPidFile(work.pid_file) == 0) {
    AppLogError(3, "%s:%d [Error] %s is dead", kModule, __LINE__,
                work.daemon_name);
    return -1;
  }

  const char* entry = nullptr;
  char parent[PATH_MAX];
  if (S_ISDIR(st.st_mode)) {
    entry = path;
  } else if (work.wants_file(path)) {
    if (work.queues_parent) {
      size_t length = strlen(path);
      if (length >= sizeof(parent)) return -1;
      memcpy(parent, path, length + 1);
      entry = dirname(parent);
    } else {
      entry = path;
    }
  }
  if (entry != nullptr && WriteIndexQueue(entry, work.queue) != 0) {
    AppLogError(3, "%s:%d [Error] fail to write %s queue", kModule, __LINE__,
                work.queue_name);
    return -1;
  }
  kill(pid, SIGUSR1);  // the daemon looks at its queue; outcome ignored
  return 0;
}
