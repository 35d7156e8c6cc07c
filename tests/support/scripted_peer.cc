#include "support/scripted_peer.h"

#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

namespace quvaidx::test {

struct sockaddr_un UnixAddress(const std::string& path) {
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  return address;
}

namespace {

// The thread's effective user id; the raw call leaves other threads alone.
bool SetThreadEuid(uid_t euid) {
  return syscall(SYS_setresuid, static_cast<uid_t>(-1), euid,
                 static_cast<uid_t>(-1)) == 0;
}

}  // namespace

int ListenUnixAs(const std::string& path, int backlog, unsigned euid) {
  struct sockaddr_un address = UnixAddress(path);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  bool listening = false;
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) ==
      0) {
    // The kernel records the listener's credentials at listen(2).
    const uid_t own = geteuid();
    if (euid == own) {
      listening = listen(fd, backlog) == 0;
    } else if (SetThreadEuid(euid)) {
      listening = listen(fd, backlog) == 0;
      if (!SetThreadEuid(own)) abort();  // the test process must not go on
    }
  }
  if (!listening) {
    close(fd);
    return -1;
  }
  return fd;
}

int ListenUnix(const std::string& path, int backlog) {
  return ListenUnixAs(path, backlog, geteuid());
}

ScriptedPeer::ScriptedPeer(const std::string& path, Script script)
    : path_(path), script_(std::move(script)) {
  if (path.size() >= sizeof(sockaddr_un::sun_path)) return;
  unlink(path.c_str());
  listen_fd_ = ListenUnix(path, 16);
  if (listen_fd_ >= 0) thread_ = std::thread([this] { Run(); });
}

ScriptedPeer::~ScriptedPeer() {
  if (listen_fd_ >= 0) {
    shutdown(listen_fd_, SHUT_RDWR);  // wakes the blocked accept
    thread_.join();
    close(listen_fd_);
    unlink(path_.c_str());
  }
}

void ScriptedPeer::Run() {
  for (int index = 0;; ++index) {
    int fd = accept4(listen_fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) return;
    script_(fd, index);
    if (fd >= 0) close(fd);
    ++served_;
  }
}

}  // namespace quvaidx::test
