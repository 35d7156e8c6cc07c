// The event server against peers that abuse it: stalling mid-request or
// between requests, half-closing with replies queued, going away while the
// server finishes, hoarding replies, and flooding it with partial requests.
#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include <event2/event.h>
#include <gtest/gtest.h>

#include "daemon/server_connections.h"
#include "daemon/server_fixture.h"
#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "util/hooks.h"

namespace {

using quvaidx::test::EventServerTest;
using quvaidx::test::LogCapture;
using quvaidx::test::Request;
using quvaidx::test::Succeed;
using quvaidx::test::TempDir;
using Clock = std::chrono::steady_clock;

long long MsSince(Clock::time_point start) {
  return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() -
                                                               start)
      .count();
}

// Sends what the socket takes now; returns how many bytes that was.
size_t SendSome(int fd, const std::string& bytes, size_t offset) {
  ssize_t n = send(fd, bytes.data() + offset, bytes.size() - offset,
                   MSG_DONTWAIT | MSG_NOSIGNAL);
  return n > 0 ? static_cast<size_t>(n) : 0;
}

// A request that trickles in is closed at the packet deadline counted from
// its first byte, however steadily its bytes come; a silent connection at
// the idle deadline; a client that keeps asking is never closed.
TEST_F(EventServerTest, StalledPeersAreClosedAtTheirDeadlines) {
  const ServerLimits limits = {150, 400, kMaxTotalPendingOutput};
  SetServerLimits(&limits);
  handler_ = Succeed;
  Start();
  LogCapture log(6);
  int trickle = Connect();
  int silent = Connect();
  int good = Connect();
  const auto start = Clock::now();
  Send(trickle, std::string("\x15\xbe\x00\x64{", 5));  // 100 bytes announced
  long long trickle_closed = -1;
  long long silent_closed = -1;
  int answered = 0;
  for (int round = 0; MsSince(start) < 1000; ++round) {
    RunFor(25);
    if (trickle_closed < 0) {
      send(trickle, " ", 1, MSG_DONTWAIT | MSG_NOSIGNAL);
      if (ServerClosed(trickle)) trickle_closed = MsSince(start);
    }
    if (silent_closed < 0 && ServerClosed(silent)) {
      silent_closed = MsSince(start);
    }
    if (round % 4 == 0) {
      Send(good, Request("PING"));
      answered += ReceiveBody(good) == "{\"success\":true}\n";
    }
  }
  EXPECT_GE(trickle_closed, 140);
  EXPECT_LT(trickle_closed, 400);
  EXPECT_GE(silent_closed, 390);
  EXPECT_LT(silent_closed, 1000);
  EXPECT_FALSE(ServerClosed(good));
  EXPECT_EQ(answered, static_cast<int>(requests_.size()));
  EXPECT_GE(answered, 8);
  EXPECT_EQ(GetCurrentConnCount(), 1);
  const std::string closed = "quvaidx_daemon:N [testd] closed 1 stalled ";
  EXPECT_EQ(log.Count(closed + "connections: 1 in a request for over 150 ms, "
                               "0 waiting for over 400 ms"),
            1);
  EXPECT_EQ(log.Count(closed + "connections: 0 in a request for over 150 ms, "
                               "1 waiting for over 400 ms"),
            1);
}

// A client that pipelines its requests and shuts down its sending side gets
// every reply before the server closes.
TEST_F(EventServerTest, HalfClosedClientGetsEveryReply) {
  handler_ = Succeed;
  Start();
  const int kRequests = 20000;
  std::string requests;
  for (int i = 0; i < kRequests; ++i) requests += Request("R");
  int fd = Connect();
  // Everything goes out before the client reads a byte, so replies are
  // still queued in the server when it sees the end of the stream.
  for (size_t sent = 0; sent < requests.size();) {
    sent += SendSome(fd, requests, sent);
    event_base_loop(base_, EVLOOP_NONBLOCK);
  }
  ASSERT_EQ(shutdown(fd, SHUT_WR), 0);
  bool closed = false;
  const std::string reply("\x15\xbe\x00\x11{\"success\":true}\n", 21);
  std::string received = Receive(fd, reply.size() * kRequests + 1, &closed, 10);
  EXPECT_TRUE(closed);
  EXPECT_EQ(requests_.size(), static_cast<size_t>(kRequests));
  ASSERT_EQ(received.size(), reply.size() * kRequests);
  for (size_t at = 0; at < received.size(); at += reply.size()) {
    ASSERT_EQ(received.compare(at, reply.size(), reply), 0) << at;
  }
  EXPECT_EQ(GetCurrentConnCount(), 0);
}

// A connection finishing (a refused request after replies that did not all
// fit the socket) whose client goes away is closed on the write error, not
// left to the idle deadline.
TEST_F(EventServerTest, ErrorOnAFinishingConnectionClosesIt) {
  const std::string blob(8000, 'b');
  handler_ = [&](Json::Value& request, Json::Value& reply) {
    reply["blob"] = blob;
    return request["command"] == "QUIT" ? -1 : 0;
  };
  Start();
  std::string requests;
  for (int i = 0; i < 60; ++i) requests += Request("BIG");
  int fd = Connect();
  Send(fd, requests + Request("QUIT"));
  ASSERT_TRUE(RunUntil([&] { return requests_.size() == 61; }, 2000));
  ASSERT_EQ(GetCurrentConnCount(), 1);  // still writing its replies
  close(fd);
  clients_.clear();
  EXPECT_TRUE(RunUntil([] { return GetCurrentConnCount() == 0; }, 2000));
}

