// The event server in-process: a real event base and real client sockets on
// the same thread, the loop driven step by step.
#include "quvaidx/daemon.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <stdexcept>
#include <string>
#include <thread>
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

std::string Header(size_t length) {
  std::string h("\x15\xbe", 2);
  h += static_cast<char>((length >> 8) & 0xff);
  h += static_cast<char>(length & 0xff);
  return h;
}

std::string Packet(const std::string& body) {
  return Header(body.size()) + body;
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

  int Connect() {
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    struct sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strcpy(address.sun_path, path_.c_str());
    EXPECT_EQ(connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                      sizeof(address)),
              0);
    clients_.push_back(fd);
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
  // there, the peer closed, or a second passed. Returns at most n bytes;
  // the rest stays for the next call.
  std::string Receive(int fd, size_t n, bool* closed = nullptr) {
    std::string& pending = pending_[fd];
    auto end = std::chrono::steady_clock::now() + std::chrono::seconds(1);
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
  std::string ReceiveBody(int fd) {
    std::string header = Receive(fd, 4);
    if (header.size() < 4) return "";
    size_t length = (static_cast<unsigned char>(header[2]) << 8) |
                    static_cast<unsigned char>(header[3]);
    return Receive(fd, length);
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

bool StartsWith(const std::string& text, const std::string& prefix) {
  return text.compare(0, prefix.size(), prefix) == 0;
}

TEST_F(EventServerTest, SuccessReplyIsExactly21Bytes) {
  handler_ = [](Json::Value&, Json::Value& reply) {
    reply = MakeResponse(true, nullptr);
    return 0;
  };
  Start();
  int fd = Connect();
  Send(fd, Request("HANDSHAKE"));
  EXPECT_EQ(Receive(fd, 21),
            std::string("\x15\xbe\x00\x11{\"success\":true}\n", 21));
  ASSERT_EQ(requests_.size(), 1u);
  EXPECT_EQ(requests_[0]["command"].asString(), "HANDSHAKE");
}

TEST_F(EventServerTest, UntouchedReplyIsAnEmptyObject) {
  Start();
  int fd = Connect();
  Send(fd, Request("ANYTHING"));
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
}

TEST_F(EventServerTest, MakeResponseCarriesReasonOnlyWhenGiven) {
  EXPECT_EQ(Json::FastWriter().write(MakeResponse(false, nullptr)),
            "{\"success\":false}\n");
  EXPECT_EQ(Json::FastWriter().write(MakeResponse(false, "no such file")),
            "{\"reason\":\"no such file\",\"success\":false}\n");
}

TEST_F(EventServerTest, PacketInPiecesReachesHandlerOnceAfterLastByte) {
  LogCapture log(6);
  Start();
  int fd = Connect();
  std::string packet = Request("SLOW");
  for (size_t i = 0; i + 1 < packet.size(); ++i) {
    Send(fd, packet.substr(i, 1));
    RunFor(1);
  }
  EXPECT_TRUE(requests_.empty());
  Send(fd, packet.substr(packet.size() - 1));
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
  EXPECT_EQ(requests_.size(), 1u);
  EXPECT_EQ(log.Count("quvaidx_daemon:N bufferevent at least 4 bytes "
                      "[1 bytes]"),
            1);
  EXPECT_EQ(log.Count("quvaidx_daemon:N bufferevent hasn't arrived "
                      "completely, and wait [arrived=4, total=23]"),
            1);
}

TEST_F(EventServerTest, ZeroLengthPacketGivesHandlerAnEmptyObject) {
  Start();
  int fd = Connect();
  Send(fd, Header(0));
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
  ASSERT_EQ(requests_.size(), 1u);
  EXPECT_TRUE(requests_[0].isObject());
  EXPECT_TRUE(requests_[0].empty());
}

TEST_F(EventServerTest, PipelinedRequestsAreAllAnsweredInOrder) {
  handler_ = [](Json::Value& request, Json::Value& reply) {
    reply["echo"] = request["command"];
    return 0;
  };
  Start();
  int fd = Connect();
  Send(fd, Request("ONE") + Request("TWO") + Request("THREE"));
  // No further byte is sent: all three must be answered now.
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"ONE\"}\n");
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"TWO\"}\n");
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"THREE\"}\n");
}

TEST_F(EventServerTest, NonZeroHandlerResultClosesWithoutReply) {
  handler_ = [](Json::Value& request, Json::Value& reply) {
    reply = MakeResponse(true, nullptr);
    return request["command"] == "QUIT" ? -1 : 0;
  };
  Start();
  int fd = Connect();
  int other = Connect();
  EXPECT_EQ(GetCurrentConnCount(), 2);
  Send(fd, Request("QUIT") + Request("AFTER"));
  bool closed = false;
  EXPECT_EQ(Receive(fd, 1, &closed), "");
  EXPECT_TRUE(closed);
  EXPECT_EQ(requests_.size(), 1u);  // the pipelined request is dropped
  EXPECT_EQ(GetCurrentConnCount(), 1);
  Send(other, Request("STILL_HERE"));
  EXPECT_EQ(ReceiveBody(other), "{\"success\":true}\n");
}

