// The exchange of the typed index requests. Not exported.
#ifndef QUVAIDX_IPC_CLIENT_INTERNAL_H_
#define QUVAIDX_IPC_CLIENT_INTERNAL_H_

#include <json/json.h>

namespace quvaidx {

// AutoSendRecvPacketBySocketPath(path, value, attempts), but the process
// that answers must be root or run as this process's effective user: a
// connection to anyone else is closed before anything is sent, logged at
// level 3, and the exchange fails at once (-1, `value` emptied), without
// further attempts, since the daemon cannot start while its path is taken.
int ExchangeWithDaemon(const char* path, Json::Value& value, int attempts);

}  // namespace quvaidx

#endif  // QUVAIDX_IPC_CLIENT_INTERNAL_H_
