// Client side of a connection to an index daemon: connect with attempts,
// handshake, one-call exchanges.
#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include "ipc/client_internal.h"
#include "ipc/connect_timeout.h"
#include "ipc/packet_codec.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "util/hooks.h"

namespace {

constexpr char kModule[] = "quvaidx_ipc_core";

int g_connect_timeout_ms = kConnectTimeoutMs;

// Closes a descriptor this module opened.
void CloseSocket(int fd) {
  close(fd);  // nothing useful to do if this fails
}

// Connects fd, waiting at most g_connect_timeout_ms for a daemon whose
// backlog is full. A Unix-domain connect never completes asynchronously: a
// non-blocking one fails at once with EAGAIN on a full backlog, and there is
// nothing to poll for. So the wait is bounded by the socket's send time-out,
// which the kernel applies to connect and which wakes the caller as soon as
// the daemon accepts; it is cleared again afterwards, because exchanges have
// no time limit. Returns false when the connection was not made.
bool ConnectWithinLimit(int fd, const struct sockaddr_un& address,
                        int limit_ms = g_connect_timeout_ms) {
  struct timeval limit = {limit_ms / 1000, (limit_ms % 1000) * 1000};
  if (setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof(limit)) != 0) {
    return false;  // an unbounded wait is what this must prevent
  }
  bool connected =
      connect(fd, reinterpret_cast<const struct sockaddr*>(&address),
              sizeof(address)) == 0;
  const int err = errno;
  struct timeval none = {0, 0};
  if (connected &&
      setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &none, sizeof(none)) != 0) {
    return false;  // sends would time out: not the connection promised
  }
  errno = err;
  return connected;
}

// True when the process at the other end of `fd` is root or runs as this
// process's effective user. Anyone else may have bound the daemon's path
// while the daemon was down: it would receive the requests and forge the
// replies. Logs a refusal at level 3.
bool PeerIsTrusted(int fd, const char* path) {
  struct ucred peer;
  socklen_t length = sizeof(peer);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) {
    AppLogError(3, "%s:%d [Error] cannot tell who serves %s: %s", kModule,
                __LINE__, path, strerror(errno));
    return false;
  }
  if (peer.uid == 0 || peer.uid == geteuid()) return true;
  AppLogError(3,
              "%s:%d [Error] refused %s: served by uid %u (pid %d), neither "
              "root nor uid %u",
              kModule, __LINE__, path, static_cast<unsigned>(peer.uid),
              static_cast<int>(peer.pid), static_cast<unsigned>(geteuid()));
  return false;
}

}  // namespace

namespace quvaidx {

int SetConnectTimeoutMs(int ms) {
  int previous = g_connect_timeout_ms;
  g_connect_timeout_ms = ms > 0 ? ms : kConnectTimeoutMs;
  return previous;
}

}  // namespace quvaidx

int ConnectPeer(const char* path, bool handshake, int attempts) {
  struct sockaddr_un address;
  if (!quvaidx::BuildUnixAddress(path, &address)) {
    AppLogError(3, "%s:%d [Error] socket path too long: %s", kModule, __LINE__,
                path != nullptr ? path : "(null)");
    return -1;
  }

  for (int i = 0; i < attempts; ++i) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
      int err = errno;
      AppLogError(3, "%s:%d [Error] create socket: %s, %s", kModule, __LINE__,
                  path, strerror(err));
      quvaidx::SleepSeconds(1);
      continue;
    }
    if (!ConnectWithinLimit(fd, address)) {
      AppLogError(7, "%s:%d [Error] connect server: %d, %s", kModule, __LINE__,
                  i, path);
      CloseSocket(fd);
      quvaidx::SleepSeconds(1);
      continue;
    }
    if (!handshake || Handshake(fd) != -1) return fd;
    AppLogError(7, "%s:%d [Error] app level handshake: %d, %s", kModule,
                __LINE__, i, path);
    CloseSocket(fd);
    quvaidx::SleepSeconds(1);
  }
  AppLogError(3, "%s:%d [Error] connect server: %s", kModule, __LINE__, path);
  return -1;
}

