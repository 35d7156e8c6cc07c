// Client connections against a scripted peer: attempt loops and their log
// lines, handshake, one-call exchanges, restarts, ownership of descriptors.
#include <errno.h>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "ipc/connect_timeout.h"
#include "quvaidx/ipc.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/scripted_peer.h"
#include "support/unprivileged.h"

namespace {

using quvaidx::test::FakeSleep;
using quvaidx::test::ListenUnix;
using quvaidx::test::LogCapture;
using quvaidx::test::ScriptedPeer;
using Lines = std::vector<std::string>;

const std::string kFailed = "quvaidx_ipc_core:N [Error] connect server: ";

Json::Value Command(const char* name) {
  Json::Value object(Json::objectValue);
  object["command"] = name;
  return object;
}

// Answers every request with {"success":true,"n":index,"echo":request}.
void AnswerAll(int& fd, int index) {
  for (Json::Value request; RecvPacket(fd, request) == 0;) {
    Json::Value reply(Json::objectValue);
    reply["success"] = true;
    reply["n"] = index;
    reply["echo"] = request;
    if (SendPacket(fd, reply) != 0) return;
  }
}

// Connects to `path` until its listen backlog is full; returns the
// connections, which the caller closes.
std::vector<int> FillBacklog(const std::string& path) {
  struct sockaddr_un address = quvaidx::test::UnixAddress(path);
  std::vector<int> queued;
  for (int i = 0; i < 8; ++i) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                sizeof(address)) != 0) {
      close(fd);
      break;
    }
    queued.push_back(fd);
  }
  return queued;
}

class ClientTest : public ::testing::Test {
 protected:
  void TearDown() override { EXPECT_TRUE(leaks_.NoLeak()); }

  quvaidx::test::FdLeakCheck leaks_;
  quvaidx::test::TempDir dir_;
  std::string path_ = dir_.File("daemon.sock");
  FakeSleep sleep_;
};

// One debug line and one sleep per failed attempt, then one error line;
// at the default level only the error line. A daemon whose backlog stays
// full costs each attempt the connect limit, and a line, not more.
TEST_F(ClientTest, EachFailedAttemptCostsOneSleepOrOneBoundedWait) {
  LogCapture log(7);
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 0), -1);
  EXPECT_EQ(ConnectPeer(path_.c_str(), true, -5), -1);
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 3), -1);
  EXPECT_EQ(sleep_.calls(), 3);
  EXPECT_EQ(sleep_.total_seconds(), 3u);
  EXPECT_EQ(log.Normalized(),
            (Lines{kFailed + path_, kFailed + path_, kFailed + "0, " + path_,
                   kFailed + "1, " + path_, kFailed + "2, " + path_,
                   kFailed + path_}));
  {
    LogCapture quiet;  // threshold 3
    EXPECT_EQ(ConnectPeer(path_.c_str(), false, 2), -1);
    EXPECT_EQ(quiet.Normalized(), Lines{kFailed + path_});
  }
  log.Clear();
  int daemon = ListenUnix(path_, 0);
  ASSERT_GE(daemon, 0);
  std::vector<int> queued = FillBacklog(path_);
  int previous = quvaidx::SetConnectTimeoutMs(50);
  auto start = std::chrono::steady_clock::now();
  alarm(10);  // a connect that waits for ever would end the test here
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 2), -1);
  alarm(0);
  auto waited = std::chrono::steady_clock::now() - start;
  quvaidx::SetConnectTimeoutMs(previous);
  EXPECT_GE(waited, std::chrono::milliseconds(90));
  EXPECT_LT(waited, std::chrono::seconds(2));
  EXPECT_EQ(sleep_.calls(), 5 + 2);
  EXPECT_EQ(log.Normalized(),
            (Lines{kFailed + "0, " + path_, kFailed + "1, " + path_,
                   kFailed + path_}));
  for (int fd : queued) close(fd);
  close(daemon);
}

