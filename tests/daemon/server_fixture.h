// The event server in-process: a real event base and real client sockets on
// the same thread, the loop driven step by step. Shared by the event-server
// test files.
#ifndef QUVAIDX_TESTS_DAEMON_SERVER_FIXTURE_H_
#define QUVAIDX_TESTS_DAEMON_SERVER_FIXTURE_H_

#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include <event2/event.h>
#include <gtest/gtest.h>

#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"

namespace quvaidx::test {

inline std::string Packet(const std::string& body) {
  const size_t n = body.size();
  return std::string("\x15\xbe", 2) + static_cast<char>(n >> 8) +
         static_cast<char>(n & 0xff) + body;
}

inline std::string Request(const std::string& command) {
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
    SetServerLimits(nullptr);
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

  // Runs the loop until `done` holds or `ms` milliseconds passed; returns
  // whether it held.
  bool RunUntil(const std::function<bool()>& done, int ms) {
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    while (!done()) {
      if (std::chrono::steady_clock::now() >= end) return false;
      event_base_loop(base_, EVLOOP_NONBLOCK);
      usleep(200);
    }
    return true;
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

  // True when the server has closed fd (reading what it sent first).
  bool ServerClosed(int fd) {
    char buf[65536];
    for (;;) {
      ssize_t got = recv(fd, buf, sizeof(buf), MSG_DONTWAIT);
      if (got == 0 || (got < 0 && errno == ECONNRESET)) return true;
      if (got < 0) return false;
      pending_[fd].append(buf, static_cast<size_t>(got));
    }
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

inline int Succeed(Json::Value&, Json::Value& reply) {
  reply = MakeResponse(true, nullptr);
  return 0;
}

inline int Echo(Json::Value& request, Json::Value& reply) {
  reply["echo"] = request["command"];
  return request["command"] == "QUIT" ? -1 : 0;
}

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_DAEMON_SERVER_FIXTURE_H_
