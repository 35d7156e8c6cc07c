// The socket file of the event server: making way for it without taking
// anything from anyone, and creating it with the access a daemon asks for.
// Internal to the event server.
#ifndef QUVAIDX_DAEMON_SERVER_SOCKET_H_
#define QUVAIDX_DAEMON_SERVER_SOCKET_H_

#include <sys/un.h>

#include "quvaidx/daemon.h"

namespace quvaidx {

// Removes a stale socket at `path` (whose address is `address`) and creates
// a socket bound there, with `access` applied when it is not null (see
// BuildServerWithAccess). Returns the bound, non-blocking, close-on-exec
// descriptor, not yet listening; or -1 with a level-3 line, leaving `path`
// as it was.
int BindServerSocket(const char* path, const struct sockaddr_un& address,
                     const ServerSocketAccess* access);

}  // namespace quvaidx

#endif  // QUVAIDX_DAEMON_SERVER_SOCKET_H_