int Handshake(int fd) {
  Json::Value value(Json::objectValue);
  value["command"] = "HANDSHAKE";
  if (SendPacket(fd, value) != 0) return -1;
  if (RecvPacket(fd, value) != 0) return -1;
  return 0;
}

int DisconnectPeer(int fd) {
  if (fd >= 0) CloseSocket(fd);
  return 0;
}

int ConnectDaemon(const char* path, int timeout_ms) {
  struct sockaddr_un address;
  if (!quvaidx::BuildUnixAddress(path, &address)) {
    errno = ENAMETOOLONG;
    return -1;
  }
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (!ConnectWithinLimit(fd, address, timeout_ms > 0 ? timeout_ms : 1)) {
    int err = errno;
    CloseSocket(fd);
    struct stat st;
    if (err == EAGAIN || err == EINPROGRESS) {
      err = ETIMEDOUT;  // the backlog stayed full
    } else if (err == ECONNREFUSED && stat(path, &st) == 0 &&
               !S_ISSOCK(st.st_mode)) {
      err = ENOTSOCK;
    }
    errno = err;
    return -1;
  }
  if (!PeerIsTrusted(fd, path)) {
    CloseSocket(fd);
    errno = EPERM;
    return -1;
  }
  return fd;
}

namespace {

// One connection, one request, optionally one reply; restarted when the
// daemon closed or reset the connection. The reply, when one is wanted,
// replaces `value`; without a reply `value` becomes null.
int ExchangeByPath(const char* path, Json::Value& value, int attempts,
                   bool want_reply, bool check_peer = false) {
  for (int restarts = 0;; ++restarts) {
    int fd = ConnectPeer(path, /*handshake=*/!want_reply, attempts);
    if (fd < 0) break;
    if (check_peer && !PeerIsTrusted(fd, path)) {
      CloseSocket(fd);  // nothing was sent to the stranger
      break;
    }
    Json::Value reply;
    int result = SendPacket(fd, value);
    if (result == 0 && want_reply) result = RecvPacket(fd, reply);
    CloseSocket(fd);
    if (result == 0) {
      value.swap(reply);
      return 0;
    }
    if (result != -2) break;
    if (restarts == kMaxExchangeRestarts) {
      AppLogError(3, "%s:%d [Error] connection to %s lost %d times, giving up",
                  kModule, __LINE__, path, restarts + 1);
      break;
    }
  }
  quvaidx::EmptyValue(value);
  return -1;
}

}  // namespace

namespace quvaidx {

int ExchangeWithDaemon(const char* path, Json::Value& value, int attempts) {
  return ExchangeByPath(path, value, attempts, /*want_reply=*/true,
                        /*check_peer=*/true);
}

}  // namespace quvaidx

int AutoSendPacket(const char* path, Json::Value& value, int attempts) {
  return ExchangeByPath(path, value, attempts, /*want_reply=*/false);
}

int AutoSendRecvPacketBySocketPath(const char* path, Json::Value& value,
                                   int attempts) {
  return ExchangeByPath(path, value, attempts, /*want_reply=*/true);
}

int AutoSendRecvPacketByFd(int fd, Json::Value& value, int /*unused*/) {
  Json::Value reply;
  int result = SendPacket(fd, value);
  if (result == 0) result = RecvPacket(fd, reply);
  if (result == 0) {
    value.swap(reply);
    return 0;
  }
  quvaidx::EmptyValue(value);
  return result;
}

int AutoSendRecvPacket(const char* path, int fd, Json::Value& value,
                       int attempts) {
  if (fd == -1) return AutoSendRecvPacketBySocketPath(path, value, attempts);
  return AutoSendRecvPacketByFd(fd, value, attempts);
}
