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
    CloseA();
    CloseB();
    EXPECT_TRUE(leaks_.NoLeak());
  }
  void CloseA() {
    if (fds_[0] >= 0) close(fds_[0]);
    fds_[0] = -1;
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
  // Bytes waiting on a(), without blocking.
  std::string Pending(int fd) {
    std::string out;
    char buf[65536];
    ssize_t n;
    while ((n = recv(fd, buf, sizeof(buf), MSG_DONTWAIT)) > 0) {
      out.append(buf, static_cast<size_t>(n));
    }
    return out;
  }

  FdLeakCheck leaks_;
  int fds_[2] = {-1, -1};
};

std::string Header(unsigned length, unsigned magic = kPacketMagic) {
  std::string h(4, '\0');
  h[0] = static_cast<char>(magic >> 8);
  h[1] = static_cast<char>(magic & 0xff);
  h[2] = static_cast<char>(length >> 8);
  h[3] = static_cast<char>(length & 0xff);
  return h;
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
  std::string expected =
      std::string("\x15\xbe\x00\x18", 4) + "{\"command\":\"HANDSHAKE\"}\n";
  EXPECT_EQ(Pending(b()), expected);
  EXPECT_EQ(request["command"].asString(), "HANDSHAKE");  // unchanged
}

TEST_F(PacketTest, ZeroCountMakesNoSystemCall) {
  // An invalid descriptor would fail any system call.
  char byte = 0;
  EXPECT_EQ(Writen(-1, &byte, 0), 0);
  EXPECT_EQ(Readn(-1, &byte, 0), 0);
}

TEST_F(PacketTest, RoundTripKeepsTheValue) {
  Json::Value sent(Json::objectValue);
  sent["path"] = "/share/Multimedia/\xe5\x86\x99\xe7\x9c\x9f.jpg";
  sent["size"] = Json::UInt64(4294967301ull);
  sent["list"].append(1);
  sent["list"].append("two");
  ASSERT_EQ(SendPacket(a(), sent), 0);
  Json::Value got;
  ASSERT_EQ(RecvPacket(b(), got), 0);
  EXPECT_EQ(got, sent);
}

TEST_F(PacketTest, MagicIsNotChecked) {
  Put(Header(8, 0x0000) + "{\"a\":1}\n");
  Json::Value got;
  ASSERT_EQ(RecvPacket(a(), got), 0);
  EXPECT_EQ(got["a"].asInt(), 1);
}

TEST_F(PacketTest, ZeroLengthBodyLeavesNullValueNull) {
  Put(Header(0));
  Json::Value got;
  ASSERT_EQ(RecvPacket(a(), got), 0);
  EXPECT_TRUE(got.isNull());
}

TEST_F(PacketTest, TruncatedHeaderIsFailureNotReset) {
  Put(std::string("\x15\xbe", 2));
  CloseB();
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), -1);
}

TEST_F(PacketTest, TruncatedBodyIsFailure) {
  Put(Header(10) + "{\"a\"");
  CloseB();
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), -1);
}

TEST_F(PacketTest, PacketArrivingInPiecesIsReassembled) {
  std::string packet = Packet("{\"piece\":true}\n");
  std::thread writer([&] {
    for (char c : packet) {
      ASSERT_EQ(write(b(), &c, 1), 1);
      usleep(200);
    }
  });
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), 0);
  writer.join();
  EXPECT_TRUE(got["piece"].asBool());
}

TEST_F(PacketTest, SendToClosedPeerIsBrokenPipeWithoutSignalOrLog) {
  LogCapture log(7);
  CloseB();
  Json::Value value(Json::objectValue);
  value["command"] = "HANDSHAKE";
  EXPECT_EQ(SendPacket(a(), value), -2);  // a SIGPIPE would end the test
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(PacketTest, ResetWhileReadingIsMinusTwo) {
  // Closing a Unix socket with unread data in it resets its peer.
  LogCapture log(7);
  Json::Value value(Json::objectValue);
  value["x"] = 1;
  ASSERT_EQ(SendPacket(a(), value), 0);
  CloseB();
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), -2);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(PacketTest, BodyThatIsNotJsonStillSucceeds) {
  Put(Packet("plain words, not json"));
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), 0);
}

TEST_F(PacketTest, BodyEndsAtEmbeddedZeroByte) {
  Put(Packet(std::string("{\"a\":1}\0{\"b\":2}", 15)));
  Json::Value got;
  ASSERT_EQ(RecvPacket(a(), got), 0);
  EXPECT_EQ(got["a"].asInt(), 1);
  EXPECT_FALSE(got.isMember("b"));
}

TEST_F(PacketTest, DeeplyNestedBodyDoesNotThrow) {
  Put(Packet(std::string(5000, '[')));
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), 0);
}

TEST_F(PacketTest, LargestBodyIsSentWhole) {
  Json::Value value = ValueOfTextSize(kMaxSendBody);
  std::thread reader([&] {
    Json::Value got;
    EXPECT_EQ(RecvPacket(b(), got), 0);
    EXPECT_EQ(got, value);
  });
  EXPECT_EQ(SendPacket(a(), value), 0);
  reader.join();
}

TEST_F(PacketTest, OversizedValueIsRefusedAndNothingWritten) {
  LogCapture log;
  for (size_t size : {kMaxSendBody + 1, size_t{65536 + 20}, size_t{200000}}) {
    Json::Value value = ValueOfTextSize(size);
    EXPECT_EQ(SendPacket(a(), value), -1) << size;
  }
  EXPECT_EQ(Pending(b()), "");
  ASSERT_EQ(log.lines().size(), 3u);
  EXPECT_EQ(log.Normalized()[0],
            "quvaidx_ipc_core:N [Error] packet too large: 16381 bytes, "
            "limit 16380");
}

TEST_F(PacketTest, HeaderAnnouncingMoreThanTheBufferIsRefused) {
  LogCapture log;
  Put(Header(16384) + "{}\n");
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), -1);
  EXPECT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(Pending(a()), "{}\n");  // the body was not read
  Put(Header(0xffff));
  EXPECT_EQ(RecvPacket(a(), got), -1);
}

TEST_F(PacketTest, LargestReceivableBodyIsAccepted) {
  std::string body = "\"" + std::string(kMaxRecvBody - 3, 'q') + "\"\n";
  ASSERT_EQ(body.size(), kMaxRecvBody);
  std::thread writer([&] { Put(Packet(body)); });
  Json::Value got;
  EXPECT_EQ(RecvPacket(a(), got), 0);
  writer.join();
  EXPECT_EQ(got.asString().size(), kMaxRecvBody - 3);
}

TEST_F(PacketTest, OtherSocketErrorsAreLoggedAndFail) {
  LogCapture log;
  Json::Value value(Json::objectValue);
  int not_a_socket = dup(STDERR_FILENO);
  close(not_a_socket);
  EXPECT_EQ(SendPacket(not_a_socket, value), -1);
  EXPECT_EQ(RecvPacket(not_a_socket, value), -1);
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_EQ(log.Normalized()[0],
            "quvaidx_ipc_core:N [Error] 9, Bad file descriptor");
}

}  // namespace
