// Framing on a socketpair: exact bytes, short and broken streams, bounds.
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;

std::string Header(unsigned length, unsigned magic = kPacketMagic) {
  return {static_cast<char>(magic >> 8), static_cast<char>(magic & 0xff),
          static_cast<char>(length >> 8), static_cast<char>(length & 0xff)};
}

std::string Packet(const std::string& body) {
  return Header(static_cast<unsigned>(body.size())) + body;
}

// Reads and writes fds_[0] ("a") against the test's end fds_[1] ("b").
class PacketTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds_), 0);
  }
  void TearDown() override {
    CloseB();
    close(fds_[0]);
    EXPECT_TRUE(leaks_.NoLeak());
  }
  void CloseB() {
    if (fds_[1] >= 0) close(fds_[1]);
    fds_[1] = -1;
  }
  void Put(const std::string& bytes) {
    ASSERT_EQ(write(fds_[1], bytes.data(), bytes.size()),
              static_cast<ssize_t>(bytes.size()));
  }
  // Bytes waiting on fd, without blocking.
  std::string Pending(int fd) {
    std::string out;
    char buf[65536];
    for (ssize_t n; (n = recv(fd, buf, sizeof(buf), MSG_DONTWAIT)) > 0;) {
      out.append(buf, static_cast<size_t>(n));
    }
    return out;
  }
  int Recv() {
    got_ = Json::Value();
    return RecvPacket(fds_[0], got_);
  }

  quvaidx::test::FdLeakCheck leaks_;
  int fds_[2] = {-1, -1};
  Json::Value got_;
};

TEST_F(PacketTest, HandshakeGoesOutAsExactly28Bytes) {
  Json::Value request(Json::objectValue);
  request["command"] = "HANDSHAKE";
  ASSERT_EQ(SendPacket(fds_[0], request), 0);
  EXPECT_EQ(Pending(fds_[1]), std::string("\x15\xbe\x00\x18", 4) +
                                  "{\"command\":\"HANDSHAKE\"}\n");
  EXPECT_EQ(request["command"].asString(), "HANDSHAKE");  // unchanged
  char byte = 0;  // a zero count makes no system call
  EXPECT_EQ(Writen(-1, &byte, 0), 0);
  EXPECT_EQ(Readn(-1, &byte, 0), 0);
}

// The magic is not checked; an empty body leaves the value null; bodies
// that are not JSON, too deeply nested, or cut by a zero byte still succeed.
// A packet arriving byte by byte is reassembled.
TEST_F(PacketTest, OddBodiesAndPiecesAreReceived) {
  Put(Header(8, 0x0000) + "{\"a\":1}\n" + Header(0) +
      Packet("plain words, not json") + Packet(std::string(5000, '[')) +
      Packet(std::string("{\"a\":1}\0{\"b\":2}", 15)));
  ASSERT_EQ(Recv(), 0);
  EXPECT_EQ(got_["a"].asInt(), 1);
  ASSERT_EQ(Recv(), 0);
  EXPECT_TRUE(got_.isNull());
  EXPECT_EQ(Recv(), 0);
  EXPECT_EQ(Recv(), 0);
  ASSERT_EQ(Recv(), 0);
  EXPECT_EQ(got_["a"].asInt(), 1);
  EXPECT_FALSE(got_.isMember("b"));
  std::thread writer([&] {
    for (char c : Packet("{\"piece\":true}\n")) {
      Put(std::string(1, c));
      usleep(200);
    }
  });
  EXPECT_EQ(Recv(), 0);
  writer.join();
  EXPECT_TRUE(got_["piece"].asBool());
}

// A stream that ends inside a header or a body fails with -1, not -2; a
// reset and a broken pipe are -2, without a signal or a line; other
// failures are -1 with a line.
TEST_F(PacketTest, EndOfStreamIsMinusOneResetAndBrokenPipeMinusTwo) {
  LogCapture log(7);
  for (const std::string& part :
       {std::string("\x15\xbe", 2), Header(10) + "{\"a\""}) {
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
    ASSERT_EQ(write(pair[1], part.data(), part.size()),
              static_cast<ssize_t>(part.size()));
    close(pair[1]);
    Json::Value value;
    EXPECT_EQ(RecvPacket(pair[0], value), -1) << part.size();
    close(pair[0]);
  }
  Json::Value value(Json::objectValue);
  value["x"] = 1;
  ASSERT_EQ(SendPacket(fds_[0], value), 0);
  CloseB();  // with unread data in it: resets the peer
  EXPECT_EQ(Recv(), -2);
  EXPECT_EQ(SendPacket(fds_[0], value), -2);  // a SIGPIPE would end the test
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(SendPacket(-1, value), -1);  // any other failure: -1 and a line
  EXPECT_EQ(RecvPacket(-1, value), -1);
  EXPECT_EQ(log.Count("quvaidx_ipc_core:N [Error] 9, Bad file descriptor"), 2);
}

// Bodies of up to 16380 bytes are sent and up to 16383 received; larger ones
// are refused with a line, and a refused body is not read.
TEST_F(PacketTest, SendAndReceiveLimits) {
  LogCapture log;
  auto text_of_size = [](size_t size) {  // {"k":"x..."}\n is `size` bytes
    Json::Value value(Json::objectValue);
    value["k"] = std::string(size - 9, 'x');
    return value;
  };
  Json::Value value = text_of_size(kMaxSendBody), got;
  EXPECT_EQ(SendPacket(fds_[0], value), 0);  // fits the socket buffer
  EXPECT_EQ(RecvPacket(fds_[1], got), 0);
  EXPECT_EQ(got, value);
  for (size_t size : {kMaxSendBody + 1, size_t{65536 + 20}}) {
    Json::Value big = text_of_size(size);
    EXPECT_EQ(SendPacket(fds_[0], big), -1) << size;
  }
  EXPECT_EQ(Pending(fds_[1]), "");
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.Normalized()[0],
            "quvaidx_ipc_core:N [Error] packet too large: 16381 bytes, "
            "limit 16380");
  log.Clear();
  std::string body = "\"" + std::string(kMaxRecvBody - 3, 'q') + "\"\n";
  Put(Packet(body));
  EXPECT_EQ(Recv(), 0);
  EXPECT_EQ(got_.asString().size(), kMaxRecvBody - 3);
  Put(Header(16384) + "{}\n");
  EXPECT_EQ(Recv(), -1);
  EXPECT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(Pending(fds_[0]), "{}\n");
  Put(Header(0xffff));
  EXPECT_EQ(Recv(), -1);
}

}  // namespace
