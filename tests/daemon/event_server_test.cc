// The event server in-process: a real event base and real client sockets on
// the same thread, the loop driven step by step.
#include "quvaidx/daemon.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <map>
#include <stdexcept>
#include <string>
#include <vector>

#include <event2/event.h>
#include <gtest/gtest.h>

#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;

std::string Packet(const std::string& body) {
  const size_t n = body.size();
  return std::string("\x15\xbe", 2) + static_cast<char>(n >> 8) +
         static_cast<char>(n & 0xff) + body;
}

std::string Request(const std::string& command) {
  return Packet("{\"command\":\"" + command + "\"}\n");
}

class EventServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    base_ = event_base_new();
    ASSERT_NE(base_, nullptr);
    args_.name = "testd";
    args_.context = this;
    args_.handler = [](Json::Value& request, Json::Value& reply,
                       EventArgs* args) {
      auto* self = static_cast<EventServerTest*>(args->context);
      self->requests_.push_back(request);
      return self->handler_ ? self->handler_(request, reply) : 0;
    };
  }

  void TearDown() override {
    for (int fd : clients_) close(fd);
    clients_.clear();
    RunFor(5);  // let the server see the closes
    EXPECT_EQ(GetCurrentConnCount(), 0);
    StopServer(path_.c_str());
    event_base_free(base_);
    EXPECT_TRUE(leaks_.NoLeak());
  }

  void Start() { ASSERT_EQ(BuildServer(base_, path_.c_str(), &args_), 0); }

  // Connects without running the loop, so nothing is accepted yet.
  int RawConnect() {
    clients_.push_back(ConnectPeer(path_.c_str(), false, 1));
    return clients_.back();
  }

  int Connect() {
    int fd = RawConnect();
    RunFor(2);  // accept
    return fd;
  }

  void Send(int fd, const std::string& bytes) {
    ASSERT_EQ(write(fd, bytes.data(), bytes.size()),
              static_cast<ssize_t>(bytes.size()));
  }

  // Runs the loop without blocking for about `ms` milliseconds.
  void RunFor(int ms) {
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    do {
      event_base_loop(base_, EVLOOP_NONBLOCK);
      usleep(200);
    } while (std::chrono::steady_clock::now() < end);
  }

  // Runs the loop and collects what arrives on fd until `n` bytes are
  // there, the peer closed, or `seconds` passed. Returns at most n bytes;
  // the rest stays for the next call.
  std::string Receive(int fd, size_t n, bool* closed = nullptr,
                      int seconds = 1) {
    std::string& pending = pending_[fd];
    auto end = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    while (pending.size() < n && std::chrono::steady_clock::now() < end) {
      event_base_loop(base_, EVLOOP_NONBLOCK);
      char buf[65536];
      ssize_t got = recv(fd, buf, sizeof(buf), MSG_DONTWAIT);
      if (got > 0) {
        pending.append(buf, static_cast<size_t>(got));
      } else if (got == 0) {
        if (closed != nullptr) *closed = true;
        break;
      } else {
        usleep(200);
      }
    }
    std::string out = pending.substr(0, n);
    pending.erase(0, out.size());
    return out;
  }

  // Receives one reply packet and returns its body.
  std::string ReceiveBody(int fd, int seconds = 1) {
    std::string header = Receive(fd, 4, nullptr, seconds);
    if (header.size() < 4) return "";
    return Receive(fd, (static_cast<unsigned char>(header[2]) << 8) |
                           static_cast<unsigned char>(header[3]));
  }

  // True when the server closed fd without sending anything more.
  bool ClosedSilently(int fd) {
    bool closed = false;
    return Receive(fd, 1, &closed).empty() && closed;
  }

  FdLeakCheck leaks_;
  TempDir dir_;
  std::string path_ = dir_.File("testd.sock");
  struct event_base* base_ = nullptr;
  EventArgs args_{};
  std::function<int(Json::Value&, Json::Value&)> handler_;
  std::vector<Json::Value> requests_;
  std::vector<int> clients_;
  std::map<int, std::string> pending_;
};

