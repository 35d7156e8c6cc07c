// The event server: listener, per-connection packet assembly, handler calls
// and replies, all inside the daemon's libevent loop. The socket file is made
// in server_socket.cc; the record of connections and the limits drawn from
// it live in server_connections.cc.
//
// Map: ending connections; the packet at the head of a connection's input;
// handling one packet; serving a connection's input; exported operations
// (deferred replies among them); libevent callbacks.
#include "quvaidx/daemon.h"

#include <errno.h>
#include <signal.h>
#include <string.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <exception>
#include <new>

#include <event2/buffer.h>
#include <event2/bufferevent.h>
#include <event2/event.h>
#include <event2/listener.h>
#include <event2/util.h>

#include "daemon/peer_groups.h"
#include "daemon/server_connections.h"
#include "daemon/server_socket.h"
#include "ipc/packet_codec.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"

struct evconnlistener* g_listener = nullptr;
int32_t g_conn_count = 0;

namespace {

using quvaidx::CloseConnection;
using quvaidx::PacketPeek;
using quvaidx::PeekStatus;
using quvaidx::Wait;

constexpr char kModule[] = "quvaidx_daemon";
// Connections closed at most, longest waiting first, each time accepting
// runs out of descriptors: a listen backlog's worth.
constexpr int kClosedPerAcceptFailure = 16;
// Bytes of later requests read from a connection while its deferred reply
// is due; reading stops there until the reply has gone.
constexpr size_t kDeferredInputLimit = 64 * 1024;

// Re-enables the listener after accepting paused for lack of descriptors.
// Lives as long as the listener.
struct event* g_accept_resume = nullptr;
// The connection whose request the handler is answering, and its server
// record; null outside handler calls (GetPeerCredentials, DeferReply).
struct bufferevent* g_handler_connection = nullptr;
EventArgs* g_handler_args = nullptr;
// The reply the handler being called took away (DeferReply), if any.
DeferredReply* g_deferred_in_call = nullptr;
// Whether the running server made its socket file (BuildServerWithAccess)
// and so removes it when it stops.
bool g_owns_socket_file = false;

const char* DaemonName(void* args) {
  const EventArgs* event_args = static_cast<const EventArgs*>(args);
  return event_args != nullptr && event_args->name != nullptr ? event_args->name
                                                              : "";
}

void CloseWhenFlushed(struct bufferevent* bev, void*) { CloseConnection(bev); }

void CloseOnEvent(struct bufferevent* bev, short, void*) {
  CloseConnection(bev);
}

// Ends a connection without dropping the replies already queued on it for
// earlier requests of the same batch: stops reading at once and closes when
// the output has been written (or writing failed).
void FinishConnection(struct bufferevent* bev) {
  if (evbuffer_get_length(bufferevent_get_output(bev)) == 0) {
    CloseConnection(bev);
    return;
  }
  bufferevent_disable(bev, EV_READ);
  bufferevent_setcb(bev, nullptr, CloseWhenFlushed, CloseOnEvent, nullptr);
  bufferevent_enable(bev, EV_WRITE);
  quvaidx::NoteWait(bev, Wait::kFlush, /*progress=*/true);
}

bool IsOutOfDescriptors(int err) {
  return err == EMFILE || err == ENFILE || err == ENOBUFS || err == ENOMEM;
}

// libevent writes replies with writev(2), which raises SIGPIPE when a client
// has gone away; its default action would end the daemon. A disposition the
// daemon chose itself is left alone.
void IgnoreBrokenPipes() {
  struct sigaction current;
  if (sigaction(SIGPIPE, nullptr, &current) == 0 &&
      current.sa_handler == SIG_DFL && !(current.sa_flags & SA_SIGINFO)) {
    signal(SIGPIPE, SIG_IGN);
  }
}

void ResumeAccepting(evutil_socket_t, short, void* listener) {
  evconnlistener_enable(static_cast<struct evconnlistener*>(listener));
}

// Queues `value` as one packet. Returns 0, -1 when it cannot be queued, and
// sets *too_large (with nothing queued) when its text exceeds a packet.
int QueuePacket(struct bufferevent* bev, const Json::Value& value,
                bool* too_large) {
  char packet[kPacketBufferSize];
  size_t size = 0;
  quvaidx::EncodeStatus status =
      quvaidx::EncodePacketOrLog(value, packet, &size, kModule);
  *too_large = status == quvaidx::EncodeStatus::kTooLarge;
  if (status != quvaidx::EncodeStatus::kOk) return -1;
  if (bufferevent_write(bev, packet, size) != 0) {
    AppLogError(3, "%s:%d bufferevent_write", kModule, __LINE__);
    return -1;
  }
  return 0;
}

// Calls the daemon's handler; an exception counts as a request to close.
int CallHandler(EventArgs* args, Json::Value& request, Json::Value& reply) {
  if (args == nullptr || args->handler == nullptr) return -1;
  try {
    return args->handler(request, reply, args);
  } catch (const std::exception& e) {
    AppLogError(3, "%s:%d [Error] [%s] handler threw: %s", kModule, __LINE__,
                DaemonName(args), e.what());
  } catch (...) {
    AppLogError(3, "%s:%d [Error] [%s] handler threw", kModule, __LINE__,
                DaemonName(args));
  }
  return -1;
}

// Logs why the packet at the head of an input of `arrived` bytes cannot be
// taken yet. The one place of both lines, so that CheckBufferevent and the
// server's own path write them alike.
void LogIncomplete(size_t arrived, const PacketPeek& peek) {
  if (arrived < kPacketHeaderSize) {
    AppLogError(3, "%s:%d bufferevent at least %d bytes [%d bytes]", kModule,
                __LINE__, static_cast<int>(kPacketHeaderSize),
                static_cast<int>(arrived));
    return;
  }
  AppLogError(6,
              "%s:%d bufferevent hasn't arrived completely, and wait "
              "[arrived=%d, total=%d]",
              kModule, __LINE__, static_cast<int>(arrived),
              static_cast<int>(peek.total));
}

// Reads the header at the head of `input` without removing anything.
PacketPeek PeekInput(struct evbuffer* input, size_t* arrived) {
  *arrived = evbuffer_get_length(input);
  unsigned char head[kPacketHeaderSize] = {0, 0, 0, 0};
  if (*arrived > 0) {
    evbuffer_copyout(input, head, std::min(*arrived, sizeof(head)));
  }
  return quvaidx::PeekPacket(head, *arrived);
}

// Replaces `value` with the parsed body, unless the reader rejects it: a
// half-read request must not reach a handler.
void ParseRequest(const char* body, size_t length, Json::Value& value) {
  Json::Value parsed;
  if (quvaidx::ParsePacketBody(body, length, parsed)) value.swap(parsed);
}

enum class PacketOutcome { kAnswered, kDeferred, kWaiting, kClosed };

// Queues `reply` on `bev`, replaced when it is too large for a packet, so
// the client is never left waiting for ever. Returns 0 when a reply was
// queued.
int QueueReply(struct bufferevent* bev, const Json::Value& reply) {
  bool too_large = false;
  int result = QueuePacket(bev, reply, &too_large);
  if (result != 0 && too_large) {
    result =
        QueuePacket(bev, MakeResponse(false, "reply too large"), &too_large);
  }
  return result;
}

// Handles the packet at the head of the connection's input, if it is
// complete: parse, handler, reply. The header is read once.
PacketOutcome HandleOnePacket(struct bufferevent* bev, EventArgs* args) {
  struct evbuffer* input = bufferevent_get_input(bev);
  size_t arrived = 0;
  PacketPeek peek = PeekInput(input, &arrived);
  if (peek.status == PeekStatus::kTooLarge) {
    AppLogError(3, "%s:%d [Error] [%s] packet too large: %zu bytes, fd = %d",
                kModule, __LINE__, DaemonName(args), peek.body_length,
                static_cast<int>(bufferevent_getfd(bev)));
    FinishConnection(bev);
    return PacketOutcome::kClosed;
  }
  if (peek.status == PeekStatus::kNeedMore) {
    LogIncomplete(arrived, peek);
    return PacketOutcome::kWaiting;
  }

  char body[kPacketBufferSize];
  evbuffer_drain(input, kPacketHeaderSize);
  evbuffer_remove(input, body, peek.body_length);
  Json::Value request(Json::objectValue);
  Json::Value reply(Json::objectValue);
  ParseRequest(body, peek.body_length, request);
  g_handler_connection = bev;
  g_handler_args = args;
  int result = CallHandler(args, request, reply);
  DeferredReply* deferred = g_deferred_in_call;
  g_handler_connection = nullptr;
  g_handler_args = nullptr;
  g_deferred_in_call = nullptr;
  if (result != 0) {
    if (deferred != nullptr) {  // nothing more is sent on this connection
      quvaidx::DetachDeferred(bev);
      deferred->bev = nullptr;
    }
    FinishConnection(bev);
    return PacketOutcome::kClosed;
  }
  if (deferred != nullptr) return PacketOutcome::kDeferred;
  QueueReply(bev, reply);
  if (quvaidx::EnforceOutputLimit(bev)) return PacketOutcome::kClosed;
  return PacketOutcome::kAnswered;
}

// While `bev` waits for a deferred reply, its later requests are read up to
// kDeferredInputLimit bytes, then not at all until the reply has gone.
void WaitForDeferredReply(struct bufferevent* bev) {
  if (evbuffer_get_length(bufferevent_get_input(bev)) >= kDeferredInputLimit) {
    bufferevent_disable(bev, EV_READ);
  }
}

// Answers every complete request buffered on `bev`: libevent calls again
// only when more bytes arrive, which may be never. Stops at a deferred
// reply, and while too many replies wait to be sent; a connection whose
// peer has ended its stream is finished once nothing is left to answer.
void ServeInput(struct bufferevent* bev, EventArgs* args) {
  // Later requests wait for the deferred reply, so replies keep their order.
  if (quvaidx::DeferredOf(bev) != nullptr) {
    WaitForDeferredReply(bev);
    return;
  }
  struct evbuffer* input = bufferevent_get_input(bev);
  struct evbuffer* output = bufferevent_get_output(bev);
  bool answered = false;
  do {
    PacketOutcome outcome = HandleOnePacket(bev, args);
    if (outcome == PacketOutcome::kClosed) return;
    if (outcome == PacketOutcome::kDeferred) {
      WaitForDeferredReply(bev);
      quvaidx::NoteWait(bev, Wait::kReply, /*progress=*/true);
      return;
    }
    if (outcome == PacketOutcome::kWaiting) {
      if (quvaidx::InputEnded(bev)) {
        FinishConnection(bev);  // the rest of that request never comes
        return;
      }
      quvaidx::NoteWait(bev, Wait::kPacket, answered);
      return;
    }
    answered = true;
    if (evbuffer_get_length(output) > kMaxPendingOutput) {
      // The peer is not reading its replies; stop reading its requests until
      // onWrite sees the output drained.
      bufferevent_disable(bev, EV_READ);
      quvaidx::NoteWait(bev, Wait::kDrain, answered);
      return;
    }
  } while (evbuffer_get_length(input) > 0);
  if (quvaidx::InputEnded(bev)) {
    FinishConnection(bev);
    return;
  }
  quvaidx::NoteWait(bev, Wait::kRequest, answered);
}

}  // namespace

