// The event server in-process: a real event base and real client sockets on
// one thread, the loop driven step by step. Map: the fixture; requests and
// handlers; the socket file; running out of descriptors; peers that vanish,
// stall, half-close or hoard their replies; deferred replies.
#include "quvaidx/daemon.h"

#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <map>
#include <stdexcept>
#include <string>
#include <tuple>
#include <vector>

#include <event2/buffer.h>
#include <event2/bufferevent.h>
#include <event2/event.h>
#include <gtest/gtest.h>

#include "daemon/server_connections.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/scripted_peer.h"
#include "support/unprivileged.h"

namespace {

using quvaidx::test::ListenUnix;
using quvaidx::test::LogCapture;
using Clock = std::chrono::steady_clock;
using Handler = std::function<int(Json::Value&, Json::Value&)>;
using Lines = std::vector<std::string>;

const std::string kSuccess = "{\"success\":true}\n";
const std::string kTooLarge =
    "{\"reason\":\"reply too large\",\"success\":false}\n";
const std::string kError = "quvaidx_daemon:N [Error] ";

std::string Packet(const std::string& body) {
  const size_t n = body.size();
  return std::string("\x15\xbe", 2) + static_cast<char>(n >> 8) +
         static_cast<char>(n & 0xff) + body;
}

// `n` copies of the request for `command`, to be sent at once.
std::string Requests(const std::string& command, int n = 1) {
  std::string requests;
  for (int i = 0; i < n; ++i) {
    requests += Packet("{\"command\":\"" + command + "\"}\n");
  }
  return requests;
}

// `reply` `n` times over.
std::string Times(const std::string& reply, int n) {
  std::string all;
  for (int i = 0; i < n; ++i) all += reply;
  return all;
}

long long MsSince(Clock::time_point start) {
  return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() -
                                                               start)
      .count();
}

int Succeed(Json::Value&, Json::Value& reply) {
  reply = MakeResponse(true, nullptr);
  return 0;
}

// Replies {"blob":"bbb..."} of `size` b's; refuses the command `refused`.
Handler Blob(size_t size, const std::string& refused = "") {
  return [size, refused](Json::Value& request, Json::Value& reply) {
    reply["blob"] = std::string(size, 'b');
    return request["command"] == refused ? -1 : 0;
  };
}

// Replies {"echo":command}; refuses QUIT.
int Echo(Json::Value& request, Json::Value& reply) {
  reply["echo"] = request["command"];
  return request["command"] == "QUIT" ? -1 : 0;
}