int Succeed(Json::Value&, Json::Value& reply) {
  reply = MakeResponse(true, nullptr);
  return 0;
}

int Echo(Json::Value& request, Json::Value& reply) {
  reply["echo"] = request["command"];
  return request["command"] == "QUIT" ? -1 : 0;
}

// A request in pieces reaches the handler once, after its last byte.
TEST_F(EventServerTest, SuccessReplyIsExactly21BytesAndPiecesAreJoined) {
  handler_ = Succeed;
  Start();
  int fd = Connect();
  std::string packet = Request("HANDSHAKE");
  for (size_t i = 0; i + 1 < packet.size(); ++i) {
    Send(fd, packet.substr(i, 1));
    RunFor(1);
  }
  EXPECT_TRUE(requests_.empty());
  Send(fd, packet.substr(packet.size() - 1));
  EXPECT_EQ(Receive(fd, 21),
            std::string("\x15\xbe\x00\x11{\"success\":true}\n", 21));
  ASSERT_EQ(requests_.size(), 1u);
  EXPECT_EQ(requests_[0]["command"].asString(), "HANDSHAKE");
  handler_ = nullptr;
  Send(fd, Request("UNTOUCHED"));
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
}

// Pipelined requests are all answered at once, in order, without waiting
// for another byte. A non-zero handler result closes the connection without
// a reply, after the earlier replies; other connections go on.
TEST_F(EventServerTest, PipelinedRequestsAndRefusal) {
  handler_ = Echo;
  Start();
  int fd = Connect();
  int other = Connect();
  Send(fd, Request("ONE") + Request("TWO") + Request("QUIT") + Request("NO"));
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"ONE\"}\n");
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"TWO\"}\n");
  EXPECT_TRUE(ClosedSilently(fd));
  EXPECT_EQ(requests_.size(), 3u);
  EXPECT_EQ(GetCurrentConnCount(), 1);
  Send(other, Request("STILL_HERE"));
  EXPECT_EQ(ReceiveBody(other), "{\"echo\":\"STILL_HERE\"}\n");
}

// A throwing handler is logged and its connection closed; a reply too large
// is replaced; a request announcing too many bytes closes the connection.
TEST_F(EventServerTest, ThrowingHandlerAndOversizedPackets) {
  LogCapture log;
  handler_ = [](Json::Value&, Json::Value&) -> int {
    throw std::runtime_error("bad day");
  };
  Start();
  int boom = Connect();
  Send(boom, Request("BOOM"));
  EXPECT_TRUE(ClosedSilently(boom));
  EXPECT_EQ(log.Normalized(),
            std::vector<std::string>{
                "quvaidx_daemon:N [Error] [testd] handler threw: bad day"});
  handler_ = [](Json::Value&, Json::Value& reply) {
    reply["blob"] = std::string(20000, 'b');
    return 0;
  };
  int big = Connect();
  Send(big, Request("BIG"));  // a reply too large is replaced
  EXPECT_EQ(ReceiveBody(big),
            "{\"reason\":\"reply too large\",\"success\":false}\n");
  int fd = Connect();
  Send(fd, std::string("\x15\xbe\x40\x00{}", 6));  // announces 16384 bytes
  EXPECT_TRUE(ClosedSilently(fd));
  EXPECT_EQ(requests_.size(), 2u);
  EXPECT_EQ(GetCurrentConnCount(), 1);
  EXPECT_EQ(log.lines().size(), 3u);
}