int BuildServer(struct event_base* base, const char* path, EventArgs* args) {
  return BuildServerWithAccess(base, path, args, nullptr);
}

int BuildServerWithAccess(struct event_base* base, const char* path,
                          EventArgs* args, const ServerSocketAccess* access) {
  struct sockaddr_un address;
  if (!quvaidx::BuildUnixAddress(path, &address)) {
    AppLogError(3, "%s:%d [Error] socket path too long: %s", kModule, __LINE__,
                path != nullptr ? path : "(null)");
    errno = ENAMETOOLONG;
    return -1;
  }
  if (g_listener != nullptr) {
    AppLogError(3, "%s:%d [Error] a server is already running, not at %s",
                kModule, __LINE__, path);
    errno = EBUSY;
    return -1;
  }
  int fd = quvaidx::BindServerSocket(path, address, access);
  if (fd < 0) return -1;

  // Children a daemon starts must not inherit its sockets.
  const unsigned flags =
      LEV_OPT_CLOSE_ON_FREE | LEV_OPT_REUSEABLE | LEV_OPT_CLOSE_ON_EXEC;
  g_listener = evconnlistener_new(base, OnAccept, args, flags, 16, fd);
  if (g_listener == nullptr || !quvaidx::StartDeadlines(base, args)) {
    int err = g_listener == nullptr ? errno : ENOMEM;
    AppLogError(3, "%s:%d [Error] Could not create a listener: %s (%s)",
                kModule, __LINE__, path, strerror(err));
    if (g_listener != nullptr) {
      evconnlistener_free(g_listener);  // closes fd
      g_listener = nullptr;
    } else {
      close(fd);
    }
    unlink(path);  // ours, made just now
    errno = err;
    return -1;
  }
  evconnlistener_set_error_cb(g_listener, OnAcceptError);
  IgnoreBrokenPipes();
  g_owns_socket_file = true;
  return 0;
}

