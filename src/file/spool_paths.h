// Where WriteThumbQueue finds the preview queues and the pid files of their
// daemons: the well-known paths of quvaidx/paths.h in production. Tests
// point them at a private directory so that they never touch the real
// /var/spool and /var/run. Not exported.
#ifndef QUVAIDX_FILE_SPOOL_PATHS_H_
#define QUVAIDX_FILE_SPOOL_PATHS_H_

namespace quvaidx {

struct SpoolPaths {
  const char* thumb_queue;     // entries for the thumbnail daemon
  const char* flv_queue;       // entries for the web-video daemon
  const char* thumb_pid_file;  // the thumbnail daemon's pid file
  const char* flv_pid_file;    // the web-video daemon's pid file
};

// Installs `paths` (whose texts must outlive their use) and returns the
// previous ones. A null member restores its well-known path (the seam
// convention of util/hooks.h). Not synchronised: call it while no
// WriteThumbQueue runs.
SpoolPaths SetSpoolPaths(const SpoolPaths& paths);

}  // namespace quvaidx

#endif  // QUVAIDX_FILE_SPOOL_PATHS_H_
