// The socket file of the event server: making way for it without taking
// anything from anyone, creating it with the access a daemon asks for, and
// checking a listening socket handed over by a service manager. Internal to
// the event server.
#ifndef QUVAIDX_DAEMON_SERVER_SOCKET_H_
#define QUVAIDX_DAEMON_SERVER_SOCKET_H_

#include <sys/un.h>

#include "quvaidx/daemon.h"

namespace quvaidx {

// Removes a stale socket at `path` (whose address is `address`) and creates
// a socket bound there, with `access` applied when it is not null (see
// BuildServerWithAccess). Returns the bound, non-blocking, close-on-exec
// descriptor, not yet listening; or -1 with errno set and a level-3 line,
// leaving `path` as it was: EADDRINUSE when a daemon answers there, EEXIST
// when something other than a socket is there, else the system's error.
int BindServerSocket(const char* path, const struct sockaddr_un& address,
                     const ServerSocketAccess* access);

// Checks that `fd` is a listening Unix-domain stream socket, bound to `path`
// unless `path` is null, and makes it non-blocking and close-on-exec.
// Returns 0; or -1 with errno (ENOTSOCK, EINVAL for another kind of socket
// or one that does not listen, EADDRNOTAVAIL for another address) and a
// level-3 line, `fd` untouched.
int AdoptListeningSocket(int fd, const char* path);

}  // namespace quvaidx

#endif  // QUVAIDX_DAEMON_SERVER_SOCKET_H_