// ConnectDaemon says why it failed, and connects only to root or this
// process's own user: a stranger who took the path gets nothing.
TEST_F(ClientTest, ConnectDaemonSaysWhyAndRefusesStrangers) {
  const std::string stale = dir_.File("stale.sock");
  close(ListenUnix(stale, 1));
  quvaidx::test::WriteFile(dir_.File("file"), "");
  int mine = ListenUnix(dir_.File("mine.sock"), 4);
  int stranger =
      quvaidx::test::ListenUnixAs(dir_.File("stranger.sock"), 4, 65534);
  int full = ListenUnix(dir_.File("full.sock"), 0);
  ASSERT_GE(mine, 0);
  ASSERT_GE(stranger, 0);
  std::vector<int> queued = FillBacklog(dir_.File("full.sock"));
  const std::pair<std::string, int> cases[] = {
      // path, errno (0: connected)
      {dir_.File("missing.sock"), ENOENT},
      {dir_.File("file"), ENOTSOCK},
      {stale, ECONNREFUSED},
      {dir_.File("full.sock"), ETIMEDOUT},
      {"/" + std::string(kMaxSocketPath, 'p'), ENAMETOOLONG},
      {dir_.File("stranger.sock"), EPERM},
      {dir_.File("mine.sock"), 0},
  };
  LogCapture log;
  for (const auto& [path, error] : cases) {
    errno = 0;
    int fd = ConnectDaemon(path.c_str(), 50);
    EXPECT_EQ(fd >= 0 ? 0 : errno, error) << path;
    if (fd >= 0) close(fd);
  }
  EXPECT_EQ(
      log.Normalized(),
      Lines{"quvaidx_ipc_core:N [Error] refused " + dir_.File("stranger.sock") +
            ": served by uid 65534 (pid " + std::to_string(getpid()) +
            "), neither root nor uid " + std::to_string(geteuid())});
  // A socket in a folder the caller cannot search: permission denied.
  ASSERT_EQ(chmod(dir_.path().c_str(), 0700), 0);
  EXPECT_EQ(quvaidx::test::RunUnprivileged([&] {
              return ConnectDaemon(dir_.File("mine.sock").c_str(), 50) < 0
                         ? errno
                         : 0;
            }),
            EACCES);
  EXPECT_EQ(quvaidx::test::RunWithSyscallsFailing(  // out of descriptors
                {{SYS_socket, EMFILE}},
                [&] {
                  return ConnectDaemon(dir_.File("mine.sock").c_str(), 50) < 0
                             ? errno
                             : 0;
                }),
            EMFILE);
  for (int fd : queued) close(fd);
  for (int fd : {mine, stranger, full}) close(fd);
}

// A daemon listening at the first 107 bytes of an overlong path must not be
// reached.
TEST_F(ClientTest, OverlongPathIsRefusedNotCut) {
  LogCapture log;
  std::string longest = "/tmp/" + std::string(kMaxSocketPath - 5, 'p');
  {
    ScriptedPeer peer(longest, AnswerAll);
    ASSERT_TRUE(peer.listening());
    EXPECT_EQ(ConnectPeer((longest + "q").c_str(), false, 3), -1);
    EXPECT_EQ(sleep_.calls(), 0);
    EXPECT_EQ(peer.served(), 0);
    int fd = ConnectPeer(longest.c_str(), false, 1);
    EXPECT_GE(fd, 0);
    DisconnectPeer(fd);
  }
  EXPECT_EQ(log.Normalized(),
            Lines{"quvaidx_ipc_core:N [Error] socket path too long: " +
                  longest + "q"});
}

