// A blocking Unix-domain peer on its own thread: it accepts connections on a
// path and runs a script on each, then closes it. Plays the daemon in client
// tests without involving the event server.
#ifndef QUVAIDX_TESTS_SUPPORT_SCRIPTED_PEER_H_
#define QUVAIDX_TESTS_SUPPORT_SCRIPTED_PEER_H_

#include <sys/un.h>

#include <atomic>
#include <functional>
#include <string>
#include <thread>

namespace quvaidx::test {

// The address of the Unix-domain socket at `path`, cut to what it holds.
struct sockaddr_un UnixAddress(const std::string& path);

// A socket bound to `path` and listening with `backlog` that nobody accepts
// on: a live daemon that is busy or stuck. -1 when it cannot be made.
int ListenUnix(const std::string& path, int backlog);

// As ListenUnix, but the socket listens as effective user `euid`, which is
// who a client's SO_PEERCRED then reports: a stranger who took a daemon's
// path. Only the calling thread's identity changes, and only while it
// listens. REQUIRES: root.
int ListenUnixAs(const std::string& path, int backlog, unsigned euid);

class ScriptedPeer {
 public:
  // Runs on the peer's thread for connection number `index` (from 0); the
  // peer closes fd after it returns unless the script set fd to -1.
  using Script = std::function<void(int& fd, int index)>;

  ScriptedPeer(const std::string& path, Script script);
  ~ScriptedPeer();  // stops accepting, joins, removes the socket file

  ScriptedPeer(const ScriptedPeer&) = delete;
  ScriptedPeer& operator=(const ScriptedPeer&) = delete;

  bool listening() const { return listen_fd_ >= 0; }
  // Connections whose script has finished.
  int served() const { return served_.load(); }

 private:
  void Run();

  std::string path_;
  Script script_;
  int listen_fd_ = -1;
  std::atomic<int> served_{0};
  std::thread thread_;
};

}  // namespace quvaidx::test

#endif  // QUVAIDX_TESTS_SUPPORT_SCRIPTED_PEER_H_