int BuildServerOnSocket(struct event_base* base, int fd, const char* path,
                        EventArgs* args) {
  if (g_listener != nullptr) {
    AppLogError(3, "%s:%d [Error] a server is already running, not on fd %d",
                kModule, __LINE__, fd);
    errno = EBUSY;
    return -1;
  }
  if (quvaidx::AdoptListeningSocket(fd, path) != 0) return -1;
  // The deadlines first: once the listener exists it owns fd, which stays
  // the caller's on failure.
  int err = ENOMEM;
  if (quvaidx::StartDeadlines(base, args)) {
    // Backlog 0: the socket listens already, with its owner's backlog.
    g_listener = evconnlistener_new(
        base, OnAccept, args, LEV_OPT_CLOSE_ON_FREE | LEV_OPT_CLOSE_ON_EXEC, 0,
        fd);
    err = errno;
  }
  if (g_listener == nullptr) {
    quvaidx::StopDeadlines();
    AppLogError(3, "%s:%d [Error] Could not create a listener: fd %d (%s)",
                kModule, __LINE__, fd, strerror(err));
    errno = err;
    return -1;
  }
  evconnlistener_set_error_cb(g_listener, OnAcceptError);
  IgnoreBrokenPipes();
  g_owns_socket_file = false;
  return 0;
}