// A reset restarts the exchange (answered on the second connection), at
// most kMaxExchangeRestarts times; a peer that hangs up fails the handshake
// on each attempt.
TEST_F(ClientTest, ResetRestartsTheExchangeAFewTimes) {
  LogCapture log(7);
  {
    ScriptedPeer peer(path_, [](int& fd, int index) {
      if (index > 0) AnswerAll(fd, index);
    });
    Json::Value value = Command("PING");
    ASSERT_EQ(AutoSendRecvPacket(path_.c_str(), -1, value, 1), 0);
    EXPECT_EQ(value["n"].asInt(), 1);
    EXPECT_EQ(value["echo"], Command("PING"));
  }
  ScriptedPeer peer(path_, [](int&, int) {});  // hangs up at once
  Json::Value value = Command("PING");
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), value, 1), -1);
  EXPECT_TRUE(value.empty());
  EXPECT_EQ(log.Count("quvaidx_ipc_core:N [Error] connection to " + path_ +
                      " lost 4 times, giving up"),
            1);
  while (peer.served() < kMaxExchangeRestarts + 1) usleep(1000);
  usleep(20 * 1000);
  EXPECT_EQ(peer.served(), kMaxExchangeRestarts + 1);
  FakeSleep sleep;
  EXPECT_EQ(ConnectPeer(path_.c_str(), true, 2), -1);
  EXPECT_EQ(sleep.calls(), 2);
  for (const char* n : {"0, ", "1, "}) {
    EXPECT_EQ(log.Count("quvaidx_ipc_core:N [Error] app level handshake: " +
                        std::string(n) + path_),
              1);
  }
}

// What an exchange leaves in the value: a failed one empties the request
// (scalars cannot be cleared in place and become null, without throwing); a
// notification, sent after a handshake, is nulled once it went out.
TEST_F(ClientTest, ExchangesLeaveTheValueEmptyOrNull) {
  Json::Value object = Command("X"), text("not an object"), number(5);
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), object, 1), -1);
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), text, 1), -1);
  EXPECT_EQ(AutoSendPacket(path_.c_str(), number, 1), -1);
  EXPECT_EQ(object, Json::Value(Json::objectValue));
  EXPECT_TRUE(text.isNull() && number.isNull());
  Json::Value received;
  ScriptedPeer peer(path_, [&](int& fd, int) {
    Json::Value request, reply(Json::objectValue);
    ASSERT_EQ(RecvPacket(fd, request), 0);
    SendPacket(fd, reply);
    ASSERT_EQ(RecvPacket(fd, received), 0);
  });
  Json::Value value = Command("NOTIFY");
  ASSERT_EQ(AutoSendPacket(path_.c_str(), value, 1), 0);
  EXPECT_TRUE(value.isNull());
  while (peer.served() < 1) usleep(1000);
  EXPECT_EQ(received, Command("NOTIFY"));
}

// The caller's descriptor is used (the path not looked at) and left open; a
// reset on it is reported as -2. A daemon started with its standard input
// closed gets connections on descriptor 0: disconnecting closes it too.
TEST_F(ClientTest, ExchangeOnCallersDescriptorAndDisconnectingIt) {
  ScriptedPeer peer(path_, AnswerAll);
  int fd = ConnectPeer(path_.c_str(), false, 1);
  ASSERT_GE(fd, 0);
  for (int i = 0; i < 2; ++i) {
    Json::Value value = Command("AGAIN");
    ASSERT_EQ(AutoSendRecvPacket(nullptr, fd, value, 0), 0);
    EXPECT_EQ(value["echo"], Command("AGAIN"));
  }
  EXPECT_NE(fcntl(fd, F_GETFD), -1);
  DisconnectPeer(fd);
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  close(fds[1]);
  Json::Value value = Command("X");
  EXPECT_EQ(AutoSendRecvPacketByFd(fds[0], value, 0), -2);
  EXPECT_TRUE(value.empty());
  int saved = dup(0);
  ASSERT_GE(saved, 0);
  ASSERT_EQ(dup2(fds[0], 0), 0);
  close(fds[0]);
  EXPECT_EQ(DisconnectPeer(0), 0);
  EXPECT_EQ(fcntl(0, F_GETFD), -1);
  EXPECT_EQ(DisconnectPeer(-1), 0);
  EXPECT_NE(fcntl(saved, F_GETFD), -1);
  dup2(saved, 0);
  close(saved);
}

}  // namespace
