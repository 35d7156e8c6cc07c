// System helpers of a daemon: waiting for the appliance to finish booting,
// starting other programs.
//
// Module "quvaidx_system". Neither function keeps state.
#ifndef QUVAIDX_SYSTEM_H_
#define QUVAIDX_SYSTEM_H_

#include "quvaidx/export.h"

// Returns once the host reports boot step 4, asking every 10 seconds. After
// 900 seconds of waiting it writes "[NOTICE] system is not ready? start
// anyway." to the system log (whatever g_log_level) and returns all the
// same; the caller is not told which ended the wait. The host is asked at
// most 91 times.
QUVAIDX_API void WaitSystemReady();

// Starts `path` with the argument vector `argv` (null-terminated, as execv
// takes it) in a child whose standard streams are on /dev/null. The child
// inherits every descriptor not marked close-on-exec, and aborts when the
// program cannot be executed. SIGCHLD's SA_NOCLDWAIT flag is cleared around
// the fork and set again afterwards if it was set, so this must not run
// while other code changes SIGCHLD's disposition.
// Returns the child's id (also when the program then fails to start), or -1
// when no child could be made. The child is not waited for.
QUVAIDX_API int ForkExecv(const char* path, char* const argv[]);

#endif  // QUVAIDX_SYSTEM_H_
