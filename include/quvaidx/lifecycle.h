// The life of a daemon around its event loop: refusing a second instance,
// detaching, the pid file, marker files.
//
// Order of use: WaitSystemReady (quvaidx/system.h); BecomeDaemon, or
// BecomeProcess to stay in the foreground, before any socket or event base
// is made (BecomeDaemon forks); the event base, BuildServer and the loop;
// StopServer; DeletePidFile.
//
// A pid file holds the process id in decimal, with no line end, and has
// mode 0644 whatever the file-creation mask. Whether the process a pid file
// names is alive is the host's decision (QLIBCProcAliveByPidFile): it must
// exist and must not have started after the pid file was written, so a pid
// recycled by an unrelated process does not lock a crashed daemon out.
//
// Single instance: besides that check, the daemon holds an exclusive flock
// on its open pid file for the rest of its life (the descriptor stays open,
// close-on-exec). A second instance that cannot take the lock is refused
// exactly as one that finds a live pid, so of any number started at the same
// moment exactly one runs. Only a regular file of one name is used as a pid
// file: a symbolic link, FIFO, device, directory or hard-linked file at the
// path is refused (logged) and left alone, and the open never waits.
//
// Failures are logged at level 3 (module "quvaidx_daemon"). Call these
// functions from one thread.
#ifndef QUVAIDX_LIFECYCLE_H_
#define QUVAIDX_LIFECYCLE_H_

#include "quvaidx/export.h"

// Refuses to start when the process named in `pid_file` is alive or another
// instance holds the file's lock (prints "Daemon alive. No need to start" on
// standard output and returns -1, leaving the file alone, without
// detaching). Otherwise opens and locks the pid file (a relative path is
// taken from the current working directory), detaches with daemon(0, 0)
// (background, new session, working directory /, standard streams on
// /dev/null), and writes the detached process's id into it; the detached
// process inherits the lock.
// Returns 0 in the detached process; -1 when the pid file is refused or
// cannot be created, locked or written, or when detaching failed (logged).
QUVAIDX_API int BecomeDaemon(const char* pid_file);

// As BecomeDaemon without detaching: the pid file gets the id of the
// calling process, which keeps its streams and working directory.
QUVAIDX_API int BecomeProcess(const char* pid_file);

// Removes the pid file `path`, unless it names another process that is
// alive (then it is left in place and a level-3 line says so): a stale file,
// or this process's own, goes. When this process holds the file's lock, the
// lock is released after the removal. Always returns 0.
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