// The server on a fresh event base; every request is recorded in requests_
// and answered by handler_ (none: an untouched reply).
class EventServerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    base_ = event_base_new();
    ASSERT_NE(base_, nullptr);
    args_ = {"testd", this,
             [](Json::Value& request, Json::Value& reply, EventArgs* args) {
               auto* self = static_cast<EventServerTest*>(args->context);
               self->requests_.push_back(request);
               return self->handler_ ? self->handler_(request, reply) : 0;
             }};
  }

  void TearDown() override {
    for (int fd : clients_) close(fd);
    clients_.clear();
    RunFor(5);  // let the server see the closes
    EXPECT_EQ(GetCurrentConnCount(), 0);
    StopServer(path_.c_str());
    SetServerLimits(nullptr);
    event_base_free(base_);
    EXPECT_TRUE(leaks_.NoLeak());
  }

  void Start(const ServerLimits* limits = nullptr) {
    SetServerLimits(limits);
    ASSERT_EQ(BuildServer(base_, path_.c_str(), &args_), 0);
  }

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

  void Drop(int fd) {  // closes a client before the test ends
    close(fd);
    clients_.erase(std::find(clients_.begin(), clients_.end(), fd));
  }

  void Send(int fd, const std::string& bytes) {
    ASSERT_EQ(write(fd, bytes.data(), bytes.size()),
              static_cast<ssize_t>(bytes.size()));
  }

  // Runs the loop without blocking until `done` holds or `ms` milliseconds
  // passed, at least once; returns whether it held.
  bool RunUntil(const std::function<bool()>& done, int ms) {
    const auto end = Clock::now() + std::chrono::milliseconds(ms);
    do {
      event_base_loop(base_, EVLOOP_NONBLOCK);
      usleep(200);
    } while (!done() && Clock::now() < end);
    return done();
  }

  void RunFor(int ms) {
    RunUntil([] { return false; }, ms);
  }

  // True when the server has closed fd; what it sent first is kept.
  bool ServerClosed(int fd) {
    char buf[65536];
    for (;;) {
      ssize_t got = recv(fd, buf, sizeof(buf), MSG_DONTWAIT);
      if (got == 0 || (got < 0 && errno == ECONNRESET)) return true;
      if (got < 0) return false;
      pending_[fd].append(buf, static_cast<size_t>(got));
    }
  }

  // Runs the loop until `n` bytes arrived on fd, the server closed it, or
  // `ms` milliseconds passed. Returns at most n bytes; the rest is kept.
  std::string Receive(int fd, size_t n, bool* closed = nullptr, int ms = 1000) {
    std::string& pending = pending_[fd];
    bool ended = false;
    RunUntil([&] { return (ended = ServerClosed(fd)) || pending.size() >= n; },
             ms);
    if (closed != nullptr) *closed = ended;
    std::string out = pending.substr(0, n);
    pending.erase(0, out.size());
    return out;
  }

  // Receives one reply packet and returns its body.
  std::string ReceiveBody(int fd, int ms = 1000) {
    std::string header = Receive(fd, 4, nullptr, ms);
    if (header.size() < 4) return "";
    return Receive(fd, (static_cast<unsigned char>(header[2]) << 8) |
                           static_cast<unsigned char>(header[3]));
  }

  std::string Ask(int fd, const std::string& command) {
    Send(fd, Requests(command));
    return ReceiveBody(fd);
  }

  // Sends bytes[*sent, end) on fd, running the loop, for as long as the
  // server takes them within `ms`; advances *sent.
  void SendAsTaken(int fd, const std::string& bytes, size_t* sent, int ms) {
    RunUntil(
        [&] {
          ssize_t n = send(fd, bytes.data() + *sent, bytes.size() - *sent,
                           MSG_DONTWAIT | MSG_NOSIGNAL);
          *sent += n > 0 ? static_cast<size_t>(n) : 0;
          return *sent == bytes.size();
        },
        ms);
  }

  // True when the server closed fd without sending anything more.
  bool ClosedSilently(int fd) {
    bool closed = false;
    return Receive(fd, 1, &closed).empty() && closed;
  }

  quvaidx::test::FdLeakCheck leaks_;
  quvaidx::test::TempDir dir_;
  std::string path_ = dir_.File("testd.sock");
  struct event_base* base_ = nullptr;
  EventArgs args_{};
  Handler handler_;
  std::vector<Json::Value> requests_;
  std::vector<int> clients_;
  std::map<int, std::string> pending_;
};

// A request in pieces reaches the handler once, after its last byte; a body
// the JSON reader rejects arrives as {}, never half read; a reply left alone
// goes out as {}; pipelined requests are answered at once, in order; a
// refusal closes after the earlier replies; other connections go on.
TEST_F(EventServerTest, RequestsAreFramedParsedAnsweredInOrderOrRefused) {
  handler_ = Succeed;
  Start();
  int fd = Connect(), other = Connect();
  const std::string packet = Requests("HANDSHAKE");
  for (size_t i = 0; i + 1 < packet.size(); ++i) {
    Send(fd, packet.substr(i, 1));
    RunFor(1);
  }
  EXPECT_TRUE(requests_.empty());
  Send(fd, packet.substr(packet.size() - 1));
  EXPECT_EQ(Receive(fd, 21), std::string("\x15\xbe\x00\x11", 4) + kSuccess);
  ASSERT_EQ(requests_.size(), 1u);
  EXPECT_EQ(requests_[0]["command"].asString(), "HANDSHAKE");
  const std::pair<std::string, std::string> bodies[] = {
      // body, and the request as the handler saw it
      {"{\"command\":\"ECHO\",\"x\":1", "{}"},  // truncated
      {"[\"ECHO\"", "{}"},
      {"plain words", "{}"},
      {"", "{}"},
      {std::string(5000, '['), "{}"},  // nested too deeply: the reader throws
      {"{\"command\":\"ECHO\"} and more", "{\"command\":\"ECHO\"}"},
      {"7", "7"}};
  for (const auto& [body, seen] : bodies) {
    requests_.clear();
    Send(fd, Packet(body));
    EXPECT_EQ(ReceiveBody(fd), kSuccess);
    ASSERT_EQ(requests_.size(), 1u);
    EXPECT_EQ(Json::FastWriter().write(requests_[0]), seen + "\n")
        << body.substr(0, 40);
  }
  handler_ = nullptr;
  EXPECT_EQ(Ask(fd, "UNTOUCHED"), "{}\n");
  handler_ = Echo;
  Send(fd,
       Requests("ONE") + Requests("TWO") + Requests("QUIT") + Requests("NO"));
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"ONE\"}\n");
  EXPECT_EQ(ReceiveBody(fd), "{\"echo\":\"TWO\"}\n");
  EXPECT_TRUE(ClosedSilently(fd));
  EXPECT_EQ(requests_.size(), 5u);
  EXPECT_EQ(GetCurrentConnCount(), 1);
  EXPECT_EQ(Ask(other, "STILL_HERE"), "{\"echo\":\"STILL_HERE\"}\n");
}

