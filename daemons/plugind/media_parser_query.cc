#include "media_parser_query.h"

#include <errno.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <vector>

#include <memory>

#include <quvaidx/ipc.h>

namespace plugind {
namespace {

long long NowMs() {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<long long>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// Reads exactly `length` bytes from `fd` before `deadline_ms`. Returns ""
// or why not.
std::string ReadWithin(int fd, int stop_fd, char* buffer, size_t length,
                       long long deadline_ms) {
  size_t done = 0;
  while (done < length) {
    const long long left = deadline_ms - NowMs();
    if (left <= 0) return "timed out";
    struct pollfd ready[2] = {{fd, POLLIN, 0}, {stop_fd, POLLIN, 0}};
    int polled = poll(ready, stop_fd >= 0 ? 2 : 1, static_cast<int>(left));
    if (polled < 0 && errno == EINTR) continue;  // Retry
    if (polled < 0) return strerror(errno);
    if (polled == 0) continue;  // the deadline is checked above
    if (stop_fd >= 0 && (ready[1].revents & POLLIN) != 0) return "stopping";
    ssize_t got = read(fd, buffer + done, length - done);
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got < 0) return strerror(errno);
    if (got == 0) return "it closed the connection";
    done += static_cast<size_t>(got);
  }
  return "";
}

// Receives one packet (header and body as quvaidx/ipc.h lays them out)
// into *value before `deadline_ms`. Returns "" or why not.
std::string ReceiveWithin(int fd, int stop_fd, long long deadline_ms,
                          Json::Value* value) {
  unsigned char header[kPacketHeaderSize];
  std::string problem = ReadWithin(fd, stop_fd, reinterpret_cast<char*>(header),
                                   sizeof(header), deadline_ms);
  if (!problem.empty()) return problem;
  const size_t length = (static_cast<size_t>(header[2]) << 8) | header[3];
  if (length > kMaxRecvBody) return "its reply is too large";
  char body[kPacketBufferSize];
  problem = ReadWithin(fd, stop_fd, body, length, deadline_ms);
  if (!problem.empty()) return problem;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  try {
    if (!reader->parse(body, body + length, value, &errors)) {
      return "its reply is not JSON";
    }
  } catch (const std::exception&) {  // nested too deeply
    return "its reply is not JSON";
  }
  return "";
}

// The calling thread's effective ids and groups. The raw calls change this
// thread alone; glibc's wrappers would change every thread of the process.
bool SetThreadGroups(const std::vector<gid_t>& groups) {
  return syscall(SYS_setgroups, groups.size(), groups.data()) == 0;
}
bool SetThreadEgid(gid_t gid) {
  return syscall(SYS_setresgid, static_cast<gid_t>(-1), gid,
                 static_cast<gid_t>(-1)) == 0;
}
bool SetThreadEuid(uid_t uid) {
  return syscall(SYS_setresuid, static_cast<uid_t>(-1), uid,
                 static_cast<uid_t>(-1)) == 0;
}

}  // namespace

int ConnectAs(const quvaidx_daemons::FsUser& peer, const std::string& path,
              int timeout_ms) {
  const uid_t own_uid = geteuid();
  if (peer.uid == 0 || peer.uid == own_uid) {
    return ConnectDaemon(path.c_str(), timeout_ms);
  }
  const gid_t own_gid = getegid();
  std::vector<gid_t> own_groups(static_cast<size_t>(getgroups(0, nullptr)));
  if (getgroups(static_cast<int>(own_groups.size()), own_groups.data()) !=
      static_cast<int>(own_groups.size())) {
    return -2;
  }
  // Groups and group first: changing the user clears the privileges that
  // both need.
  int fd = -2;
  int err = 0;
  if (SetThreadGroups(peer.groups)) {
    if (SetThreadEgid(peer.gid)) {
      if (SetThreadEuid(peer.uid)) {
        fd = ConnectDaemon(path.c_str(), timeout_ms);
        err = errno;
        // The saved user is still the daemon's: this cannot fail, and the
        // thread must never go on as the peer.
        if (!SetThreadEuid(own_uid)) abort();
      }
      if (!SetThreadEgid(own_gid)) abort();
    }
    if (!SetThreadGroups(own_groups)) abort();
  }
  if (fd == -1) errno = err;
  return fd;
}

std::string AskMediaInfo(const PluginConfig& config,
                         const quvaidx_daemons::FsUser& peer,
                         const std::string& path, Json::Value* media) {
  const long long deadline =
      NowMs() + static_cast<long long>(config.media_parser_timeout_s) * 1000;
  const std::string no_answer = "the media parser does not answer";
  int fd = ConnectAs(peer, config.media_parser_socket,
                     config.media_parser_timeout_s * 1000);
  if (fd == -2) return "cannot take the rights of the asking process";
  if (fd < 0) return no_answer + " (" + strerror(errno) + ")";
  Json::Value request(Json::objectValue);
  request["command"] = "GET_MEDIA_INFO";
  request["path"] = path;
  Json::Value reply;
  std::string problem =
      SendPacket(fd, request) == 0
          ? ReceiveWithin(fd, config.stop_fd, deadline, &reply)
          : "it took no request";
  DisconnectPeer(fd);
  if (problem == "stopping") return "the daemon is stopping";
  if (!problem.empty()) return no_answer + " (" + problem + ")";
  if (!reply.isObject() || !reply["success"].isBool() ||
      !reply["success"].asBool()) {
    std::string reason = "the media parser cannot read the file";
    if (reply.isObject() && reply["reason"].isString()) {
      reason += ": " + reply["reason"].asString();
    }
    return reason;
  }
  *media = reply["media"];
  return "";
}

}  // namespace plugind
