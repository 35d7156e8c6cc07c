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
// of the daemon; a handler whose answer takes long takes the reply away
// (DeferReply), has the work done elsewhere, and sends the reply later from
// the loop (SendDeferredReply), while the server answers other connections.
//
// Robustness:
// - a handler that throws is logged and its connection closed;
// - a header announcing more than kMaxRecvBody bytes closes the connection
//   without calling the handler;
// - a body the JSON reader rejects reaches the handler as an empty object,
//   never as a half-read value;
// - a reply too large for a packet is replaced by
//   {"success":false,"reason":"reply too large"};
// - every complete request in a connection's input buffer is answered, in
//   order, in the same callback, unless a handler defers a reply: then the
//   connection's later requests wait (64 KiB of them at most are read) until
//   that reply has been sent, and other connections are served meanwhile;
// - a peer that shuts down its sending side still gets every reply queued
//   for it before the server closes the connection;
// - a connection stops being read while more than kMaxPendingOutput bytes of
//   its replies wait to be sent, and the unsent replies of all connections
//   together are bounded (ServerLimits);
// - a peer that stalls in the middle of a request, or waits too long between
//   requests, is closed (ServerLimits);
// - running out of descriptors first closes the connections that have
//   waited longest, and only when none has waited kAcceptPauseMs pauses
//   accepting for that long, instead of ending the loop;
// - BuildServer never removes anything at its socket path but a stale
//   socket: it takes no socket away from a daemon that still answers on it;
// - a daemon started by a service manager may instead serve the listening
//   socket the manager bound for it (BuildServerOnSocket), which then stays
//   the manager's: StopServer leaves its file in place.
//
// Log lines carry the module name "quvaidx_daemon" and go through
// AppLogError.
#ifndef QUVAIDX_DAEMON_H_
#define QUVAIDX_DAEMON_H_

#include <stddef.h>
#include <stdint.h>
#include <sys/socket.h>
#include <sys/types.h>

#include <vector>

#include <json/json.h>

#include "quvaidx/export.h"

struct event_base;
struct evconnlistener;
struct bufferevent;

// Unsent reply bytes of one connection above which the server stops reading
// its requests until the output drains.
constexpr size_t kMaxPendingOutput = 1024 * 1024;
// How long accepting pauses after the process or system ran out of
// descriptors, when no connection has waited that long (see OnAcceptError).
constexpr int kAcceptPauseMs = 100;
// Defaults of ServerLimits.
constexpr int kPacketDeadlineMs = 10 * 1000;
constexpr int kIdleDeadlineMs = 5 * 60 * 1000;
constexpr size_t kMaxTotalPendingOutput = 64 * 1024 * 1024;

// The limits the server holds its peers to. A field of 0 or less turns that
// limit off.
struct ServerLimits {
  // A request must have arrived whole this many milliseconds after its
  // first byte, however steadily its bytes trickle in.
  int packet_deadline_ms;
  // A connection may wait this many milliseconds for its next request, and
  // a connection whose replies wait to be sent (or that is finishing) may go
  // this long without the peer taking any of them.
  int idle_deadline_ms;
  // Unsent reply bytes of all connections together. When a reply takes the
  // sum past it, the connection holding the most unsent bytes is closed
  // (logged at level 3), until the sum is back within the bound.
  size_t max_total_pending_output;
};

struct EventArgs;
// A request whose reply a handler took away to send later (DeferReply).
struct DeferredReply;

// A daemon's request handler. It fills `reply` (see MakeResponse) and
// returns 0 to have the reply sent; any other result ends the connection
// without a reply and without reading further requests (replies already
// queued for earlier requests of the same connection are still delivered
// before it closes). GetPeerCredentials and GetPeerGroups tell it who is
// asking; DeferReply lets it answer later.
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

// How BuildServerWithAccess sets up the socket file.
struct ServerSocketAccess {
  mode_t mode;  // permission bits of the socket file (e.g. 0660)
  gid_t group;  // its group, or (gid_t)-1 to keep the one it is created with
};

// The process at the other end of a connection, as the kernel recorded it
// when the process connected.
struct PeerCredentials {
  pid_t pid;
  uid_t uid;
  gid_t gid;
};