// However many clients leave their replies unread, the unsent replies of
// all connections stay within the bound: the connection holding the most
// goes. Others are still served.
TEST_F(EventServerTest, UnsentRepliesOfAllConnectionsAreBounded) {
  const size_t kBound = 1 << 20;
  const ServerLimits limits = {kPacketDeadlineMs, kIdleDeadlineMs, kBound};
  SetServerLimits(&limits);
  const std::string blob(4000, 'b');
  handler_ = [&](Json::Value&, Json::Value& reply) {
    reply["blob"] = blob;
    return 0;
  };
  Start();
  LogCapture log;
  std::string burst;  // about 400 KB of replies, more than a socket holds
  for (int i = 0; i < 100; ++i) burst += Request("R");
  const int kClients = 300;
  size_t peak = 0;
  for (int i = 0; i < kClients; ++i) {
    int fd = RawConnect();
    ASSERT_GE(fd, 0);
    Send(fd, burst);
    for (int step = 0; step < 4; ++step) {
      event_base_loop(base_, EVLOOP_NONBLOCK);
      peak = std::max(peak, quvaidx::PendingOutputTotal());
    }
  }
  EXPECT_LE(peak, kBound);
  EXPECT_GT(peak, kBound / 2);
  int closed = 0;
  for (const std::string& line : log.Normalized()) {
    closed += line.rfind(
                  "quvaidx_daemon:N [Error] [testd] unsent replies "
                  "over 1048576 bytes in all: closed fd = ",
                  0) == 0;
  }
  EXPECT_EQ(static_cast<size_t>(closed), log.lines().size());
  EXPECT_GT(closed, kClients / 2);
  EXPECT_EQ(GetCurrentConnCount(), kClients - closed);
  handler_ = Succeed;
  int fresh = Connect();
  Send(fresh, Request("STILL_THERE"));
  EXPECT_EQ(ReceiveBody(fresh), "{\"success\":true}\n");
  for (int fd : clients_) close(fd);
  clients_.clear();
  EXPECT_TRUE(RunUntil([] { return GetCurrentConnCount() == 0; }, 5000));
  EXPECT_EQ(quvaidx::PendingOutputTotal(), 0u);
}

void DiscardLine(int, const char*) {}

// Runs a daemon in a child process with few descriptors and long deadlines;
// returns its pid.
pid_t StartSmallDaemon(const std::string& path) {
  pid_t child = fork();
  if (child != 0) return child;
  quvaidx::SetLogSink(DiscardLine);
  struct rlimit few = {40, 40};
  getrlimit(RLIMIT_NOFILE, &few);
  few.rlim_cur = 40;
  if (setrlimit(RLIMIT_NOFILE, &few) != 0) _exit(3);
  const ServerLimits limits = {30000, 30000, kMaxTotalPendingOutput};
  SetServerLimits(&limits);
  struct event_base* base = event_base_new();
  EventArgs args = {"floodd", nullptr,
                    [](Json::Value&, Json::Value& reply, EventArgs*) {
                      reply = MakeResponse(true, nullptr);
                      return 0;
                    }};
  if (base == nullptr || BuildServer(base, path.c_str(), &args) != 0) _exit(2);
  struct timeval at_most = {20, 0};  // bounded, should the test not end it
  event_base_loopexit(base, &at_most);
  event_base_dispatch(base);
  _exit(0);
}

// Connections that send two bytes and stall take every descriptor of the
// daemon; a client that then asks is answered long before the deadlines
// would have freed anything, because the stalled ones are given up first.
TEST(ServerFloodTest, PartialRequestFloodDoesNotLockOthersOut) {
  TempDir dir;
  const std::string path = dir.File("flood.sock");
  pid_t daemon = StartSmallDaemon(path);
  ASSERT_GT(daemon, 0);
  const auto start = Clock::now();
  while (access(path.c_str(), F_OK) != 0 && MsSince(start) < 5000) {
    usleep(1000);
  }
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  // Until the daemon takes no more (its backlog full for 50 ms), or 200.
  std::vector<int> flood;
  for (auto refused = Clock::now();
       flood.size() < 200 && MsSince(refused) < 50;) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                sizeof(address)) != 0) {
      close(fd);
      usleep(500);
      continue;
    }
    send(fd, "\x15\xbe", 2, MSG_NOSIGNAL);
    flood.push_back(fd);
    refused = Clock::now();
  }
  EXPECT_GT(flood.size(), 20u);
  const auto asked = Clock::now();
  int fd = ConnectPeer(path.c_str(), false, 1);
  Json::Value request(Json::objectValue);
  request["command"] = "HELLO";
  Json::Value reply;
  struct pollfd ready = {fd, POLLIN, 0};
  bool answered = fd >= 0 && SendPacket(fd, request) == 0 &&
                  poll(&ready, 1, 5000) == 1 && RecvPacket(fd, reply) == 0;
  long long waited = MsSince(asked);
  kill(daemon, SIGKILL);
  waitpid(daemon, nullptr, 0);
  if (fd >= 0) close(fd);
  for (int f : flood) close(f);
  EXPECT_TRUE(answered);
  EXPECT_TRUE(reply["success"].asBool());
  EXPECT_LT(waited, 5000);
}

}  // namespace