// An overlong path is refused, not cut: the file at the cut path stays. A
// stale file is replaced by the socket, which is removed on stop. A second
// server is refused.
TEST_F(EventServerTest, SocketFile) {
  LogCapture log;
  std::string too_long = dir_.File(std::string(120, 'l'));
  std::string cut = too_long.substr(0, kMaxSocketPath);
  close(open(cut.c_str(), O_CREAT | O_WRONLY, 0600));
  EXPECT_EQ(BuildServer(base_, too_long.c_str(), &args_), -1);
  EXPECT_EQ(g_listener, nullptr);
  struct stat st;
  ASSERT_EQ(stat(cut.c_str(), &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));
  EXPECT_EQ(log.lines().size(), 1u);
  close(open(path_.c_str(), O_CREAT | O_WRONLY, 0600));
  Start();
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  std::string other = dir_.File("other.sock");  // a second server
  EXPECT_EQ(BuildServer(base_, other.c_str(), &args_), -1);
  EXPECT_NE(access(other.c_str(), F_OK), 0);
  StopServer(path_.c_str());
  EXPECT_NE(access(path_.c_str(), F_OK), 0);
}

TEST_F(EventServerTest, AcceptErrorEndsTheLoop) {
  LogCapture log;
  Start();
  errno = EINVAL;
  OnAcceptError(g_listener, &args_);
  EXPECT_EQ(event_base_dispatch(base_), 0);  // returns at once
  EXPECT_EQ(log.Normalized(),
            (std::vector<std::string>{
                "quvaidx_daemon:N [Error] OnAcceptError: 22, Invalid "
                "argument"}));
  EXPECT_NE(g_listener, nullptr);
}

TEST_F(EventServerTest, RunningOutOfDescriptorsPausesAccepting) {
  LogCapture log;
  handler_ = Succeed;
  Start();
  int fd = RawConnect();
  struct rlimit saved;
  getrlimit(RLIMIT_NOFILE, &saved);
  struct rlimit low = saved;
  low.rlim_cur = 256;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
  std::vector<int> filler;
  for (int d; (d = dup(0)) >= 0;) filler.push_back(d);
  RunFor(20);
  EXPECT_EQ(GetCurrentConnCount(), 0);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(
      log.Normalized()[0].rfind("quvaidx_daemon:N [Error] accept: 24, ", 0),
      0u);
  for (int d : filler) close(d);
  setrlimit(RLIMIT_NOFILE, &saved);
  // After the pause the connection is served.
  Send(fd, Request("HANDSHAKE"));
  EXPECT_EQ(ReceiveBody(fd, 3), "{\"success\":true}\n");
}

// Replies to a client that is gone raise no SIGPIPE; replies to a client
// that does not read are bounded.
TEST_F(EventServerTest, SlowOrGoneClientsDoNotHurtTheDaemon) {
  signal(SIGPIPE, SIG_DFL);
  const std::string blob(10000, 'r');
  handler_ = [&](Json::Value&, Json::Value& reply) {
    reply["blob"] = blob;
    return 0;
  };
  Start();
  const int kRequests = 400;  // 4 MB of replies
  std::string requests;
  for (int i = 0; i < kRequests; ++i) requests += Request("R");
  int gone = Connect();
  Send(gone, requests.substr(0, requests.size() / 4));
  RunFor(10);  // replies pile up unread
  close(gone);
  clients_.clear();
  RunFor(20);  // writing to the closed client raises SIGPIPE, if not ignored
  EXPECT_EQ(GetCurrentConnCount(), 0);
  struct sigaction action;
  sigaction(SIGPIPE, nullptr, &action);
  EXPECT_EQ(action.sa_handler, SIG_IGN);

  requests_.clear();
  int fd = Connect();
  Send(fd, requests);
  RunFor(50);
  // Served: what fits the pending-output bound plus the socket buffers.
  size_t served = requests_.size();
  EXPECT_LT(served, static_cast<size_t>(kRequests));
  EXPECT_LT(served * blob.size(), kMaxPendingOutput + 2 * 1024 * 1024);
  // Once the client reads, everything is answered.
  const size_t reply_size = 4 + blob.size() + 12;
  EXPECT_EQ(Receive(fd, reply_size * kRequests).size(), reply_size * kRequests);
  EXPECT_EQ(requests_.size(), static_cast<size_t>(kRequests));
}

}  // namespace