// The listener of the running server; null while none runs.
QUVAIDX_API extern struct evconnlistener* g_listener;
// Number of connections open at the moment.
QUVAIDX_API extern int32_t g_conn_count;

// Listens on `path`, on `base`, with a backlog of 16, as
// BuildServerWithAccess(base, path, args, nullptr) does: the socket file
// gets the process's file-creation mask.
QUVAIDX_API int BuildServer(struct event_base* base, const char* path,
                            EventArgs* args);

// Makes way for the socket at `path` and listens there, on `base`, with a
// backlog of 16.
// - Nothing at `path`: the socket is created there.
// - A stale socket (one that refuses connections, left by a daemon that
//   died): removed and replaced.
// - A socket on which a daemon still takes connections: left alone; -1, and
//   a level-3 line saying it is in use.
// - A regular file, directory, link or anything else, or a path that cannot
//   be examined or probed: left alone; -1, and a level-3 line naming the
//   path, what was found and "left alone" ("<path> is not a socket; left
//   alone").
// - A stale socket that cannot be removed: -1 and the level-3 line
//   "remove <path> (<system error>)".
// With `access` null the socket file gets the process's file-creation mask.
// Otherwise it is created for the owner alone (0600 at most, where the
// system allows setting a socket's mode before binding it), then given
// access->group (unless (gid_t)-1) and finally access->mode, so at no moment
// can a process outside the owner and the intended group connect. Failing to
// set either removes the socket again and gives -1 (logged at level 3).
// When SIGPIPE still has its default action (ending the process), it is set
// to be ignored: a client that goes away while its reply is being written
// must not end the daemon.
// Returns 0 with g_listener set. Returns -1, with g_listener unchanged, on
// the refusals above, when a server already runs, when the listener cannot
// be created ("Could not create a listener: <path> (<system error>)"), or
// when the path is longer than kMaxSocketPath bytes (nothing is examined or
// created then). Each failure is logged at level 3, and errno says why, for
// a daemon to tell whoever started it: EADDRINUSE (a daemon answers at the
// path), EEXIST (something other than a socket is there, or it changed
// while examined), ENAMETOOLONG, EBUSY (a server already runs), or the
// system's error (EACCES, ENOENT, ...) of examining, removing, binding or
// listening.
QUVAIDX_API int BuildServerWithAccess(struct event_base* base, const char* path,
                                      EventArgs* args,
                                      const ServerSocketAccess* access);

// Serves connections on `fd`, a socket that a service manager (systemd's
// socket activation, say) has bound and set listening for this daemon, so
// that nobody else could take its path while the daemon was not running.
// `fd` must be a listening Unix-domain stream socket bound to `path`, when
// `path` is not null; it is made non-blocking and close-on-exec, and keeps
// the backlog, mode and owner its manager gave it. On success the server
// owns the descriptor and closes it when it stops, while the socket file
// stays the manager's: StopServer does not remove it. Otherwise as
// BuildServerWithAccess after the socket is made.
// Returns 0 with g_listener set. Returns -1, with `fd` still the caller's
// and g_listener unchanged, when a server already runs (EBUSY), or when
// `fd` is not a socket (ENOTSOCK), is another kind of socket or does not
// listen (EINVAL), or is bound to another path (EADDRNOTAVAIL); each
// logged at level 3 ("the socket handed over (fd N) ...; not used").
QUVAIDX_API int BuildServerOnSocket(struct event_base* base, int fd,
                                    const char* path, EventArgs* args);

// Sets the limits of the running server and of later ones; null restores
// the defaults (kPacketDeadlineMs, kIdleDeadlineMs, kMaxTotalPendingOutput).
// Deadlines are checked about every quarter of the shorter one (at least
// once a second while connections are open), and connections closed for
// them are counted in one level-6 line per check. Connections that a daemon
// serves with these callbacks on a listener of its own are not held to
// them.
QUVAIDX_API void SetServerLimits(const ServerLimits* limits);

// During a handler call: stores in *peer the credentials of the process on
// the other end of the connection whose request is being handled, and
// returns 0. Returns -1, leaving *peer unchanged, outside a handler call (or
// when peer is null or the system does not tell).
QUVAIDX_API int GetPeerCredentials(PeerCredentials* peer);

