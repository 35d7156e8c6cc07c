#include "support/scripted_peer.h"

#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace quvaidx::test {

ScriptedPeer::ScriptedPeer(const std::string& path, Script script)
    : path_(path), script_(std::move(script)) {
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) return;
  memcpy(address.sun_path, path.data(), path.size());
  unlink(path.c_str());
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return;
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) !=
          0 ||
      listen(fd, 16) != 0) {
    close(fd);
    return;
  }
  listen_fd_ = fd;
  thread_ = std::thread([this] { Run(); });
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
