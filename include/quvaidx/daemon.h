// The event server: the socket side of an index daemon.
//
// A daemon creates a libevent event base, calls BuildServer with the path of
// its Unix-domain socket and an EventArgs record naming its request handler,
// and runs the base's loop itself. The server accepts connections, gathers
// each packet (layout in quvaidx/ipc.h) in the connection's input buffer,
// parses it, calls the handler with the request and an empty reply object,
// and queues the reply on the same connection. StopServer takes the socket
// down again.
//
// Results: 0 on success, -1 on failure, unless a function says otherwise.
//
// Threads: single-threaded. Every function and callback here runs on the
// thread that runs the daemon's event loop; g_listener and g_conn_count are
// plain variables without locking. A slow handler holds up every connection
// of the daemon.
//
// Robustness: a handler that throws is logged and its connection closed; a
// header announcing more than kMaxRecvBody bytes closes the connection
// without calling the handler; a reply too large for a packet is replaced by
// {"success":false,"reason":"reply too large"}; every complete request in a
// connection's input buffer is answered, in order, in the same callback; a
// connection stops being read while more than kMaxPendingOutput bytes of its
// replies wait to be sent; running out of descriptors pauses accepting for
// kAcceptPauseMs instead of ending the loop.
//
// Log lines carry the module name "quvaidx_daemon" and go through
// AppLogError.
#ifndef QUVAIDX_DAEMON_H_
#define QUVAIDX_DAEMON_H_

#include <stddef.h>
#include <stdint.h>
#include <sys/socket.h>

#include <json/json.h>

#include "quvaidx/export.h"

struct event_base;
struct evconnlistener;
struct bufferevent;

// Unsent reply bytes of one connection above which the server stops reading
// its requests until the output drains.
constexpr size_t kMaxPendingOutput = 1024 * 1024;
// How long accepting pauses after the process or system ran out of
// descriptors.
constexpr int kAcceptPauseMs = 100;

struct EventArgs;

// A daemon's request handler. It fills `reply` (see MakeResponse) and
// returns 0 to have the reply sent; any other result ends the connection
// without a reply and without reading further requests (replies already
// queued for earlier requests of the same connection are still delivered
// before it closes).
typedef int (*EventHandler)(Json::Value& request, Json::Value& reply,
                            EventArgs* args);

// How a daemon plugs into the event server. The daemon owns the record and
// keeps it alive from BuildServer until StopServer has returned and its last
// connection is gone; the server hands the same pointer to every callback.
struct EventArgs {
  const char* name;      // the daemon's label, shown in connection log lines
  void* context;         // the daemon's own; never read or written here
  EventHandler handler;  // called once for every request received
};

// The listener of the running server; null while none runs.
QUVAIDX_API extern struct evconnlistener* g_listener;
// Number of connections open at the moment.
QUVAIDX_API extern int32_t g_conn_count;

// Removes whatever file is at `path` (a socket left from an earlier run) and
// listens there, on `base`, with a backlog of 16. The socket file gets the
// process's file-creation mask. When SIGPIPE still has its default action
// (ending the process), it is set to be ignored: a client that goes away
// while its reply is being written must not end the daemon.
// Returns 0 with g_listener set. Returns -1 when the old file cannot be
// removed, when the listener cannot be created (g_listener stays null), or
// when the path is longer than kMaxSocketPath bytes (no file is removed or
// created). Each failure is logged at level 3.
QUVAIDX_API int BuildServer(struct event_base* base, const char* path,
                            EventArgs* args);

// When a server runs: frees its listener (closing the listening socket),
// sets g_listener to null and removes the file at `path`. Otherwise does
// nothing. Open connections are left alone. Always returns 0.
QUVAIDX_API int StopServer(const char* path);

// Returns g_conn_count.
QUVAIDX_API int GetCurrentConnCount();

// Returns {"success": success}, plus "reason" when `reason` is not null.
QUVAIDX_API Json::Value MakeResponse(bool success, const char* reason);

// Returns 1 when the input buffer of `bev` holds a whole packet, 0 when not
// yet (logged at level 3 when fewer than 4 bytes are there, at level 6 when
// the body is incomplete). Nothing is removed from the buffer.
QUVAIDX_API int CheckBufferevent(struct bufferevent* bev);

// Takes one packet out of the input buffer of `bev` and parses its body into
// `value`, as RecvPacket does.
// REQUIRES: CheckBufferevent(bev) returned 1.
// Returns 0, or -1 (logged at level 3) when fewer bytes came out than the
// header announced or the header announces more than kMaxRecvBody bytes.
QUVAIDX_API int RecvPacketEv(struct bufferevent* bev, Json::Value& value);

// Queues `value` as one packet on the output buffer of `bev`.
// Returns 0, or -1 (logged at level 3) when the text is longer than
// kMaxSendBody bytes or the bytes cannot be queued; nothing is queued then.
QUVAIDX_API int SendPacketEv(struct bufferevent* bev, Json::Value& value);

// libevent callbacks registered by BuildServer and OnAccept. Exported so
// that a daemon can reuse them on connections of its own.
QUVAIDX_API void OnAccept(struct evconnlistener* listener, int fd,
                          struct sockaddr* address, int address_length,
                          void* args);
QUVAIDX_API void OnAcceptError(struct evconnlistener* listener, void* args);
QUVAIDX_API void onRead(struct bufferevent* bev, void* args);
QUVAIDX_API void onWrite(struct bufferevent* bev, void* args);
QUVAIDX_API void onEvent(struct bufferevent* bev, short events, void* args);

#endif  // QUVAIDX_DAEMON_H_
