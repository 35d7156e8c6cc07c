// The supplementary groups of a connection's peer: the kernel's record of
// the connection first, the peer's status text only where the system keeps
// no such record (kernels before 4.13).
#include "daemon/peer_groups.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "quvaidx/log.h"

namespace quvaidx {
namespace {

constexpr char kModule[] = "quvaidx_daemon";
constexpr unsigned long long kLargestId = 0xFFFFFFFEull;  // (id_t)-1 is none

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

// Parses the blank-separated decimal ids of [at, end) into `out` (appended).
// False on anything else in the line, an id out of range, or more than
// `most` ids.
bool ParseIds(const char* at, const char* end, size_t most,
              std::vector<unsigned>* out) {
  for (;;) {
    while (at < end && IsBlank(*at)) ++at;
    if (at == end) return true;
    if (*at < '0' || *at > '9' || out->size() == most) return false;
    unsigned long long value = 0;
    while (at < end && *at >= '0' && *at <= '9') {
      value = value * 10 + static_cast<unsigned>(*at - '0');
      if (value > kLargestId) return false;
      ++at;
    }
    if (at < end && !IsBlank(*at)) return false;
    out->push_back(static_cast<unsigned>(value));
  }
}

bool StartsWith(const char* line, const char* end, const char* label,
                size_t label_length) {
  return static_cast<size_t>(end - line) >= label_length &&
         memcmp(line, label, label_length) == 0;
}

}  // namespace

bool ParseStatusIds(const char* text, size_t length, StatusIds* ids) {
  static constexpr char kUid[] = "Uid:";
  static constexpr char kGid[] = "Gid:";
  static constexpr char kGroups[] = "Groups:";
  bool have_uid = false;
  bool have_gid = false;
  bool have_groups = false;
  const char* const stop = text + length;
  for (const char* line = text; line < stop;) {
    const void* newline = memchr(line, '\n', static_cast<size_t>(stop - line));
    const char* end =
        newline != nullptr ? static_cast<const char*>(newline) : stop;
    std::vector<unsigned> values;
    if (!have_uid && StartsWith(line, end, kUid, sizeof(kUid) - 1)) {
      if (!ParseIds(line + sizeof(kUid) - 1, end, 4, &values) ||
          values.size() != 4) {
        return false;
      }
      for (int i = 0; i < 4; ++i) ids->uid[i] = values[i];
      have_uid = true;
    } else if (!have_gid && StartsWith(line, end, kGid, sizeof(kGid) - 1)) {
      if (!ParseIds(line + sizeof(kGid) - 1, end, 4, &values) ||
          values.size() != 4) {
        return false;
      }
      for (int i = 0; i < 4; ++i) ids->gid[i] = values[i];
      have_gid = true;
    } else if (!have_groups &&
               StartsWith(line, end, kGroups, sizeof(kGroups) - 1)) {
      if (!ParseIds(line + sizeof(kGroups) - 1, end, kMaxPeerGroups, &values)) {
        return false;
      }
      ids->groups.assign(values.begin(), values.end());
      have_groups = true;
    }
    if (have_uid && have_gid && have_groups) return true;
    line = end + 1;
  }
  return false;
}

bool StatusFileGroups(const char* status_path, const struct ucred& peer,
                      std::vector<gid_t>* groups) {
  int fd = open(status_path, O_RDONLY | O_CLOEXEC | O_NOCTTY);
  if (fd < 0) {
    AppLogError(3, "%s:%d [Error] no groups for pid %d: %s: %s", kModule,
                __LINE__, static_cast<int>(peer.pid), status_path,
                strerror(errno));
    return false;
  }
  std::string text;
  int err = 0;
  char chunk[16384];
  while (text.size() <= kMaxStatusBytes) {
    ssize_t got = read(fd, chunk, sizeof(chunk));
    if (got < 0 && errno == EINTR) continue;  // Retry
    if (got < 0) err = errno;
    if (got <= 0) break;
    text.append(chunk, static_cast<size_t>(got));
  }
  close(fd);  // read only: nothing to lose
  StatusIds ids;
  if (err != 0 || text.size() > kMaxStatusBytes ||
      !ParseStatusIds(text.data(), text.size(), &ids)) {
    AppLogError(3, "%s:%d [Error] no groups for pid %d: %s unreadable", kModule,
                __LINE__, static_cast<int>(peer.pid), status_path);
    return false;
  }
  // The process may have ended and its pid gone to another: its groups
  // count only while it still has the identity it connected with.
  if (ids.uid[1] != peer.uid || ids.gid[1] != peer.gid) {
    AppLogError(
        3,
        "%s:%d [Error] no groups for pid %d: it runs as %u:%u now, "
        "not as %u:%u",
        kModule, __LINE__, static_cast<int>(peer.pid),
        static_cast<unsigned>(ids.uid[1]), static_cast<unsigned>(ids.gid[1]),
        static_cast<unsigned>(peer.uid), static_cast<unsigned>(peer.gid));
    return false;
  }
  groups->swap(ids.groups);
  return true;
}

bool PeerSocketGroups(int fd, const struct ucred& peer,
                      std::vector<gid_t>* groups) {
  std::vector<gid_t> found(64);
  for (int attempt = 0; attempt < 3; ++attempt) {
    socklen_t length = static_cast<socklen_t>(found.size() * sizeof(gid_t));
    if (getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, found.data(), &length) == 0) {
      found.resize(length / sizeof(gid_t));
      groups->swap(found);
      return true;
    }
    if (errno != ERANGE || length / sizeof(gid_t) > kMaxPeerGroups) break;
    found.resize(length / sizeof(gid_t));  // length says how many there are
  }
  if (errno != ENOPROTOOPT && errno != EINVAL) return false;
  if (peer.pid <= 0) return false;  // not a process this system can name
  char path[64];
  snprintf(path, sizeof(path), "/proc/%d/status", static_cast<int>(peer.pid));
  return StatusFileGroups(path, peer, groups);
}

}  // namespace quvaidx
