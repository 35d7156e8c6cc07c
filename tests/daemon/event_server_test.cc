// The event server in-process: framing, handler results, the socket file,
// running out of descriptors, slow and vanished clients.
#include "quvaidx/daemon.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

#include <event2/event.h>
#include <gtest/gtest.h>

#include "daemon/server_fixture.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

namespace {

using quvaidx::test::Echo;
using quvaidx::test::EventServerTest;
using quvaidx::test::LogCapture;
using quvaidx::test::Packet;
using quvaidx::test::Request;
using quvaidx::test::Succeed;

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

// A body the JSON reader rejects must not run with half-read arguments: the
// handler gets an empty object. Bodies that parse, trailing bytes included,
// arrive as they are.
TEST_F(EventServerTest, RejectedBodyReachesTheHandlerEmpty) {
  handler_ = Succeed;
  Start();
  struct Case {
    std::string body;
    const char* request;  // as the handler saw it, compact
  } cases[] = {
      {"{\"command\":\"ECHO\",\"x\":1", "{}"},  // truncated
      {"{\"command\":\"ECHO\",\"x\":", "{}"},
      {"[\"ECHO\"", "{}"},
      {"plain words", "{}"},
      {std::string(5000, '['), "{}"},  // nested too deeply
      {"", "{}"},
      {"{\"command\":\"ECHO\"} and more", "{\"command\":\"ECHO\"}"},
      {"{\"command\":\"ECHO\"}\n", "{\"command\":\"ECHO\"}"},
      {"7", "7"},
  };
  int fd = Connect();
  for (const Case& c : cases) Send(fd, Packet(c.body));
  for (size_t i = 0; i < std::size(cases); ++i) {
    EXPECT_EQ(ReceiveBody(fd), "{\"success\":true}\n");
  }
  ASSERT_EQ(requests_.size(), std::size(cases));
  Json::FastWriter writer;
  for (size_t i = 0; i < std::size(cases); ++i) {
    EXPECT_EQ(writer.write(requests_[i]), std::string(cases[i].request) + "\n")
        << cases[i].body.substr(0, 40);
  }
}

// During a handler call the peer's credentials are known; outside, not.
TEST_F(EventServerTest, HandlerLearnsWhoIsAsking) {
  PeerCredentials seen = {-1, 0, 0};
  int result = 1;
  handler_ = [&](Json::Value&, Json::Value& reply) {
    result = GetPeerCredentials(&seen);
    reply["success"] = result == 0;
    return 0;
  };
  Start();
  int fd = Connect();
  Send(fd, Request("WHO"));
  EXPECT_EQ(ReceiveBody(fd), "{\"success\":true}\n");
  EXPECT_EQ(result, 0);
  EXPECT_EQ(seen.pid, getpid());
  EXPECT_EQ(seen.uid, getuid());
  EXPECT_EQ(seen.gid, getgid());
  PeerCredentials untouched = {-7, 0, 0};
  EXPECT_EQ(GetPeerCredentials(&untouched), -1);
  EXPECT_EQ(untouched.pid, -7);
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

// A listening socket at `path` that never accepts: a live daemon.
int Listen(const std::string& path) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) !=
          0 ||
      listen(fd, 4) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// Only a stale socket is replaced. Anything else at the path stays as it
// was: a regular file, a directory, a link, and above all a socket a daemon
// still listens on, whose clients would otherwise be taken over.
TEST_F(EventServerTest, OnlyAStaleSocketIsReplaced) {
  int live = Listen(dir_.File("live.sock"));
  ASSERT_GE(live, 0);
  close(Listen(dir_.File("stale.sock")));  // its daemon died
  close(open(dir_.File("file").c_str(), O_CREAT | O_WRONLY, 0600));
  mkdir(dir_.File("dir").c_str(), 0700);
  symlink(dir_.File("stale.sock").c_str(), dir_.File("link").c_str());
  const std::string in_use = " is in use: a daemon listens there";
  struct Case {
    const char* name;
    int result;
    std::string line;  // after "quvaidx_daemon:N [Error] " and the path
    mode_t type;       // what is at the path afterwards
  } cases[] = {
      {"absent.sock", 0, "", S_IFSOCK},    {"stale.sock", 0, "", S_IFSOCK},
      {"live.sock", -1, in_use, S_IFSOCK}, {"file", -1, "remove", S_IFREG},
      {"dir", -1, "remove", S_IFDIR},      {"link", -1, "remove", S_IFLNK},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string path = dir_.File(c.name);
    struct stat before = {};
    lstat(path.c_str(), &before);
    LogCapture log;
    EXPECT_EQ(BuildServer(base_, path.c_str(), &args_), c.result);
    EXPECT_EQ(g_listener != nullptr, c.result == 0);
    struct stat after = {};
    ASSERT_EQ(lstat(path.c_str(), &after), 0);
    EXPECT_EQ(after.st_mode & S_IFMT, c.type);
    if (c.result == 0) {
      EXPECT_TRUE(log.lines().empty());
      int client = ConnectPeer(path.c_str(), false, 1);  // ours now
      EXPECT_GE(client, 0);
      close(client);
      RunFor(5);
      StopServer(path.c_str());
      EXPECT_NE(access(path.c_str(), F_OK), 0);
      continue;
    }
    EXPECT_EQ(after.st_ino, before.st_ino);
    const std::string line =
        c.line == in_use ? path + c.line : c.line + " " + path;
    EXPECT_EQ(log.Normalized(),
              std::vector<std::string>{"quvaidx_daemon:N [Error] " + line});
  }
  close(live);
}

// An overlong path is refused, not cut: the file at the cut path stays. A
// second server is refused.
TEST_F(EventServerTest, OverlongPathAndSecondServer) {
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
  Start();
  std::string other = dir_.File("other.sock");  // a second server
  EXPECT_EQ(BuildServer(base_, other.c_str(), &args_), -1);
  EXPECT_NE(access(other.c_str(), F_OK), 0);
}

// Without an access record the socket file follows the umask; with one it
// gets the mode and group asked for, and is never created open to others.
TEST_F(EventServerTest, SocketModeAndGroup) {
  mode_t saved = umask(0);
  Start();
  struct stat st;
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0777u);
  StopServer(path_.c_str());
  gid_t group = getuid() == 0 ? 65534 : getgid();
  ServerSocketAccess wanted = {0660, group};
  ASSERT_EQ(BuildServerWithAccess(base_, path_.c_str(), &args_, &wanted), 0);
  ASSERT_EQ(stat(path_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0660u);
  EXPECT_EQ(st.st_gid, group);
  StopServer(path_.c_str());
  umask(saved);
  // A group the process may not give: refused, and the socket goes again.
  chmod(dir_.path().c_str(), 0777);
  EXPECT_EQ(quvaidx::test::RunUnprivileged([&] {
              struct event_base* base = event_base_new();
              ServerSocketAccess root_group = {0660, 0};
              int result = BuildServerWithAccess(base, path_.c_str(), &args_,
                                                 &root_group);
              bool gone = access(path_.c_str(), F_OK) != 0;
              event_base_free(base);
              return result == -1 && gone && g_listener == nullptr ? 0 : 1;
            }),
            0);
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
