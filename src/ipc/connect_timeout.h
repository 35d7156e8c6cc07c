// How long one connection attempt of ConnectPeer may wait for a daemon that
// does not take the connection (its listen backlog is full). The limit is
// kConnectTimeoutMs in production; tests shorten it so that a full backlog
// costs them milliseconds. Not exported.
#ifndef QUVAIDX_IPC_CONNECT_TIMEOUT_H_
#define QUVAIDX_IPC_CONNECT_TIMEOUT_H_

namespace quvaidx {

// Installs a limit of `ms` milliseconds per attempt (0 or less restores
// kConnectTimeoutMs) and returns the previous one.
int SetConnectTimeoutMs(int ms);

}  // namespace quvaidx

#endif  // QUVAIDX_IPC_CONNECT_TIMEOUT_H_
