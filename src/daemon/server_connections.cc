// The event server's record of its connections, and the limits drawn from
// it: deadlines, the bound on unsent replies, and which connections to give
// up when descriptors run out.
#include "daemon/server_connections.h"

#include <time.h>

#include <algorithm>
#include <new>
#include <utility>
#include <vector>

#include <event2/buffer.h>
#include <event2/bufferevent.h>
#include <event2/event.h>

#include "quvaidx/log.h"

namespace quvaidx {
namespace {

constexpr char kModule[] = "quvaidx_daemon";
// Deadlines are checked about every quarter of the shorter one, within
// these bounds.
constexpr long long kMinCheckIntervalMs = 1;
constexpr long long kMaxCheckIntervalMs = 1000;

struct Connection {
  struct bufferevent* bev;
  EventArgs* args;
  Wait wait;              // what it waits for now
  long long since_ms;     // when that wait began, or progress last came
  size_t pending_output;  // bytes in its output buffer, counted in total
  struct evbuffer_cb_entry* output_watch;  // keeps pending_output current
  DeferredReply* deferred;  // the reply the daemon still owes, or null
  bool input_ended;         // the peer ended its stream while one was owed
};

const ServerLimits kDefaultLimits = {kPacketDeadlineMs, kIdleDeadlineMs,
                                     kMaxTotalPendingOutput};
ServerLimits g_limits = kDefaultLimits;

// Tracked connections by socket descriptor, which is unique among open
// connections and small, so a lookup costs an index.
std::vector<Connection*> g_by_fd;
size_t g_tracked = 0;  // non-null entries of g_by_fd
size_t g_pending_total = 0;
struct event* g_deadline_timer = nullptr;
EventArgs* g_server_args = nullptr;

long long NowMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC_COARSE, &now);
  return static_cast<long long>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

const char* NameOf(const EventArgs* args) {
  return args != nullptr && args->name != nullptr ? args->name : "";
}

Connection* Find(struct bufferevent* bev) {
  int fd = static_cast<int>(bufferevent_getfd(bev));
  if (fd < 0 || static_cast<size_t>(fd) >= g_by_fd.size()) return nullptr;
  Connection* connection = g_by_fd[static_cast<size_t>(fd)];
  return connection != nullptr && connection->bev == bev ? connection : nullptr;
}

// Keeps the unsent byte counts current as replies are queued and written.
void OnOutputChanged(struct evbuffer*, const struct evbuffer_cb_info* info,
                     void* arg) {
  Connection* connection = static_cast<Connection*>(arg);
  connection->pending_output += info->n_added;
  connection->pending_output -= info->n_deleted;
  g_pending_total += info->n_added;
  g_pending_total -= info->n_deleted;
  // Only a connection waiting on its peer to take replies counts writes as
  // progress; the others restart their clocks as requests are answered.
  if (info->n_deleted > 0 &&
      (connection->wait == Wait::kDrain || connection->wait == Wait::kFlush)) {
    connection->since_ms = NowMs();
  }
}

void Forget(struct bufferevent* bev) {
  Connection* connection = Find(bev);
  if (connection == nullptr) return;
  evbuffer_remove_cb_entry(bufferevent_get_output(bev),
                           connection->output_watch);
  g_pending_total -= connection->pending_output;
  if (connection->deferred != nullptr) connection->deferred->bev = nullptr;
  g_by_fd[static_cast<size_t>(bufferevent_getfd(bev))] = nullptr;
  --g_tracked;
  delete connection;
}

// The shorter of the deadlines in force, or 0 when both are off.
long long ShortestDeadlineMs() {
  long long shortest = 0;
  for (int deadline :
       {g_limits.packet_deadline_ms, g_limits.idle_deadline_ms}) {
    if (deadline > 0 && (shortest == 0 || deadline < shortest)) {
      shortest = deadline;
    }
  }
  return shortest;
}

// Arms the deadline check unless it is armed, off, or has nothing to check.
void ArmDeadlineCheck() {
  if (g_deadline_timer == nullptr || g_tracked == 0 ||
      evtimer_pending(g_deadline_timer, nullptr)) {
    return;
  }
  long long shortest = ShortestDeadlineMs();
  if (shortest == 0) return;
  long long interval =
      std::clamp(shortest / 4, kMinCheckIntervalMs, kMaxCheckIntervalMs);
  struct timeval delay = {static_cast<time_t>(interval / 1000),
                          static_cast<suseconds_t>((interval % 1000) * 1000)};
  evtimer_add(g_deadline_timer, &delay);
}

void ApplyLimits(const ServerLimits& limits) {
  g_limits = limits;
  if (g_deadline_timer != nullptr) {
    event_del(g_deadline_timer);  // the interval follows the new deadlines
    ArmDeadlineCheck();
  }
}

void CheckDeadlines(evutil_socket_t, short, void*) {
  const long long now = NowMs();
  const int packet_ms = g_limits.packet_deadline_ms;
  const int idle_ms = g_limits.idle_deadline_ms;
  int mid_request = 0;
  int idle = 0;
  // Closing empties slots; nothing is added to the table meanwhile.
  for (size_t fd = 0; fd < g_by_fd.size(); ++fd) {
    Connection* connection = g_by_fd[fd];
    if (connection == nullptr) continue;
    const bool in_packet = connection->wait == Wait::kPacket;
    const int deadline = in_packet ? packet_ms : idle_ms;
    if (deadline > 0 && now - connection->since_ms >= deadline) {
      ++(in_packet ? mid_request : idle);
      CloseConnection(connection->bev);
    }
  }
  if (mid_request + idle > 0) {
    AppLogError(6,
                "%s:%d [%s] closed %d stalled connections: %d in a request "
                "for over %d ms, %d waiting for over %d ms",
                kModule, __LINE__, NameOf(g_server_args), mid_request + idle,
                mid_request, packet_ms, idle, idle_ms);
  }
  ArmDeadlineCheck();
}

}  // namespace