int StopServer(const char* path) {
  if (g_listener == nullptr) return 0;
  if (g_accept_resume != nullptr) {
    event_free(g_accept_resume);
    g_accept_resume = nullptr;
  }
  quvaidx::StopDeadlines();
  evconnlistener_free(g_listener);
  g_listener = nullptr;
  // A socket handed over belongs to whoever bound it. The removal's
  // outcome is not examined.
  if (path != nullptr && g_owns_socket_file) unlink(path);
  return 0;
}

int GetCurrentConnCount() { return g_conn_count; }

Json::Value MakeResponse(bool success, const char* reason) {
  Json::Value response(Json::objectValue);
  response["success"] = success;
  if (reason != nullptr) response["reason"] = reason;
  return response;
}

int GetPeerCredentials(PeerCredentials* peer) {
  if (peer == nullptr || g_handler_connection == nullptr) return -1;
  struct ucred credentials;
  socklen_t length = sizeof(credentials);
  if (getsockopt(static_cast<int>(bufferevent_getfd(g_handler_connection)),
                 SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
    return -1;
  }
  peer->pid = credentials.pid;
  peer->uid = credentials.uid;
  peer->gid = credentials.gid;
  return 0;
}

int GetPeerGroups(std::vector<gid_t>* groups) {
  if (groups == nullptr || g_handler_connection == nullptr) return -1;
  const int fd = static_cast<int>(bufferevent_getfd(g_handler_connection));
  struct ucred credentials;
  socklen_t length = sizeof(credentials);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
    return -1;
  }
  try {
    return quvaidx::PeerSocketGroups(fd, credentials, groups) ? 0 : -1;
  } catch (...) {  // out of memory
    return -1;
  }
}

DeferredReply* DeferReply() {
  if (g_handler_connection == nullptr || g_deferred_in_call != nullptr) {
    AppLogError(3, "%s:%d [Error] no reply to defer here", kModule, __LINE__);
    return nullptr;
  }
  auto* deferred =
      new (std::nothrow) DeferredReply{g_handler_connection, g_handler_args};
  if (deferred == nullptr ||
      !quvaidx::AttachDeferred(g_handler_connection, deferred)) {
    AppLogError(3, "%s:%d [Error] [%s] cannot defer the reply on fd = %d",
                kModule, __LINE__, DaemonName(g_handler_args),
                static_cast<int>(bufferevent_getfd(g_handler_connection)));
    delete deferred;
    return nullptr;
  }
  g_deferred_in_call = deferred;
  return deferred;
}

