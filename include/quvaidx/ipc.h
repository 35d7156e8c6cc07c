// Packet transport: framing on a connected Unix-domain stream socket and the
// client side of a connection to an index daemon.
//
// Packet layout. One packet is a 4-byte header followed by a body:
//   offset 0, 2 bytes: magic 5566 (0x15BE), most significant byte first;
//   offset 2, 2 bytes: body length in bytes, most significant byte first;
//   offset 4: the compact JSON text of one value, as Json::FastWriter writes
//             it (ending in a line feed, which is counted), no zero byte.
// The receiver never checks the magic. A body is at most kMaxSendBody bytes
// when sent and at most kMaxRecvBody bytes when received.
//
// Results. 0 (or a byte count) on success; -1 on failure; -2 when the peer
// closed the connection under a send (broken pipe) or reset it under a read.
// Only -2 makes the path-based exchanges reconnect and repeat the request.
//
// Blocking. Every call blocks its thread until the transfer completes or
// fails; reads and writes get no time-outs. A connection attempt waits at
// most kConnectTimeoutMs for a daemon that does not take it; waits between
// connection attempts are one second each.
//
// Threads. No shared state: any number of threads may use these functions at
// once, each on its own descriptor.
//
// Log lines carry the module name "quvaidx_ipc_core" and go through
// AppLogError.
#ifndef QUVAIDX_IPC_H_
#define QUVAIDX_IPC_H_

#include <stddef.h>

#include <json/json.h>

#include "quvaidx/export.h"

// Size of the buffer in which a packet is assembled or received.
constexpr size_t kPacketBufferSize = 16384;
// Size of the packet header.
constexpr size_t kPacketHeaderSize = 4;
// The magic number written at the start of every packet.
constexpr unsigned kPacketMagic = 5566;
// Largest body that is sent: the buffer less the header.
constexpr size_t kMaxSendBody = kPacketBufferSize - kPacketHeaderSize;
// Largest body that is received: the buffer less its terminating zero.
constexpr size_t kMaxRecvBody = kPacketBufferSize - 1;
// Longest socket path, in bytes, that fits a Unix-domain address with its
// terminating zero. Longer paths are refused, never cut.
constexpr size_t kMaxSocketPath = 107;
// How long one connection attempt waits, at most, for a daemon that does not
// take the connection (its listen backlog is full) before it counts as
// failed.
constexpr int kConnectTimeoutMs = 3000;
// How many times a path-based exchange reconnects and repeats its request
// after the daemon closed or reset the connection, before it gives up.
constexpr int kMaxExchangeRestarts = 3;

// ---------------------------------------------------------------------------
// Framing primitives

// Writes exactly n bytes from buf to the socket fd (send with MSG_NOSIGNAL,
// so a closed peer never raises SIGPIPE). Interrupted and would-block sends
// are repeated.
// Returns n when everything was written; 0 at once, without a system call,
// when n is 0; the count written so far when a send transfers nothing; -2 on
// a broken pipe (not logged); -1 on any other error (logged at level 3).
QUVAIDX_API int Writen(int fd, const void* buf, size_t n);

// Reads exactly n bytes from fd into buf.
// REQUIRES: buf has room for n bytes.
// Returns n when all arrived; 0 at once when n is 0; the count read so far
// when the stream ended first; -2 when the peer reset the connection (not
// logged); -1 on any other error (logged at level 3).
QUVAIDX_API int Readn(int fd, void* buf, size_t n);

// Sends `value` as one packet, header and body in a single write. The value
// is not changed.
// Returns 0 when the whole packet was written, -2 on a broken pipe, and -1
// otherwise: an error, a short write, or a value whose text is longer than
// kMaxSendBody bytes (logged at level 3, nothing written).
QUVAIDX_API int SendPacket(int fd, Json::Value& value);

