#include "peer_access.h"

#include <errno.h>
#include <grp.h>
#include <limits.h>
#include <pwd.h>
#include <stdlib.h>
#include <string.h>
#include <sys/fsuid.h>
#include <unistd.h>

#include <algorithm>

namespace mediaparserd {

bool PeerNeedsCheck(const PeerIdentity& peer) {
  return peer.uid != 0 && peer.uid != geteuid();
}

std::vector<gid_t> PeerGroups(const PeerIdentity& peer) {
  std::vector<gid_t> groups = {peer.gid};
  struct passwd entry;
  struct passwd* found = nullptr;
  std::vector<char> buffer(16384);
  if (getpwuid_r(peer.uid, &entry, buffer.data(), buffer.size(), &found) != 0 ||
      found == nullptr) {
    return groups;  // a user without an entry has its primary group only
  }
  int count = 64;
  groups.resize(static_cast<size_t>(count));
  if (getgrouplist(entry.pw_name, peer.gid, groups.data(), &count) < 0) {
    groups.resize(static_cast<size_t>(count));  // count now says how many
    if (getgrouplist(entry.pw_name, peer.gid, groups.data(), &count) < 0) {
      return {peer.gid};
    }
  }
  groups.resize(static_cast<size_t>(count));
  return groups;
}

bool ModeGrants(const struct stat& status, uid_t uid,
                const std::vector<gid_t>& groups, mode_t want) {
  mode_t bits;
  if (status.st_uid == uid) {
    bits = (status.st_mode >> 6) & 7;
  } else if (std::find(groups.begin(), groups.end(), status.st_gid) !=
             groups.end()) {
    bits = (status.st_mode >> 3) & 7;
  } else {
    bits = status.st_mode & 7;
  }
  return (bits & want) == want;
}

bool PeerMayRead(const std::string& path, const PeerIdentity& peer,
                 std::string* reason) {
  char* resolved = realpath(path.c_str(), nullptr);
  if (resolved == nullptr) {
    *reason = strerror(errno);
    return false;
  }
  std::string canonical = resolved;
  free(resolved);
  const std::vector<gid_t> groups = PeerGroups(peer);
  // Every folder from "/" down to the file's own must be searchable.
  for (size_t slash = 0; slash != std::string::npos;
       slash = canonical.find('/', slash + 1)) {
    std::string folder = slash == 0 ? "/" : canonical.substr(0, slash);
    struct stat status;
    if (stat(folder.c_str(), &status) != 0 ||
        !ModeGrants(status, peer.uid, groups, S_IXOTH)) {
      *reason = strerror(EACCES);
      return false;
    }
  }
  struct stat status;
  if (stat(canonical.c_str(), &status) != 0 ||
      !ModeGrants(status, peer.uid, groups, S_IROTH)) {
    *reason = strerror(EACCES);
    return false;
  }
  return true;
}

PeerFileIdentity::PeerFileIdentity(const PeerIdentity& peer) {
  int count = getgroups(0, nullptr);
  if (count < 0) return;
  saved_groups_.resize(static_cast<size_t>(count));
  if (getgroups(count, saved_groups_.data()) != count) return;
  const std::vector<gid_t> groups = PeerGroups(peer);
  if (setgroups(groups.size(), groups.data()) != 0) return;
  // setfsuid and setfsgid report the previous value, not success; asking
  // again (with an id that cannot be set) tells what is in force.
  setfsgid(peer.gid);
  setfsuid(peer.uid);
  if (static_cast<uid_t>(setfsuid(static_cast<uid_t>(-1))) != peer.uid ||
      static_cast<gid_t>(setfsgid(static_cast<gid_t>(-1))) != peer.gid) {
    setfsuid(geteuid());
    setfsgid(getegid());
    setgroups(saved_groups_.size(), saved_groups_.data());
    return;
  }
  taken_ = true;
}

PeerFileIdentity::~PeerFileIdentity() {
  if (!taken_) return;
  setfsuid(geteuid());
  setfsgid(getegid());
  setgroups(saved_groups_.size(), saved_groups_.data());
}

}  // namespace mediaparserd