int SendDeferredReply(DeferredReply* deferred, const Json::Value* reply) {
  if (deferred == nullptr || g_handler_connection != nullptr) {
    AppLogError(3,
                "%s:%d [Error] a deferred reply is sent from the loop, "
                "outside handlers",
                kModule, __LINE__);
    return -1;
  }
  struct bufferevent* bev = deferred->bev;
  EventArgs* args = deferred->args;
  delete deferred;
  if (bev == nullptr) return -1;  // its connection has closed
  quvaidx::DetachDeferred(bev);
  // Reading resumes unless the peer has ended its stream (libevent stopped
  // reading then).
  if (!quvaidx::InputEnded(bev)) bufferevent_enable(bev, EV_READ);
  if (reply == nullptr) {
    FinishConnection(bev);
    return 0;
  }
  const int queued = QueueReply(bev, *reply);
  if (quvaidx::EnforceOutputLimit(bev)) return -1;
  if (evbuffer_get_length(bufferevent_get_output(bev)) > kMaxPendingOutput) {
    bufferevent_disable(bev, EV_READ);  // onWrite serves the rest
    quvaidx::NoteWait(bev, Wait::kDrain, /*progress=*/true);
  } else if (evbuffer_get_length(bufferevent_get_input(bev)) > 0) {
    ServeInput(bev, args);
  } else if (quvaidx::InputEnded(bev)) {
    FinishConnection(bev);
  } else {
    quvaidx::NoteWait(bev, Wait::kRequest, /*progress=*/true);
  }
  return queued;
}

int CheckBufferevent(struct bufferevent* bev) {
  size_t arrived = 0;
  PacketPeek peek = PeekInput(bufferevent_get_input(bev), &arrived);
  // A whole packet is there once its bytes are, whatever the header
  // announces; RecvPacketEv refuses one that is too large.
  if (arrived >= kPacketHeaderSize && arrived >= peek.total) return 1;
  LogIncomplete(arrived, peek);
  return 0;
}

int RecvPacketEv(struct bufferevent* bev, Json::Value& value) {
  unsigned char header[kPacketHeaderSize];
  size_t got = bufferevent_read(bev, header, sizeof(header));
  if (got != sizeof(header)) {
    AppLogError(3, "%s:%d bufferevent_read, %d, %d", kModule, __LINE__,
                static_cast<int>(got), static_cast<int>(sizeof(header)));
    return -1;
  }
  PacketPeek peek = quvaidx::PeekPacket(header, sizeof(header));
  if (peek.status == PeekStatus::kTooLarge) {
    AppLogError(3, "%s:%d [Error] packet too large: %zu bytes, limit %zu",
                kModule, __LINE__, peek.body_length, kMaxRecvBody);
    return -1;
  }
  char body[kPacketBufferSize];
  got = bufferevent_read(bev, body, peek.body_length);
  if (got != peek.body_length) {
    AppLogError(3, "%s:%d bufferevent_read, %d, %d", kModule, __LINE__,
                static_cast<int>(got), static_cast<int>(peek.body_length));
    return -1;
  }
  ParseRequest(body, peek.body_length, value);
  return 0;
}

int SendPacketEv(struct bufferevent* bev, Json::Value& value) {
  bool too_large = false;
  return QueuePacket(bev, value, &too_large);
}

void OnAccept(struct evconnlistener* listener, int fd, struct sockaddr*, int,
              void* args) {
  ++g_conn_count;
  struct bufferevent* bev = bufferevent_socket_new(
      evconnlistener_get_base(listener), fd, BEV_OPT_CLOSE_ON_FREE);
  if (bev == nullptr) {
    AppLogError(3, "%s:%d [Error] [%s] bufferevent_socket_new: fd = %d",
                kModule, __LINE__, DaemonName(args), fd);
    --g_conn_count;
    close(fd);  // nobody else owns it
    return;
  }
  if (!quvaidx::TrackConnection(bev, static_cast<EventArgs*>(args))) {
    AppLogError(3, "%s:%d [Error] [%s] out of memory for fd = %d", kModule,
                __LINE__, DaemonName(args), fd);
    CloseConnection(bev);
    return;
  }
  bufferevent_setcb(bev, onRead, onWrite, onEvent, args);
  bufferevent_enable(bev, EV_READ);
}