// The handler learns who is asking (nobody, outside its calls): process,
// user, group and every group it holds, not those the database gives.
TEST_F(EventServerTest, HandlerLearnsThePeerAndTheGroupsItHolds) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to make a peer of groups";
  std::vector<gid_t> seen;
  PeerCredentials peer = {};
  handler_ = [&](Json::Value& request, Json::Value& reply) {
    EXPECT_EQ(GetPeerGroups(&seen), 0);
    EXPECT_EQ(GetPeerCredentials(&peer), 0);
    return Succeed(request, reply);
  };
  ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
  const ServerSocketAccess open_to_all = {0666, static_cast<gid_t>(-1)};
  ASSERT_EQ(BuildServerWithAccess(base_, path_.c_str(), &args_, &open_to_all),
            0);
  // Fewer groups than a first guess of the count, and more.
  for (gid_t last : {48303, 48400}) {
    std::vector<gid_t> groups;
    for (gid_t gid = 48301; gid <= last; ++gid) groups.push_back(gid);
    requests_.clear();
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {  // no gtest here: the exit status says how it went
      if (setgroups(groups.size(), groups.data()) != 0 ||
          setresgid(48211, 48211, 48211) != 0 ||
          setresuid(48211, 48211, 48211) != 0) {
        _exit(2);
      }
      int fd = ConnectPeer(path_.c_str(), false, 1);
      Json::Value request(Json::objectValue);
      request["command"] = "WHO";
      _exit(fd >= 0 && AutoSendRecvPacketByFd(fd, request, 0) == 0 ? 0 : 1);
    }
    RunUntil([&] { return !requests_.empty(); }, 3000);
    RunFor(20);
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(seen, groups);
    EXPECT_TRUE(peer.uid == 48211 && peer.gid == 48211 && peer.pid == child);
  }
  std::vector<gid_t> outside = {1};
  EXPECT_EQ(GetPeerGroups(&outside), -1);
  EXPECT_EQ(outside, std::vector<gid_t>{1});
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
  Send(boom, Requests("BOOM"));
  EXPECT_TRUE(ClosedSilently(boom));
  EXPECT_EQ(log.Normalized(), Lines{kError + "[testd] handler threw: bad day"});
  handler_ = Blob(20000);
  EXPECT_EQ(Ask(Connect(), "BIG"), kTooLarge);
  int fd = Connect();
  Send(fd, std::string("\x15\xbe\x40\x00{}", 6));  // announces 16384 bytes
  EXPECT_TRUE(ClosedSilently(fd));
  EXPECT_EQ(requests_.size(), 2u);
  EXPECT_EQ(GetCurrentConnCount(), 1);
  EXPECT_EQ(log.lines().size(), 3u);
}