TEST_F(EventServerTest, RefusalKeepsRepliesToEarlierPipelinedRequests) {
  handler_ = [](Json::Value& request, Json::Value& reply) {
    reply["echo"] = request["command"];
    return request["command"] == "QUIT" ? -1 : 0;
  };
  Start();
  int fd = Connect();
  Send(fd, Request("FIRST") + Request("QUIT") + Request("NEVER"));
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"FIRST\"}\n");
  bool closed = false;
  EXPECT_EQ(Receive(fd, 1, &closed), "");
  EXPECT_TRUE(closed);
  EXPECT_EQ(requests_.size(), 2u);
  EXPECT_EQ(GetCurrentConnCount(), 0);
}

TEST_F(EventServerTest, ThrowingHandlerIsLoggedAndClosed) {
  LogCapture log;
  handler_ = [](Json::Value&, Json::Value&) -> int {
    throw std::runtime_error("bad day");
  };
  Start();
  int fd = Connect();
  Send(fd, Request("BOOM"));
  bool closed = false;
  EXPECT_EQ(Receive(fd, 1, &closed), "");
  EXPECT_TRUE(closed);
  EXPECT_EQ(log.Count("quvaidx_daemon:N [Error] [testd] handler threw: "
                      "bad day"),
            1);
  EXPECT_EQ(GetCurrentConnCount(), 0);
}

TEST_F(EventServerTest, ClientCloseLeavesOneDebugLine) {
  LogCapture log(7);
  Start();
  int fd = Connect();
  EXPECT_EQ(GetCurrentConnCount(), 1);
  close(fd);
  clients_.clear();
  RunFor(5);
  EXPECT_EQ(GetCurrentConnCount(), 0);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_TRUE(StartsWith(log.Normalized()[0],
                         "quvaidx_daemon:N [testd] BEV_EVENT_EOF: fd = "));
}

TEST_F(EventServerTest, BadBodiesReachTheHandlerWithoutCrashing) {
  Start();
  int fd = Connect();
  Send(fd, Packet("not json at all") + Packet(std::string(5000, '[')) +
               Packet(std::string("{\"a\":1}\0{\"b\"", 12)));
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
  EXPECT_EQ(ReceiveBody(fd), "{}\n");
  ASSERT_EQ(requests_.size(), 3u);
  EXPECT_EQ(requests_[2]["a"].asInt(), 1);
  EXPECT_FALSE(requests_[2].isMember("b"));
}

TEST_F(EventServerTest, OversizedHeaderClosesWithoutCallingHandler) {
  LogCapture log;
  Start();
  int fd = Connect();
  Send(fd, Header(16384) + "{}");
  bool closed = false;
  Receive(fd, 1, &closed);
  EXPECT_TRUE(closed);
  EXPECT_TRUE(requests_.empty());
  EXPECT_EQ(GetCurrentConnCount(), 0);
  ASSERT_EQ(log.lines().size(), 1u);
}

TEST_F(EventServerTest, OversizedReplyIsReplacedByAFailure) {
  handler_ = [](Json::Value&, Json::Value& reply) {
    reply = MakeResponse(true, nullptr);
    reply["blob"] = std::string(20000, 'b');
    return 0;
  };
  Start();
  int fd = Connect();
  Send(fd, Request("BIG"));
  EXPECT_EQ(ReceiveBody(fd),
            "{\"reason\":\"reply too large\",\"success\":false}\n");
}

TEST_F(EventServerTest, ClientExchangeEndToEnd) {
  handler_ = [](Json::Value& request, Json::Value& reply) {
    reply = MakeResponse(true, nullptr);
    reply["path"] = request["path"];
    return 0;
  };
  Start();
  Json::Value value(Json::objectValue);
  value["command"] = "GET_MEDIA_INFO";
  value["path"] = "/share/Multimedia/a.jpg";
  int result = -9;
  std::atomic<bool> done{false};
  std::thread client([&] {
    result = AutoSendRecvPacketBySocketPath(path_.c_str(), value, 1);
    int fd = ConnectPeer(path_.c_str(), true, 1);
    if (fd >= 0) result += 10;
    DisconnectPeer(fd);
    done = true;
  });
  while (!done) RunFor(1);
  client.join();
  RunFor(5);
  EXPECT_EQ(result, 10);
  EXPECT_TRUE(value["success"].asBool());
  EXPECT_EQ(value["path"].asString(), "/share/Multimedia/a.jpg");
}

TEST_F(EventServerTest, ClientGoneBeforeItsReplyDoesNotKillTheDaemon) {
  signal(SIGPIPE, SIG_DFL);
  const std::string blob(10000, 'g');
  handler_ = [&](Json::Value&, Json::Value& reply) {
    reply["blob"] = blob;
    return 0;
  };
  Start();
  int fd = Connect();
  std::string requests;
  for (int i = 0; i < 100; ++i) requests += Request("R");
  Send(fd, requests);
  RunFor(10);  // replies pile up unread
  close(fd);
  clients_.clear();
  RunFor(20);  // writing to the closed client raises SIGPIPE, if not ignored
  EXPECT_EQ(GetCurrentConnCount(), 0);
  struct sigaction action;
  sigaction(SIGPIPE, nullptr, &action);
  EXPECT_EQ(action.sa_handler, SIG_IGN);
}

