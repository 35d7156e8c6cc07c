// Framing on a socketpair: exact bytes, short and broken streams, bounds.
#include <errno.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;

class PacketTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds_), 0);
  }
  void TearDown() override {
    CloseB();
    close(a());
    EXPECT_TRUE(leaks_.NoLeak());
  }
  void CloseB() {
    if (fds_[1] >= 0) close(fds_[1]);
    fds_[1] = -1;
  }
  int a() const { return fds_[0]; }
  int b() const { return fds_[1]; }

  void Put(const std::string& bytes) {
    ASSERT_EQ(write(b(), bytes.data(), bytes.size()),
              static_cast<ssize_t>(bytes.size()));
  }
  // Bytes waiting on fd, without blocking.
  std::string Pending(int fd) {
    std::string out;
    char buf[65536];
    ssize_t n;
    while ((n = recv(fd, buf, sizeof(buf), MSG_DONTWAIT)) > 0) {
      out.append(buf, static_cast<size_t>(n));
    }
    return out;
  }
  int Recv() {
    got_ = Json::Value();
    return RecvPacket(a(), got_);
  }

  FdLeakCheck leaks_;
  int fds_[2] = {-1, -1};
  Json::Value got_;
};

std::string Header(unsigned length, unsigned magic = kPacketMagic) {
  return {static_cast<char>(magic >> 8), static_cast<char>(magic & 0xff),
          static_cast<char>(length >> 8), static_cast<char>(length & 0xff)};
}

std::string Packet(const std::string& body) {
  return Header(static_cast<unsigned>(body.size())) + body;
}

// An object {"k":"xxx..."} whose compact text, line feed included, is
// exactly `text_size` bytes.
Json::Value ValueOfTextSize(size_t text_size) {
  Json::Value value(Json::objectValue);
  value["k"] = std::string(text_size - 9, 'x');
  return value;
}

TEST_F(PacketTest, HandshakeGoesOutAsExactly28Bytes) {
  Json::Value request(Json::objectValue);
  request["command"] = "HANDSHAKE";
  ASSERT_EQ(SendPacket(a(), request), 0);
  EXPECT_EQ(Pending(b()), std::string("\x15\xbe\x00\x18", 4) +
                              "{\"command\":\"HANDSHAKE\"}\n");
  EXPECT_EQ(request["command"].asString(), "HANDSHAKE");  // unchanged
  char byte = 0;  // a zero count makes no system call
  EXPECT_EQ(Writen(-1, &byte, 0), 0);
  EXPECT_EQ(Readn(-1, &byte, 0), 0);
}

// The magic is not checked; an empty body leaves the value null; bodies
// that are not JSON, too deeply nested, or cut by a zero byte still succeed.
TEST_F(PacketTest, OddBodiesAreReceived) {
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
}

TEST_F(PacketTest, TruncatedPacketsFailWithoutReset) {
  for (std::string part : {std::string("\x15\xbe", 2), Header(10) + "{\"a\""}) {
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(write(fds[1], part.data(), part.size()),
              static_cast<ssize_t>(part.size()));
    close(fds[1]);
    EXPECT_EQ(RecvPacket(fds[0], got_), -1);
    close(fds[0]);
  }
}

TEST_F(PacketTest, PacketArrivingInPiecesIsReassembled) {
  std::string packet = Packet("{\"piece\":true}\n");
  std::thread writer([&] {
    for (char c : packet) {
      ASSERT_EQ(write(b(), &c, 1), 1);
      usleep(200);
    }
  });
  EXPECT_EQ(Recv(), 0);
  writer.join();
  EXPECT_TRUE(got_["piece"].asBool());
}

TEST_F(PacketTest, BrokenPipeAndResetAreMinusTwoWithoutSignalOrLog) {
  LogCapture log(7);
  Json::Value value(Json::objectValue);
  value["x"] = 1;
  ASSERT_EQ(SendPacket(a(), value), 0);
  CloseB();  // with unread data in it: resets the peer
  EXPECT_EQ(Recv(), -2);
  EXPECT_EQ(SendPacket(a(), value), -2);  // a SIGPIPE would end the test
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(PacketTest, SendLimitIs16380Bytes) {
  LogCapture log;
  Json::Value value = ValueOfTextSize(kMaxSendBody);
  std::thread reader([&] {
    Json::Value got;
    EXPECT_EQ(RecvPacket(b(), got), 0);
    EXPECT_EQ(got, value);
  });
  EXPECT_EQ(SendPacket(a(), value), 0);
  reader.join();
  for (size_t size : {kMaxSendBody + 1, size_t{65536 + 20}}) {
    Json::Value big = ValueOfTextSize(size);
    EXPECT_EQ(SendPacket(a(), big), -1) << size;
  }
  EXPECT_EQ(Pending(b()), "");
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.Normalized()[0],
            "quvaidx_ipc_core:N [Error] packet too large: 16381 bytes, "
            "limit 16380");
}

TEST_F(PacketTest, ReceiveLimitIs16383Bytes) {
  LogCapture log;
  std::string body = "\"" + std::string(kMaxRecvBody - 3, 'q') + "\"\n";
  ASSERT_EQ(body.size(), kMaxRecvBody);
  std::thread writer([&] { Put(Packet(body)); });
  EXPECT_EQ(Recv(), 0);
  writer.join();
  EXPECT_EQ(got_.asString().size(), kMaxRecvBody - 3);
  Put(Header(16384) + "{}\n");
  EXPECT_EQ(Recv(), -1);
  EXPECT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(Pending(a()), "{}\n");  // the body was not read
  Put(Header(0xffff));
  EXPECT_EQ(Recv(), -1);
}

}  // namespace