// Only a stale socket is replaced; anything else stays, above all a socket
// a daemon still listens on, whose clients would otherwise be taken over.
TEST_F(EventServerTest, OnlyAStaleSocketIsReplaced) {
  int live = ListenUnix(dir_.File("live.sock"), 4);
  ASSERT_GE(live, 0);
  close(ListenUnix(dir_.File("stale.sock"), 4));  // its daemon died
  close(open(dir_.File("file").c_str(), O_CREAT | O_WRONLY, 0600));
  mkdir(dir_.File("dir").c_str(), 0700);
  symlink(dir_.File("stale.sock").c_str(), dir_.File("link").c_str());
  const std::string in_use = " is in use: a daemon listens there";
  const std::string other = " is not a socket; left alone";
  // name, result, log line after the path, errno, what is there afterwards
  const std::tuple<const char*, int, std::string, int, mode_t> cases[] = {
      {"absent.sock", 0, "", 0, S_IFSOCK},
      {"stale.sock", 0, "", 0, S_IFSOCK},
      {"live.sock", -1, in_use, EADDRINUSE, S_IFSOCK},
      {"file", -1, other, EEXIST, S_IFREG},
      {"dir", -1, other, EEXIST, S_IFDIR},
      {"link", -1, other, EEXIST, S_IFLNK},
  };
  for (const auto& [name, result, line, error, type] : cases) {
    SCOPED_TRACE(name);
    const std::string path = dir_.File(name);
    struct stat before = {}, after = {};
    lstat(path.c_str(), &before);
    LogCapture log;
    errno = 0;
    EXPECT_EQ(BuildServer(base_, path.c_str(), &args_), result);
    EXPECT_EQ(result == 0 ? 0 : errno, error);
    EXPECT_EQ(g_listener != nullptr, result == 0);
    ASSERT_EQ(lstat(path.c_str(), &after), 0);
    EXPECT_EQ(after.st_mode & S_IFMT, type);
    EXPECT_TRUE(result == 0 || after.st_ino == before.st_ino);
    EXPECT_EQ(log.Normalized(),
              result == 0 ? Lines{} : Lines{kError + path + line});
    if (result == 0) StopServer(path.c_str());
  }
  close(live);
  LogCapture log;  // nowhere to bind
  const std::string nowhere = dir_.File("none/d.sock");
  EXPECT_EQ(BuildServer(base_, nowhere.c_str(), &args_), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(log.Normalized(), Lines{kError + "Could not create a listener: " +
                                    nowhere + " (No such file or directory)"});
  const std::string refused = dir_.File("refused.sock");  // listen() fails
  EXPECT_EQ(quvaidx::test::RunWithSyscallsFailing(
                {{SYS_listen, EACCES}},
                [&] {
                  return BuildServer(base_, refused.c_str(), &args_) == -1
                             ? errno
                             : 0;
                }),
            EACCES);
  EXPECT_NE(access(refused.c_str(), F_OK), 0);  // its socket file removed
}

// A socket handed over is served only when it is a listening Unix stream
// socket bound to the expected path; the server closes its descriptor when
// it stops but never removes the file, which belongs to whoever bound it.
TEST_F(EventServerTest, HandedOverSocketIsCheckedAndItsFileKept) {
  int pipe_ends[2];
  ASSERT_EQ(pipe(pipe_ends), 0);
  const std::tuple<const char*, int, int> refused[] = {
      {"pipe", pipe_ends[0], ENOTSOCK},
      {"datagram", socket(AF_UNIX, SOCK_DGRAM, 0), EINVAL},
      {"not listening", socket(AF_UNIX, SOCK_STREAM, 0), EINVAL},
      {"other path", ListenUnix(dir_.File("elsewhere.sock"), 4),
       EADDRNOTAVAIL}};
  for (const auto& [name, fd, error] : refused) {
    SCOPED_TRACE(name);
    LogCapture log;
    errno = 0;
    EXPECT_EQ(BuildServerOnSocket(base_, fd, path_.c_str(), &args_), -1);
    EXPECT_EQ(errno, error);
    EXPECT_EQ(g_listener, nullptr);
    EXPECT_EQ(fcntl(fd, F_GETFL) & O_NONBLOCK, 0) << "the descriptor changed";
    EXPECT_EQ(log.lines().size(), 1u);
    close(fd);
  }
  close(pipe_ends[1]);
  int handed = ListenUnix(path_, 4);
  ASSERT_EQ(BuildServerOnSocket(base_, handed, path_.c_str(), &args_), 0);
  EXPECT_NE(fcntl(handed, F_GETFL) & O_NONBLOCK, 0);
  EXPECT_EQ(Ask(Connect(), "HANDSHAKE"), "{}\n");
  StopServer(path_.c_str());
  struct stat st;
  EXPECT_EQ(lstat(path_.c_str(), &st), 0) << "the manager's socket was removed";
  EXPECT_EQ(fcntl(handed, F_GETFD), -1) << "the descriptor was not closed";
  // A server built later on its own socket removes it again.
  unlink(path_.c_str());
  Start();
  StopServer(path_.c_str());
  EXPECT_NE(lstat(path_.c_str(), &st), 0);
}

// An overlong path is refused, not cut: the file at the cut path stays. A
// second server is refused. An accept error other than running out of
// descriptors is logged and ends the loop; the listener stays.
TEST_F(EventServerTest, OverlongPathSecondServerAndAcceptError) {
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
  std::string other = dir_.File("other.sock");
  EXPECT_EQ(BuildServer(base_, other.c_str(), &args_), -1);
  EXPECT_NE(access(other.c_str(), F_OK), 0);
  log.Clear();
  errno = EINVAL;
  OnAcceptError(g_listener, &args_);
  EXPECT_EQ(event_base_dispatch(base_), 0);  // returns at once
  EXPECT_EQ(log.Normalized(),
            Lines{kError + "OnAcceptError: 22, Invalid argument"});
  EXPECT_NE(g_listener, nullptr);
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

// Out of descriptors, accepting pauses and resumes; when connections stalled
// in a request hold the descriptors, the longest waiting are given up, so a
// client that then asks is answered long before any deadline.
TEST_F(EventServerTest, RunningOutOfDescriptorsLocksNoClientOut) {
  LogCapture log;
  handler_ = Succeed;
  const ServerLimits limits = {30000, 30000, kMaxTotalPendingOutput};
  Start(&limits);
  struct rlimit saved;
  getrlimit(RLIMIT_NOFILE, &saved);
  std::vector<int> filler;
  auto exhaust = [&](size_t spare) {  // takes all descriptors but `spare`
    struct rlimit low = {256, saved.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &low), 0);
    for (int d; (d = dup(0)) >= 0;) filler.push_back(d);
    for (; spare > 0; --spare, filler.pop_back()) close(filler.back());
  };
  auto restore = [&] {
    for (int d : filler) close(d);
    filler.clear();
    setrlimit(RLIMIT_NOFILE, &saved);
  };
  const std::string accept_failed =
      kError + "accept: 24, Too many open files; ";
  int fd = RawConnect();
  exhaust(0);
  RunFor(20);
  EXPECT_EQ(GetCurrentConnCount(), 0);
  EXPECT_EQ(log.Count(accept_failed + "pausing for 100 ms"), 1);
  restore();
  Send(fd, Requests("HANDSHAKE"));
  EXPECT_EQ(ReceiveBody(fd, 3000), kSuccess);
  for (int i = 0; i < 40; ++i) Send(Connect(), std::string("\x15\xbe", 2));
  RunFor(150);  // all accepted, and stalled for longer than a pause
  ASSERT_EQ(GetCurrentConnCount(), 41);
  exhaust(1);  // room for one more client
  EXPECT_EQ(Ask(RawConnect(), "HELLO"), kSuccess);
  restore();
  EXPECT_EQ(log.Count(accept_failed + "closed 16 stalled connections"), 1);
  EXPECT_EQ(GetCurrentConnCount(), 41 + 1 - 16);
}

// Replies to a client that does not read are bounded, and all sent, in
// order, once it reads, big ones (4 MB) and many small ones, though it shut
// down its sending side after its requests; then the server closes.
TEST_F(EventServerTest, RepliesToASlowHalfClosedClientAreBoundedAndAllSent) {
  Start();
  for (const auto& [blob_size, count] :
       {std::pair(10000, 400), std::pair(0, 20000)}) {
    handler_ = Blob(blob_size);
    requests_.clear();
    const std::string requests = Requests("R", count);
    int fd = Connect();
    size_t sent = 0;  // everything goes out before the client reads a byte
    SendAsTaken(fd, requests, &sent, 10000);
    ASSERT_EQ(shutdown(fd, SHUT_WR), 0);
    RunFor(50);
    // Served: what fits the pending-output bound plus the socket buffers.
    if (blob_size > 0) {
      EXPECT_LT(requests_.size(), static_cast<size_t>(count));
      EXPECT_LT(requests_.size() * blob_size,
                kMaxPendingOutput + 2 * 1024 * 1024);
    }
    const std::string replies = Times(
        Packet("{\"blob\":\"" + std::string(blob_size, 'b') + "\"}\n"), count);
    bool closed = false;
    const std::string received =
        Receive(fd, replies.size() + 1, &closed, 10000);
    EXPECT_TRUE(closed);
    EXPECT_EQ(requests_.size(), static_cast<size_t>(count));
    EXPECT_TRUE(received == replies) << received.size();
    EXPECT_EQ(GetCurrentConnCount(), 0);
  }
}

// A request that trickles in is closed at the packet deadline counted from
// its first byte; a silent connection at the idle deadline; a client that
// keeps asking, or keeps taking its replies however slowly, never.
TEST_F(EventServerTest, StalledPeersAreClosedAtTheirDeadlines) {
  const ServerLimits limits = {150, 400, kMaxTotalPendingOutput};
  handler_ = [](Json::Value& request, Json::Value& reply) {
    return Blob(request["command"] == "BIG" ? 10000 : 1)(request, reply);
  };
  Start(&limits);
  LogCapture log(6);
  int trickle = Connect(), silent = Connect(), good = Connect();
  int slow = Connect();
  Send(slow, Requests("BIG", 400));  // 4 MB of replies, read 1 MB a second
  char sink[32 * 1024];
  const auto start = Clock::now();
  Send(trickle, std::string("\x15\xbe\x00\x64{", 5));  // 100 bytes announced
  long long trickle_closed = -1, silent_closed = -1;
  int answered = 0, asked = 0;
  for (int round = 0; MsSince(start) < 1000; ++round) {
    RunFor(25);
    EXPECT_GT(recv(slow, sink, sizeof(sink), MSG_DONTWAIT), 0);
    if (trickle_closed < 0) {
      send(trickle, " ", 1, MSG_DONTWAIT | MSG_NOSIGNAL);
      if (ServerClosed(trickle)) trickle_closed = MsSince(start);
    }
    if (silent_closed < 0 && ServerClosed(silent)) {
      silent_closed = MsSince(start);
    }
    if (round % 4 == 0) {
      ++asked;
      answered += Ask(good, "PING") == "{\"blob\":\"b\"}\n";
    }
  }
  EXPECT_TRUE(trickle_closed >= 140 && trickle_closed < 400) << trickle_closed;
  EXPECT_TRUE(silent_closed >= 390 && silent_closed < 1000) << silent_closed;
  EXPECT_FALSE(ServerClosed(good));
  EXPECT_EQ(answered, asked);
  EXPECT_GE(answered, 8);
  EXPECT_EQ(GetCurrentConnCount(), 2);
  for (const char* counts : {"1 in a request for over 150 ms, 0",
                             "0 in a "
                             "request for over 150 ms, 1"}) {
    EXPECT_EQ(log.Count("quvaidx_daemon:N [testd] closed 1 stalled "
                        "connections: " +
                        std::string(counts) + " waiting for over 400 ms"),
              1);
  }
}

// A finishing connection (a refusal after replies that did not all fit the
// socket) whose client goes away is closed on the write error, not left to
// the idle deadline, and raises no SIGPIPE, which would end the daemon.
TEST_F(EventServerTest, ErrorOnAFinishingConnectionClosesIt) {
  signal(SIGPIPE, SIG_DFL);
  handler_ = Blob(8000, "QUIT");
  Start();
  int fd = Connect();
  Send(fd, Requests("BIG", 60) + Requests("QUIT"));
  ASSERT_TRUE(RunUntil([&] { return requests_.size() == 61; }, 2000));
  ASSERT_EQ(GetCurrentConnCount(), 1);  // still writing its replies
  Drop(fd);
  EXPECT_TRUE(RunUntil([] { return GetCurrentConnCount() == 0; }, 2000));
  struct sigaction action;
  sigaction(SIGPIPE, nullptr, &action);
  EXPECT_EQ(action.sa_handler, SIG_IGN);
  StopServer(path_.c_str());  // a disposition the daemon chose itself stays
  void (*own)(int) = [](int) {};
  signal(SIGPIPE, own);
  Start();
  sigaction(SIGPIPE, nullptr, &action);
  EXPECT_EQ(action.sa_handler, own);
  signal(SIGPIPE, SIG_IGN);
}

// However many clients leave their replies unread, the unsent replies of
// all connections stay within the bound: the connection holding the most
// goes. Others are still served.
TEST_F(EventServerTest, UnsentRepliesOfAllConnectionsAreBounded) {
  const size_t kBound = 1 << 20;
  const ServerLimits limits = {kPacketDeadlineMs, kIdleDeadlineMs, kBound};
  handler_ = Blob(4000);
  Start(&limits);
  LogCapture log;
  const std::string burst = Requests("R", 100);  // more than a socket holds
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
  EXPECT_TRUE(peak <= kBound && peak > kBound / 2) << peak;
  int closed = 0;
  for (const std::string& line : log.Normalized()) {
    closed += line.rfind(kError +
                             "[testd] unsent replies over 1048576 bytes in "
                             "all: closed fd = ",
                         0) == 0;
  }
  EXPECT_EQ(static_cast<size_t>(closed), log.lines().size());
  EXPECT_GT(closed, kClients / 2);
  EXPECT_EQ(GetCurrentConnCount(), kClients - closed);
  handler_ = Succeed;
  EXPECT_EQ(Ask(Connect(), "STILL_THERE"), kSuccess);
  for (int fd : clients_) close(fd);
  clients_.clear();
  EXPECT_TRUE(RunUntil([] { return GetCurrentConnCount() == 0; }, 5000));
  EXPECT_EQ(quvaidx::PendingOutputTotal(), 0u);
}

// A handler that takes every "SLOW" request's reply away, kept in
// deferred_, and echoes the others.
class DeferredReplyTest : public EventServerTest {
 protected:
  void SetUp() override {
    EventServerTest::SetUp();
    handler_ = [this](Json::Value& request, Json::Value& reply) {
      if (request["command"] != "SLOW") return Echo(request, reply);
      deferred_.push_back(DeferReply());
      EXPECT_NE(deferred_.back(), nullptr);
      return 0;
    };
  }

  // Sends the oldest deferred reply: {"late": n}.
  int Answer(int n) {
    Json::Value late(Json::objectValue);
    late["late"] = n;
    DeferredReply* deferred = deferred_.front();
    deferred_.erase(deferred_.begin());
    return SendDeferredReply(deferred, &late);
  }

  std::vector<DeferredReply*> deferred_;
};

// While a reply is deferred, other connections are answered; the
// connection's own later requests wait, unseen by the handler, and are
// answered in order after the late reply, however many arrive meanwhile.
TEST_F(DeferredReplyTest, RepliesKeepTheirOrderPerConnection) {
  Start();
  int slow = Connect(), other = Connect();
  const int kLater = 30000;  // about 750 KB of requests
  std::string requests = Requests("SLOW") + Requests("LATER", kLater);
  size_t sent = 0;
  SendAsTaken(slow, requests, &sent, 300);
  EXPECT_LT(sent, requests.size());  // the server stopped reading
  EXPECT_EQ(Ask(other, "OTHER"), "{\"echo\":\"OTHER\"}\n");
  ASSERT_EQ(deferred_.size(), 1u);
  EXPECT_EQ(requests_.size(), 2u);  // nothing of `slow` after its SLOW
  EXPECT_EQ(Receive(slow, 1, nullptr, 50), "");
  EXPECT_EQ(Answer(1), 0);
  EXPECT_EQ(ReceiveBody(slow), "{\"late\":1}\n");
  const std::string replies = Times(Packet("{\"echo\":\"LATER\"}\n"), kLater);
  std::string received;
  RunUntil(
      [&] {
        SendAsTaken(slow, requests, &sent, 1);
        received += Receive(slow, replies.size() - received.size(), nullptr, 1);
        return received.size() == replies.size();
      },
      5000);
  EXPECT_EQ(sent, requests.size());
  EXPECT_TRUE(received == replies) << received.size();
}

// A peer that ends its stream while its reply is deferred still gets that
// reply and the answers to what it sent before, then the close. A late
// reply to a connection that has gone (its peer left, its idle deadline
// passed, the handler ended it) is dropped and its handle freed.
TEST_F(DeferredReplyTest, LateRepliesReachHalfClosedPeersAndNobodyElse) {
  const ServerLimits limits = {kPacketDeadlineMs, 300, kMaxTotalPendingOutput};
  Start(&limits);
  int half = Connect();
  Send(half, Requests("SLOW") + Requests("AFTER") + Requests("SLOW"));
  ASSERT_EQ(shutdown(half, SHUT_WR), 0);
  RunFor(20);
  ASSERT_EQ(deferred_.size(), 1u);
  EXPECT_EQ(Answer(1), 0);
  EXPECT_EQ(ReceiveBody(half), "{\"late\":1}\n");
  EXPECT_EQ(ReceiveBody(half), "{\"echo\":\"AFTER\"}\n");
  ASSERT_EQ(deferred_.size(), 1u);
  EXPECT_EQ(Answer(2), 0);
  EXPECT_EQ(ReceiveBody(half), "{\"late\":2}\n");
  EXPECT_TRUE(ClosedSilently(half));
  int leaving = Connect(), idle = Connect();
  Send(leaving, Requests("SLOW"));
  Send(idle, Requests("SLOW"));
  RunFor(20);
  Drop(leaving);
  EXPECT_TRUE(RunUntil([] { return GetCurrentConnCount() == 0; }, 1500));
  EXPECT_TRUE(ClosedSilently(idle));  // the idle deadline holds meanwhile
  EXPECT_EQ(Answer(3), -1);
  EXPECT_EQ(Answer(4), -1);
  int ended = Connect();
  handler_ = [&](Json::Value&, Json::Value&) {
    deferred_.push_back(DeferReply());
    return -1;
  };
  Send(ended, Requests("SLOW"));
  EXPECT_TRUE(ClosedSilently(ended));
  ASSERT_EQ(deferred_.size(), 1u);
  EXPECT_EQ(Answer(5), -1);
}

// Deferring works only inside a handler, once per request; a late reply is
// sent from the loop, not from a handler; a null one ends the connection as
// a refusal does; one too large for a packet is replaced, as any reply is.
TEST_F(DeferredReplyTest, MisusesAreRefusedAndNullOrHugeRepliesHandled) {
  LogCapture log;
  EXPECT_EQ(DeferReply(), nullptr);
  Json::Value reply(Json::objectValue);
  EXPECT_EQ(SendDeferredReply(nullptr, &reply), -1);
  Start();
  handler_ = [&](Json::Value&, Json::Value&) {
    deferred_.push_back(DeferReply());
    EXPECT_EQ(DeferReply(), nullptr);
    Json::Value now(Json::objectValue);
    EXPECT_EQ(SendDeferredReply(deferred_.back(), &now), -1);  // untouched
    return 0;
  };
  int fd = Connect();
  Send(fd, Requests("SLOW"));
  RunFor(10);
  ASSERT_EQ(deferred_.size(), 1u);
  EXPECT_EQ(Receive(fd, 1, nullptr, 20), "");
  Json::Value huge(Json::objectValue);
  huge["blob"] = std::string(20000, 'b');
  EXPECT_EQ(SendDeferredReply(deferred_.back(), &huge), 0);
  EXPECT_EQ(ReceiveBody(fd), kTooLarge);
  Send(fd, Requests("SLOW"));
  RunFor(10);
  ASSERT_EQ(deferred_.size(), 2u);
  EXPECT_EQ(SendDeferredReply(deferred_.back(), nullptr), 0);
  EXPECT_TRUE(ClosedSilently(fd));
  EXPECT_EQ(log.lines().size(), 7u);  // each refusal, the reply too large
}

}  // namespace

