// Where the spool queues and the pid files of their daemons lie. Fixed
// constants in production; tests point them at a private directory so they
// never touch the real /var/spool and /var/run. Not exported.
#ifndef QUVAIDX_UTIL_SPOOL_PATHS_H_
#define QUVAIDX_UTIL_SPOOL_PATHS_H_

namespace quvaidx {

struct SpoolPaths {
  const char* thumb_queue;     // entries for the thumbnail daemon
  const char* flv_queue;       // entries for the web-video daemon
  const char* thumb_pid_file;  // the thumbnail daemon's pid file
  const char* flv_pid_file;    // the web-video daemon's pid file
};

// The paths in force.
const SpoolPaths& CurrentSpoolPaths();

// Replaces the paths (the strings must outlive their use) and returns the
// previous ones. For tests.
SpoolPaths SetSpoolPaths(const SpoolPaths& paths);

}  // namespace quvaidx

#endif  // QUVAIDX_UTIL_SPOOL_PATHS_H_
