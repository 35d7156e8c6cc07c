// The well-known paths of the index service: where each daemon keeps its
// pid file, executable and Unix-domain socket, and where the spool queues of
// the preview daemons and those daemons' pid files lie.
//
// This header is the one place these paths are written. DaemonInfo
// (quvaidx/daemon_info.h), the typed requests (quvaidx/index_requests.h),
// the spool queues (quvaidx/system.h) and the quvaidx tool all read them
// from here.
//
// Header only: every name below is a macro or a constant of internal
// linkage, so including it adds no symbol to any library or program. The
// macros are plain string literals, usable from C and in literal
// concatenation; the tables below them are C++ only.
#ifndef QUVAIDX_PATHS_H_
#define QUVAIDX_PATHS_H_

// --- the index daemons, by short name --------------------------------------

#define QUVAIDX_CONTROLD_PID_FILE "/var/run/quvaindexd.pid"
#define QUVAIDX_CONTROLD_EXECUTABLE "/usr/quva/sbin/quvaindexd"
#define QUVAIDX_CONTROLD_SOCKET "/tmp/quvaindexd_sock"

#define QUVAIDX_SCAND_PID_FILE "/var/run/quvaindexscand.pid"
#define QUVAIDX_SCAND_EXECUTABLE "/usr/quva/sbin/quvaindexscand"
#define QUVAIDX_SCAND_SOCKET "/tmp/quvaindexscand_sock"

#define QUVAIDX_WORKERD_PID_FILE "/var/run/quvaindexworkerd.pid"
#define QUVAIDX_WORKERD_EXECUTABLE "/usr/quva/sbin/quvaindexworkerd"
#define QUVAIDX_WORKERD_SOCKET "/tmp/quvaindexworkerd_sock"

#define QUVAIDX_PLUGIND_PID_FILE "/var/run/quvaindexplugind.pid"
#define QUVAIDX_PLUGIND_EXECUTABLE "/usr/quva/sbin/quvaindexplugind"
#define QUVAIDX_PLUGIND_SOCKET "/tmp/quvaindexplugind_sock"

#define QUVAIDX_MEDIAD_PID_FILE "/var/run/quvamediaparserd.pid"
#define QUVAIDX_MEDIAD_EXECUTABLE "/usr/quva/sbin/quvamediaparserd"
#define QUVAIDX_MEDIAD_SOCKET "/tmp/quvamediaparserd_sock"

// --- the spool queues and the daemons that serve them ----------------------

// Folders of photos waiting for thumbnails, served by quvamkthumbd.
#define QUVAIDX_THUMB_QUEUE "/var/spool/thumb_create.queue"
#define QUVAIDX_THUMB_DAEMON "quvamkthumbd"
#define QUVAIDX_THUMB_PID_FILE "/var/run/quvamkthumbd.pid"

// Videos (and folders) waiting for web video, served by quvamkflvd.
#define QUVAIDX_FLV_QUEUE "/var/spool/flv_create.queue"
#define QUVAIDX_FLV_DAEMON "quvamkflvd"
#define QUVAIDX_FLV_PID_FILE "/var/run/quvamkflvd.pid"

#ifdef __cplusplus

namespace quvaidx {

// One index daemon.
struct IndexDaemonPaths {
  const char* name;        // short name, as DaemonInfo takes it
  const char* pid_file;    // its pid file
  const char* executable;  // its program
  const char* socket;      // the Unix-domain socket it serves
};

// Every index daemon, in the order the tools list them.
constexpr IndexDaemonPaths kIndexDaemons[] = {
    {"controld", QUVAIDX_CONTROLD_PID_FILE, QUVAIDX_CONTROLD_EXECUTABLE,
     QUVAIDX_CONTROLD_SOCKET},
    {"scand", QUVAIDX_SCAND_PID_FILE, QUVAIDX_SCAND_EXECUTABLE,
     QUVAIDX_SCAND_SOCKET},
    {"workerd", QUVAIDX_WORKERD_PID_FILE, QUVAIDX_WORKERD_EXECUTABLE,
     QUVAIDX_WORKERD_SOCKET},
    {"plugind", QUVAIDX_PLUGIND_PID_FILE, QUVAIDX_PLUGIND_EXECUTABLE,
     QUVAIDX_PLUGIND_SOCKET},
    {"mediad", QUVAIDX_MEDIAD_PID_FILE, QUVAIDX_MEDIAD_EXECUTABLE,
     QUVAIDX_MEDIAD_SOCKET},
};

// One spool queue and the daemon that serves it.
struct SpoolQueuePaths {
  const char* queue;     // the queue file
  const char* daemon;    // the serving daemon's program name
  const char* pid_file;  // its pid file
};

constexpr SpoolQueuePaths kThumbSpoolQueue = {
    QUVAIDX_THUMB_QUEUE, QUVAIDX_THUMB_DAEMON, QUVAIDX_THUMB_PID_FILE};
constexpr SpoolQueuePaths kFlvSpoolQueue = {
    QUVAIDX_FLV_QUEUE, QUVAIDX_FLV_DAEMON, QUVAIDX_FLV_PID_FILE};

}  // namespace quvaidx

#endif  // __cplusplus

#endif  // QUVAIDX_PATHS_H_