TEST_F(EventServerTest, StaleSocketFileIsReplaced) {
  int fd = open(path_.c_str(), O_CREAT | O_WRONLY, 0600);
  close(fd);
  Start();
  struct stat st;
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  StopServer(path_.c_str());
  EXPECT_EQ(g_listener, nullptr);
  EXPECT_NE(access(path_.c_str(), F_OK), 0);  // removed
}

TEST_F(EventServerTest, UnremovableFileFailsTheBuild) {
  LogCapture log;
  ASSERT_EQ(mkdir(path_.c_str(), 0700), 0);
  EXPECT_EQ(BuildServer(base_, path_.c_str(), &args_), -1);
  EXPECT_EQ(g_listener, nullptr);
  EXPECT_EQ(
      log.Normalized(),
      (std::vector<std::string>{"quvaidx_daemon:N [Error] remove " + path_}));
  rmdir(path_.c_str());
}

TEST_F(EventServerTest, OverlongPathIsRefusedAndNothingTouched) {
  LogCapture log;
  std::string too_long = dir_.File(std::string(120, 'l'));
  std::string cut = too_long.substr(0, kMaxSocketPath);
  int fd = open(cut.c_str(), O_CREAT | O_WRONLY, 0600);
  close(fd);
  EXPECT_EQ(BuildServer(base_, too_long.c_str(), &args_), -1);
  EXPECT_EQ(g_listener, nullptr);
  struct stat st;
  ASSERT_EQ(stat(cut.c_str(), &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));  // neither removed nor replaced
  EXPECT_EQ(log.lines().size(), 1u);
}

TEST_F(EventServerTest, StopWithoutServerRemovesNothing) {
  int fd = open(path_.c_str(), O_CREAT | O_WRONLY, 0600);
  close(fd);
  EXPECT_EQ(StopServer(path_.c_str()), 0);
  EXPECT_EQ(access(path_.c_str(), F_OK), 0);
}

TEST_F(EventServerTest, SecondServerIsRefused) {
  LogCapture log;
  Start();
  std::string other = dir_.File("other.sock");
  EXPECT_EQ(BuildServer(base_, other.c_str(), &args_), -1);
  EXPECT_NE(access(other.c_str(), F_OK), 0);
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
  handler_ = [](Json::Value&, Json::Value& reply) {
    reply = MakeResponse(true, nullptr);
    return 0;
  };
  Start();
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  strcpy(address.sun_path, path_.c_str());
  ASSERT_EQ(connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                    sizeof(address)),
            0);
  clients_.push_back(fd);
  // Fill the descriptor table so that the server's accept fails.
  struct rlimit saved;
  getrlimit(RLIMIT_NOFILE, &saved);
  struct rlimit low = saved;
  low.rlim_cur = 256;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
  std::vector<int> filler;
  for (int d; (d = dup(0)) >= 0;) filler.push_back(d);
  RunFor(20);
  EXPECT_EQ(GetCurrentConnCount(), 0);
  EXPECT_EQ(log.lines().size(), 1u);
  EXPECT_TRUE(
      StartsWith(log.Normalized()[0], "quvaidx_daemon:N [Error] accept: 24, "));
  for (int d : filler) close(d);
  setrlimit(RLIMIT_NOFILE, &saved);
  // The loop kept running; after the pause the connection is served.
  Send(fd, Request("HANDSHAKE"));
  auto end = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  std::string body;
  while (body.empty() && std::chrono::steady_clock::now() < end) {
    body = ReceiveBody(fd);
  }
  EXPECT_EQ(body, "{\"success\":true}\n");
}

TEST_F(EventServerTest, ClientThatNeverReadsIsNotBufferedWithoutBound) {
  const std::string blob(10000, 'r');
  handler_ = [&](Json::Value&, Json::Value& reply) {
    reply["blob"] = blob;
    return 0;
  };
  Start();
  int fd = Connect();
  const int kRequests = 400;  // 4 MB of replies
  std::string requests;
  for (int i = 0; i < kRequests; ++i) requests += Request("R");
  Send(fd, requests);
  RunFor(50);
  // Served: what fits the pending-output bound plus the socket buffers.
  size_t served = requests_.size();
  EXPECT_LT(served, static_cast<size_t>(kRequests));
  EXPECT_LT(served * blob.size(), kMaxPendingOutput + 2 * 1024 * 1024);
  // Once the client reads, everything is answered, in order.
  const size_t reply_size = 4 + blob.size() + 12;
  std::string all = Receive(fd, reply_size * kRequests);
  EXPECT_EQ(all.size(), reply_size * kRequests);
  EXPECT_EQ(requests_.size(), static_cast<size_t>(kRequests));
}

}  // namespace
