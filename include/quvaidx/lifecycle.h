// The life of a daemon around its event loop: refusing a second instance,
// detaching, the pid file, marker files.
//
// Order of use: WaitSystemReady (quvaidx/system.h); BecomeDaemon, or
// BecomeProcess to stay in the foreground, before any socket or event base
// is made (BecomeDaemon forks); the event base, BuildServer and the loop;
// StopServer; DeletePidFile.
//
// A pid file holds the process id in decimal, with no line end. Whether the
// process a pid file names is alive is the host's decision
// (QLIBCProcAliveByPidFile): it must exist and must not have started after
// the pid file was written, so a pid recycled by an unrelated process does
// not lock a crashed daemon out.
//
// Failures are logged at level 3 (module "quvaidx_daemon"). Nothing here
// keeps state or takes a lock; the alive check and the pid-file write are
// two steps, so two instances started at the same moment can both pass.
#ifndef QUVAIDX_LIFECYCLE_H_
#define QUVAIDX_LIFECYCLE_H_

#include "quvaidx/export.h"

// Refuses to start when the process named in `pid_file` is alive (prints
// "Daemon alive. No need to start" on standard output and returns -1,
// leaving the file alone). Otherwise detaches with daemon(0, 0) (background,
// new session, working directory /, standard streams on /dev/null) and
// writes the detached process's id into `pid_file` (a relative path is
// taken from the working directory before detaching).
// Returns 0 in the detached process; -1 when detaching failed, or when the
// pid file could not be created or written (the process then stays
// detached).
QUVAIDX_API int BecomeDaemon(const char* pid_file);

// As BecomeDaemon without detaching: the pid file gets the id of the
// calling process, which keeps its streams and working directory.
QUVAIDX_API int BecomeProcess(const char* pid_file);

// Removes `path`. Always returns 0.
QUVAIDX_API int DeletePidFile(const char* path);

// Creates the marker file `path`, or empties it. Returns 0, or -1 when it
// cannot be opened (not logged).
QUVAIDX_API int CheckIn(const char* path);

// Removes the marker file `path`. Returns 0, or -1 when there was no file
// or it could not be removed.
QUVAIDX_API int CheckOut(const char* path);

// Returns the seconds since the status of `path` last changed (now less
// st_ctime), or 0 when its status cannot be read.
QUVAIDX_API int GetExecutionTime(const char* path);

#endif  // QUVAIDX_LIFECYCLE_H_