bool TrackConnection(struct bufferevent* bev, EventArgs* args) {
  int fd = static_cast<int>(bufferevent_getfd(bev));
  if (fd < 0) return false;
  Connection* connection = new (std::nothrow) Connection{
      bev, args, Wait::kRequest, NowMs(), 0, nullptr, nullptr, false};
  if (connection == nullptr) return false;
  try {
    if (static_cast<size_t>(fd) >= g_by_fd.size()) {
      g_by_fd.resize(static_cast<size_t>(fd) + 1, nullptr);
    }
  } catch (...) {
    delete connection;
    return false;
  }
  connection->output_watch =
      evbuffer_add_cb(bufferevent_get_output(bev), OnOutputChanged, connection);
  if (connection->output_watch == nullptr) {
    delete connection;
    return false;
  }
  Connection*& slot = g_by_fd[static_cast<size_t>(fd)];
  if (slot != nullptr) {
    // The descriptor was closed behind the server's back (its bufferevent
    // freed elsewhere): the old record describes nothing any more.
    g_pending_total -= slot->pending_output;
    if (slot->deferred != nullptr) slot->deferred->bev = nullptr;
    --g_tracked;
    delete slot;
  }
  slot = connection;
  ++g_tracked;
  ArmDeadlineCheck();
  return true;
}

void CloseConnection(struct bufferevent* bev) {
  Forget(bev);
  --g_conn_count;
  bufferevent_free(bev);  // closes the socket
}

bool AttachDeferred(struct bufferevent* bev, DeferredReply* deferred) {
  Connection* connection = Find(bev);
  if (connection == nullptr || connection->deferred != nullptr) return false;
  connection->deferred = deferred;
  return true;
}

DeferredReply* DeferredOf(struct bufferevent* bev) {
  Connection* connection = Find(bev);
  return connection != nullptr ? connection->deferred : nullptr;
}

void DetachDeferred(struct bufferevent* bev) {
  Connection* connection = Find(bev);
  if (connection != nullptr) connection->deferred = nullptr;
}

void NoteInputEnded(struct bufferevent* bev) {
  Connection* connection = Find(bev);
  if (connection != nullptr) connection->input_ended = true;
}

bool InputEnded(struct bufferevent* bev) {
  Connection* connection = Find(bev);
  return connection != nullptr && connection->input_ended;
}

void NoteWait(struct bufferevent* bev, Wait wait, bool progress) {
  Connection* connection = Find(bev);
  if (connection == nullptr) return;
  if (progress || connection->wait != wait) connection->since_ms = NowMs();
  connection->wait = wait;
}

bool EnforceOutputLimit(struct bufferevent* current) {
  const size_t limit = g_limits.max_total_pending_output;
  bool closed_current = false;
  while (limit > 0 && g_pending_total > limit) {
    Connection* largest = nullptr;
    for (Connection* connection : g_by_fd) {
      if (connection != nullptr &&
          (largest == nullptr ||
           connection->pending_output > largest->pending_output)) {
        largest = connection;
      }
    }
    if (largest == nullptr || largest->pending_output == 0) break;
    AppLogError(3,
                "%s:%d [Error] [%s] unsent replies over %zu bytes in all: "
                "closed fd = %d, which held %zu of them",
                kModule, __LINE__, NameOf(largest->args), limit,
                static_cast<int>(bufferevent_getfd(largest->bev)),
                largest->pending_output);
    closed_current = closed_current || largest->bev == current;
    CloseConnection(largest->bev);
  }
  return closed_current;
}

int CloseLongestWaiting(int count, int min_wait_ms) {
  const long long now = NowMs();
  std::vector<std::pair<long long, struct bufferevent*>> waiting;
  for (Connection* connection : g_by_fd) {
    if (connection != nullptr && now - connection->since_ms >= min_wait_ms) {
      waiting.emplace_back(connection->since_ms, connection->bev);
    }
  }
  size_t closing = std::min(waiting.size(), static_cast<size_t>(count));
  std::partial_sort(waiting.begin(), waiting.begin() + closing, waiting.end());
  for (size_t i = 0; i < closing; ++i) CloseConnection(waiting[i].second);
  return static_cast<int>(closing);
}

bool StartDeadlines(struct event_base* base, EventArgs* args) {
  StopDeadlines();
  g_deadline_timer = evtimer_new(base, CheckDeadlines, nullptr);
  g_server_args = args;
  if (g_deadline_timer == nullptr) return false;
  ArmDeadlineCheck();
  return true;
}

void StopDeadlines() {
  if (g_deadline_timer != nullptr) event_free(g_deadline_timer);
  g_deadline_timer = nullptr;
  g_server_args = nullptr;
}

size_t PendingOutputTotal() { return g_pending_total; }

}  // namespace quvaidx

void SetServerLimits(const ServerLimits* limits) {
  quvaidx::ApplyLimits(limits != nullptr ? *limits : quvaidx::kDefaultLimits);
}
