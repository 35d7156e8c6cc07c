// The event server's record of its connections: what each is waiting for
// and since when, and how many of its reply bytes are unsent. From it come
// the limits that protect a daemon from peers that stall or hoard memory
// (ServerLimits in quvaidx/daemon.h). Internal to the event server; every
// function runs on the loop's thread.
//
// Connections accepted by OnAccept are tracked; connections a daemon serves
// with the exported callbacks on a listener of its own are not, and every
// function here leaves them alone (CloseConnection still closes them).
#ifndef QUVAIDX_DAEMON_SERVER_CONNECTIONS_H_
#define QUVAIDX_DAEMON_SERVER_CONNECTIONS_H_

#include <stddef.h>

#include "quvaidx/daemon.h"

// A request whose reply the daemon sends later (DeferReply). The daemon
// holds it from DeferReply until SendDeferredReply frees it.
struct DeferredReply {
  struct bufferevent* bev;  // its connection; null once that has closed
  EventArgs* args;          // the connection's server record
};

namespace quvaidx {

// What a connection waits for, which decides the deadline that applies.
enum class Wait {
  kRequest,  // the next request; input empty (idle deadline)
  kPacket,   // the rest of a request that has begun (packet deadline)
  kDrain,    // the peer to take its replies; not read meanwhile (idle)
  kFlush,    // the peer to take its last replies before the close (idle)
  kReply,    // the daemon's deferred reply; further requests wait (idle)
};

// Starts tracking `bev`, just accepted, as waiting for a request. Returns
// false, tracking nothing, when memory runs out.
bool TrackConnection(struct bufferevent* bev, EventArgs* args);

// Ends a connection: stops tracking it, lowers g_conn_count and frees `bev`,
// which closes its socket and drops whatever it had not sent.
void CloseConnection(struct bufferevent* bev);

// Records that `bev` waits for `deferred`'s reply (Wait::kReply). Returns
// false, recording nothing, when `bev` is not tracked or already waits for
// one. When the connection closes, deferred->bev becomes null.
bool AttachDeferred(struct bufferevent* bev, DeferredReply* deferred);
// The reply `bev` waits for, or null.
DeferredReply* DeferredOf(struct bufferevent* bev);
// `bev` no longer waits for a deferred reply.
void DetachDeferred(struct bufferevent* bev);
// Records that the peer of `bev` sent the end of its stream while a deferred
// reply was due, and tells whether it did; untracked connections never did.
void NoteInputEnded(struct bufferevent* bev);
bool InputEnded(struct bufferevent* bev);

// Records that `bev` now waits for `wait`. Its clock restarts when `wait`
// differs from before or `progress` says a request was just answered; a
// connection still waiting for the rest of the same request keeps its clock,
// however many bytes trickle in.
void NoteWait(struct bufferevent* bev, Wait wait, bool progress);

// While the unsent reply bytes of all connections exceed the limit, closes
// the connection holding the most (logged at level 3). Returns true when
// `current` was one of them.
bool EnforceOutputLimit(struct bufferevent* current);

// Closes up to `count` connections that have waited `min_wait_ms` or longer,
// longest first. Returns how many it closed.
int CloseLongestWaiting(int count, int min_wait_ms);

// Checks the deadlines with a timer on `base` from now on; connections
// closed for them are logged with `args`' name. Returns false when the timer
// cannot be made.
bool StartDeadlines(struct event_base* base, EventArgs* args);
// Stops checking deadlines and frees the timer.
void StopDeadlines();

// Unsent reply bytes of all tracked connections.
size_t PendingOutputTotal();

}  // namespace quvaidx

#endif  // QUVAIDX_DAEMON_SERVER_CONNECTIONS_H_