// During a handler call: stores in *groups the supplementary groups of the
// process on the other end of the connection whose request is being
// handled, as the kernel holds them (which may differ from what the group
// database lists for its user): those the process had when it connected
// (SO_PEERGROUPS), or, where the system does not record them, those its
// /proc/PID/status lists, used only while that process still runs with the
// effective user and group it connected with. The primary group is the gid
// of GetPeerCredentials and may or may not be among them.
// Returns 0. Returns -1, leaving *groups unchanged, outside a handler call,
// when groups is null, or when the groups cannot be told (logged at level 3
// when the process's status text refused them); a caller that decides
// access by them then refuses.
QUVAIDX_API int GetPeerGroups(std::vector<gid_t>* groups);

// During a handler call: takes the reply of the request being handled away
// from the server, so that the daemon can send it later with
// SendDeferredReply, for example when another thread has done the work.
// The handler then returns 0 (its `reply` is not sent). Until the deferred
// reply is sent, the connection's later requests wait unanswered (at most
// 64 KiB of them are read meanwhile), so the replies of one connection keep
// the order of its requests; other connections are answered as usual. The
// server's bounds hold throughout: a connection may wait for its deferred
// reply as long as the idle deadline (ServerLimits) allows, and a peer that
// ends its stream meanwhile still gets the reply and the answers to the
// requests it sent before, as for any reply.
// Returns the request's handle, owned by the daemon until it passes it to
// SendDeferredReply. Returns null (logged at level 3) outside a handler
// call, for a second deferral in the same call, for a connection the server
// did not accept itself (one a daemon serves with these callbacks on a
// listener of its own), or when memory runs out; the handler then answers
// as usual.
QUVAIDX_API DeferredReply* DeferReply();

// Sends `reply` as the answer to the deferred request `deferred` and frees
// the handle; then answers the connection's waiting requests. With `reply`
// null, ends the connection without an answer instead, as a handler's
// non-zero result does. When the connection closed meanwhile (its peer went,
// a deadline or a bound of the server ended it), only frees the handle.
// A reply too large for a packet is replaced as a handler's is.
// REQUIRES: on the loop's thread, outside handler calls (from an event
// callback of the daemon's own), with a handle from DeferReply not yet
// passed here.
// Returns 0 when the reply was queued (or, with `reply` null, the connection
// ended); -1 when the connection had closed, when the reply could not be
// queued, when the server's bound on unsent replies closed the connection
// at once, or, with the handle untouched, when called inside a handler call
// or with a null handle.
QUVAIDX_API int SendDeferredReply(DeferredReply* deferred,
                                  const Json::Value* reply);

// When a server runs: frees its listener (closing the listening socket),
// sets g_listener to null and removes the file at `path`, unless the socket
// was handed over (BuildServerOnSocket). Otherwise does nothing. Open
// connections are left alone. Always returns 0.
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
// `value`. Unlike RecvPacket, `value` is replaced only when the JSON reader
// accepts the body (trailing bytes after a complete value are accepted); an
// empty or rejected body leaves it as it was, never half-read.
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
// onEvent: the end of the peer's stream (BEV_EVENT_EOF) stops reading and
// closes the connection once the replies already queued are written; any
// other event closes it at once.
// OnAcceptError: on running out of descriptors, closes up to 16 connections
// that have waited longest for their peer, if they waited kAcceptPauseMs or
// more, and accepts again at once; else pauses accepting for kAcceptPauseMs.
// Any other error ends the loop.
QUVAIDX_API void OnAccept(struct evconnlistener* listener, int fd,
                          struct sockaddr* address, int address_length,
                          void* args);
QUVAIDX_API void OnAcceptError(struct evconnlistener* listener, void* args);
QUVAIDX_API void onRead(struct bufferevent* bev, void* args);
QUVAIDX_API void onWrite(struct bufferevent* bev, void* args);
QUVAIDX_API void onEvent(struct bufferevent* bev, short events, void* args);

#endif  // QUVAIDX_DAEMON_H_