void OnAcceptError(struct evconnlistener* listener, void*) {
  int err = EVUTIL_SOCKET_ERROR();
  struct event_base* base = evconnlistener_get_base(listener);
  if (IsOutOfDescriptors(err)) {
    // Any local user could otherwise stop the daemon by holding connections
    // open: give up those that have waited longest for their peer, and
    // accept again at once; with none to give up, pause and try again
    // shortly.
    int closed =
        quvaidx::CloseLongestWaiting(kClosedPerAcceptFailure, kAcceptPauseMs);
    if (closed > 0) {
      AppLogError(3,
                  "%s:%d [Error] accept: %d, %s; closed %d stalled "
                  "connections",
                  kModule, __LINE__, err, evutil_socket_error_to_string(err),
                  closed);
      return;
    }
    AppLogError(3, "%s:%d [Error] accept: %d, %s; pausing for %d ms", kModule,
                __LINE__, err, evutil_socket_error_to_string(err),
                kAcceptPauseMs);
    if (g_accept_resume == nullptr) {
      g_accept_resume = evtimer_new(base, ResumeAccepting, listener);
    }
    if (g_accept_resume != nullptr) {
      struct timeval pause = {0, kAcceptPauseMs * 1000};
      evconnlistener_disable(listener);
      evtimer_add(g_accept_resume, &pause);
      return;
    }
  }
  event_base_loopexit(base, nullptr);
  AppLogError(3, "%s:%d [Error] OnAcceptError: %d, %s", kModule, __LINE__, err,
              evutil_socket_error_to_string(err));
}

void onRead(struct bufferevent* bev, void* args) {
  ServeInput(bev, static_cast<EventArgs*>(args));
}

void onWrite(struct bufferevent* bev, void* args) {
  // Called when the output has drained. Resume a connection that was paused
  // for backpressure, and answer what it had already sent; one that waits
  // for a deferred reply is resumed when that is sent.
  if ((bufferevent_get_enabled(bev) & EV_READ) != 0 ||
      quvaidx::DeferredOf(bev) != nullptr) {
    return;
  }
  bufferevent_enable(bev, EV_READ);
  if (evbuffer_get_length(bufferevent_get_input(bev)) > 0) {
    onRead(bev, args);
  } else {
    quvaidx::NoteWait(bev, Wait::kRequest, /*progress=*/true);
  }
}

void onEvent(struct bufferevent* bev, short events, void* args) {
  const char* name = DaemonName(args);
  int fd = static_cast<int>(bufferevent_getfd(bev));
  if (events & BEV_EVENT_EOF) {
    AppLogError(7, "%s:%d [%s] BEV_EVENT_EOF: fd = %d", kModule, __LINE__, name,
                fd);
  } else if (events & BEV_EVENT_READING) {
    AppLogError(3, "%s:%d [%s] BEV_EVENT_READING: fd = %d", kModule, __LINE__,
                name, fd);
  } else if (events & BEV_EVENT_WRITING) {
    AppLogError(3, "%s:%d [%s] BEV_EVENT_WRITING: fd = %d", kModule, __LINE__,
                name, fd);
  } else if (events & BEV_EVENT_ERROR) {
    AppLogError(3, "%s:%d [%s] BEV_EVENT_ERROR: fd = %d", kModule, __LINE__,
                name, fd);
  } else if (events & BEV_EVENT_TIMEOUT) {
    AppLogError(3, "%s:%d [%s] BEV_EVENT_TIMEOUT: fd = %d", kModule, __LINE__,
                name, fd);
  } else {
    AppLogError(3, "%s:%d [%s] unknown: fd = %d", kModule, __LINE__, name, fd);
  }
  if ((events & BEV_EVENT_EOF) != 0) {
    // The peer will send nothing more, but may still read: its replies go
    // out before the close (libevent has stopped reading already), the
    // deferred one and those to the requests waiting behind it included.
    if (quvaidx::DeferredOf(bev) != nullptr) {
      quvaidx::NoteInputEnded(bev);
      return;
    }
    FinishConnection(bev);
    return;
  }
  CloseConnection(bev);
}
