// Client connections against a scripted peer: attempt loops and their log
// lines, handshake, one-call exchanges, restarts, ownership of descriptors.
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/ipc.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/scripted_peer.h"

namespace {

using quvaidx::test::FakeSleep;
using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;
using quvaidx::test::ScriptedPeer;
using quvaidx::test::TempDir;

Json::Value Object(const char* key, const char* value) {
  Json::Value object(Json::objectValue);
  object[key] = value;
  return object;
}

// Answers every request on the connection with {"success":true,"n":index}.
void AnswerAll(int& fd, int index) {
  Json::Value request;
  while (RecvPacket(fd, request) == 0) {
    Json::Value reply(Json::objectValue);
    reply["success"] = true;
    reply["n"] = index;
    reply["echo"] = request;
    if (SendPacket(fd, reply) != 0) return;
    request = Json::Value();
  }
}

// Closes at once without reading: the client sees a broken pipe or a reset.
void Hangup(int&, int) {}

class ClientTest : public ::testing::Test {
 protected:
  void TearDown() override { EXPECT_TRUE(leaks_.NoLeak()); }

  FdLeakCheck leaks_;
  TempDir dir_;
  std::string path_ = dir_.File("daemon.sock");
  FakeSleep sleep_;
};

// One debug line and one sleep per failed attempt, then one error line;
// at the default level only the error line.
TEST_F(ClientTest, NoDaemonCostsOneSleepPerAttempt) {
  LogCapture log(7);
  const std::string last =
      "quvaidx_ipc_core:N [Error] connect server: " + path_;
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 0), -1);
  EXPECT_EQ(ConnectPeer(path_.c_str(), true, -5), -1);
  EXPECT_EQ(sleep_.calls(), 0);
  EXPECT_EQ(log.Normalized(), (std::vector<std::string>{last, last}));
  log.Clear();
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 3), -1);
  EXPECT_EQ(sleep_.calls(), 3);
  EXPECT_EQ(sleep_.total_seconds(), 3u);
  std::vector<std::string> expected;
  for (int i = 0; i < 3; ++i) {
    expected.push_back("quvaidx_ipc_core:N [Error] connect server: " +
                       std::to_string(i) + ", " + path_);
  }
  expected.push_back(last);
  EXPECT_EQ(log.Normalized(), expected);
  LogCapture quiet;  // threshold 3
  EXPECT_EQ(ConnectPeer(path_.c_str(), false, 2), -1);
  EXPECT_EQ(quiet.Normalized(), std::vector<std::string>{last});
}

TEST_F(ClientTest, OverlongPathIsRefusedNotCut) {
  LogCapture log;
  std::string longest = "/tmp/" + std::string(kMaxSocketPath - 5, 'p');
  std::string too_long = longest + "q";
  {
    // A daemon listening at the first 107 bytes must not be reached.
    ScriptedPeer peer(longest, AnswerAll);
    ASSERT_TRUE(peer.listening());
    EXPECT_EQ(ConnectPeer(too_long.c_str(), false, 3), -1);
    EXPECT_EQ(sleep_.calls(), 0);
    EXPECT_EQ(peer.served(), 0);
    int fd = ConnectPeer(longest.c_str(), false, 1);
    EXPECT_GE(fd, 0);
    DisconnectPeer(fd);
  }
  EXPECT_EQ(
      log.Normalized(),
      std::vector<std::string>{
          "quvaidx_ipc_core:N [Error] socket path too long: " + too_long});
}

TEST_F(ClientTest, PeerThatHangsUpFailsTheHandshakeEachAttempt) {
  LogCapture log(7);
  ScriptedPeer peer(path_, Hangup);
  EXPECT_EQ(ConnectPeer(path_.c_str(), true, 2), -1);
  EXPECT_EQ(sleep_.calls(), 2);
  for (const char* n : {"0, ", "1, "}) {
    EXPECT_EQ(log.Count(std::string("quvaidx_ipc_core:N [Error] app level "
                                    "handshake: ") +
                        n + path_),
              1);
  }
}

// A failed exchange empties the request; scalars cannot be cleared in
// place and become null, without throwing.
TEST_F(ClientTest, FailedExchangeEmptiesTheRequest) {
  Json::Value object = Object("command", "X");
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), object, 1), -1);
  EXPECT_TRUE(object.isObject() && object.empty());
  Json::Value text("not an object");
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), text, 1), -1);
  EXPECT_TRUE(text.isNull());
  Json::Value number(5);
  EXPECT_EQ(AutoSendPacket(path_.c_str(), number, 1), -1);
  EXPECT_TRUE(number.isNull());
}

// A reset restarts the exchange (answered on the second connection), at
// most kMaxExchangeRestarts times.
TEST_F(ClientTest, ResetRestartsTheExchangeAFewTimes) {
  LogCapture log;
  {
    ScriptedPeer peer(path_, [](int& fd, int index) {
      if (index > 0) AnswerAll(fd, index);
    });
    Json::Value value = Object("command", "PING");
    ASSERT_EQ(AutoSendRecvPacket(path_.c_str(), -1, value, 1), 0);
    EXPECT_EQ(value["n"].asInt(), 1);
    EXPECT_EQ(value["echo"], Object("command", "PING"));
  }
  ScriptedPeer peer(path_, Hangup);
  Json::Value value = Object("command", "PING");
  EXPECT_EQ(AutoSendRecvPacketBySocketPath(path_.c_str(), value, 1), -1);
  EXPECT_TRUE(value.empty());
  EXPECT_EQ(log.Normalized(), std::vector<std::string>{
                                  "quvaidx_ipc_core:N [Error] connection to " +
                                  path_ + " lost 4 times, giving up"});
  while (peer.served() < kMaxExchangeRestarts + 1) usleep(1000);
  usleep(20 * 1000);
  EXPECT_EQ(peer.served(), kMaxExchangeRestarts + 1);
}

TEST_F(ClientTest, SendWithoutReplyHandshakesFirstAndNullsTheValue) {
  Json::Value received;
  ScriptedPeer peer(path_, [&](int& fd, int) {
    Json::Value request;
    ASSERT_EQ(RecvPacket(fd, request), 0);
    Json::Value reply(Json::objectValue);
    SendPacket(fd, reply);
    ASSERT_EQ(RecvPacket(fd, received), 0);
  });
  Json::Value value = Object("command", "NOTIFY");
  ASSERT_EQ(AutoSendPacket(path_.c_str(), value, 1), 0);
  EXPECT_TRUE(value.isNull());
  while (peer.served() < 1) usleep(1000);
  EXPECT_EQ(received, Object("command", "NOTIFY"));
}

// The caller's descriptor is used (the path not looked at) and left open; a
// reset on it is reported as -2.
TEST_F(ClientTest, ExchangeOnCallersDescriptor) {
  ScriptedPeer peer(path_, AnswerAll);
  int fd = ConnectPeer(path_.c_str(), false, 1);
  ASSERT_GE(fd, 0);
  for (int i = 0; i < 2; ++i) {
    Json::Value value = Object("command", "AGAIN");
    ASSERT_EQ(AutoSendRecvPacket(nullptr, fd, value, 0), 0);
    EXPECT_EQ(value["echo"]["command"].asString(), "AGAIN");
  }
  EXPECT_NE(fcntl(fd, F_GETFD), -1);
  DisconnectPeer(fd);
  int fds[2];
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
  close(fds[1]);
  Json::Value value = Object("command", "X");
  EXPECT_EQ(AutoSendRecvPacketByFd(fds[0], value, 0), -2);
  EXPECT_TRUE(value.empty());
  close(fds[0]);
}

}  // namespace