// Receives one packet and parses its body into `value`. The body is read up
// to its first zero byte; a body that is not valid JSON (including one
// nested too deeply) still yields 0 and leaves `value` as the parser left
// it (possibly half-read), so callers receive into a fresh null value and
// judge it by its keys. (The event server is stricter with requests: see
// RecvPacketEv in quvaidx/daemon.h.)
// Returns 0 when header and body were read in full; -2 when a read was
// reset; -1 otherwise: an error, an end of stream before the packet was
// complete, or a header announcing more than kMaxRecvBody bytes (logged at
// level 3; the body is not read, so the connection is out of step and should
// be closed).
QUVAIDX_API int RecvPacket(int fd, Json::Value& value);

// ---------------------------------------------------------------------------
// Client connections

// Connects to the daemon listening on `path`, making up to `attempts`
// attempts one second apart (a wait follows every failed attempt, the last
// included). An attempt that the daemon does not take within
// kConnectTimeoutMs (its backlog stays full) fails like a refused one. With
// `handshake`, each connected socket must also answer a
// {"command":"HANDSHAKE"} request with one packet, whatever it holds.
// Returns the connected descriptor, which belongs to the caller, or -1 when
// every attempt failed, when attempts <= 0, or at once when the path is
// longer than kMaxSocketPath bytes (logged at level 3; nothing connected).
QUVAIDX_API int ConnectPeer(const char* path, bool handshake, int attempts);

// Sends {"command":"HANDSHAKE"} on fd and waits for one reply packet. The
// reply's content is not examined.
// Returns 0 when a reply arrived, -1 otherwise.
QUVAIDX_API int Handshake(int fd);

// Closes fd when it is 0 or greater. Always returns 0.
QUVAIDX_API int DisconnectPeer(int fd);

// An addition for programs that talk to a daemon on a well-known path.
// Connects to the daemon listening on `path` and checks who answers: the
// process at the other end (SO_PEERCRED) must be root or run as this
// process's effective user, since anyone else may have bound the path while
// the daemon was down. Makes one attempt, waiting at most `timeout_ms`
// (at least 1) for a daemon whose backlog is full; no handshake.
// Returns the connected descriptor, which belongs to the caller; -1 with
// errno ENAMETOOLONG (path longer than kMaxSocketPath bytes), ENOENT (no
// such socket), EACCES (permission denied), ENOTSOCK (something other than
// a socket is there), ECONNREFUSED (nobody listens), ETIMEDOUT (the backlog
// stayed full), EPERM (another user answers; logged at level 3), or the
// system's errno of a failed socket(2).
QUVAIDX_API int ConnectDaemon(const char* path, int timeout_ms);

// Connects with a handshake (see ConnectPeer), sends `value` and expects no
// reply. When the daemon closes the connection under the send, reconnects
// and sends again, at most kMaxExchangeRestarts times.
// On success `value` becomes null and the result is 0. On failure `value` is
// emptied (an array or object loses its members, any other value becomes
// null) and the result is -1.
QUVAIDX_API int AutoSendPacket(const char* path, Json::Value& value,
                               int attempts);

// Connects without a handshake, sends `value` as the request and receives one
// reply into it; the connection is closed on every path. When the daemon
// closes or resets the connection, the exchange starts again, at most
// kMaxExchangeRestarts times (so a request may reach the daemon more than
// once).
// On success `value` holds the reply and the result is 0. On failure `value`
// is emptied as by AutoSendPacket and the result is -1.
QUVAIDX_API int AutoSendRecvPacketBySocketPath(const char* path,
                                               Json::Value& value,
                                               int attempts);

// Sends `value` on the caller's connected descriptor and receives one reply
// into it. The descriptor stays open and the caller's; `unused` is ignored.
// Returns 0 with the reply in `value`; otherwise empties `value` and returns
// the failing result, -1 or -2. It neither reconnects nor retries.
QUVAIDX_API int AutoSendRecvPacketByFd(int fd, Json::Value& value, int unused);

// With fd == -1, AutoSendRecvPacketBySocketPath(path, value, attempts);
// otherwise AutoSendRecvPacketByFd(fd, value, attempts), without looking at
// the path.
QUVAIDX_API int AutoSendRecvPacket(const char* path, int fd, Json::Value& value,
                                   int attempts);

#endif  // QUVAIDX_IPC_H_