// The packet functions a daemon may use on connections of its own: a packet
// is whole only once all its announced bytes are there (nothing is taken
// while waiting), exactly one is taken at a time, a body the reader rejects
// leaves the destination alone, and a reply is queued as one whole packet.
TEST(BuffereventPacketTest, CheckTakeAndQueueOnePacketAtATime) {
  struct event_base* base = event_base_new();
  struct bufferevent* pair[2];
  ASSERT_EQ(bufferevent_pair_new(base, 0, pair), 0);
  struct bufferevent* bev = pair[1];  // what pair[0] writes, bev reads
  bufferevent_enable(bev, EV_READ);
  struct evbuffer* input = bufferevent_get_input(bev);
  auto add = [&](const std::string& bytes) {
    bufferevent_write(pair[0], bytes.data(), bytes.size());
  };
  LogCapture log(6);
  const std::string first = Packet("{\"n\":1}\n");
  add(first.substr(0, 3));
  EXPECT_EQ(CheckBufferevent(bev), 0);
  add(first.substr(3, 3));
  EXPECT_EQ(CheckBufferevent(bev), 0);
  add(first.substr(6) + Packet("{bad") + Packet("{\"n\":2}"));
  EXPECT_EQ(CheckBufferevent(bev), 1);
  EXPECT_EQ(log.Normalized(),
            (Lines{"quvaidx_daemon:N bufferevent at least 4 bytes [3 bytes]",
                   "quvaidx_daemon:N bufferevent hasn't arrived completely, "
                   "and wait [arrived=6, total=12]"}));
  Json::Value value(7);
  for (int expected : {1, 1, 2}) {  // the rejected body changes nothing
    ASSERT_EQ(RecvPacketEv(bev, value), 0);
    EXPECT_EQ(value.get("n", 0), expected);
  }
  EXPECT_EQ(evbuffer_get_length(input), 0u);
  add(std::string("\x15\xbe\x00\x05{}", 6));  // fewer bytes than announced
  EXPECT_EQ(RecvPacketEv(bev, value), -1);
  add(std::string("\x15\xbe\xff\xff", 4));  // more than a packet carries
  EXPECT_EQ(RecvPacketEv(bev, value), -1);

  Json::Value reply = MakeResponse(true, nullptr);
  EXPECT_EQ(SendPacketEv(bev, reply), 0);
  Json::Value huge;
  huge["blob"] = std::string(kMaxSendBody, 'b');
  EXPECT_EQ(SendPacketEv(bev, huge), -1);
  bufferevent_enable(pair[0], EV_READ);
  event_base_loop(base, EVLOOP_NONBLOCK);
  char queued[64] = {};
  const size_t n = bufferevent_read(pair[0], queued, sizeof queued);
  EXPECT_EQ(std::string(queued, n), Packet(kSuccess));  // and nothing more
  bufferevent_free(pair[0]);
  bufferevent_free(bev);
  event_base_free(base);
}
