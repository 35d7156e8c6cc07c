#include "peer_access.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>

namespace mediaparserd {

bool PeerNeedsCheck(const PeerIdentity& peer) {
  return peer.uid != 0 && peer.uid != geteuid();
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
  std::vector<gid_t> groups = peer.groups;
  groups.push_back(peer.gid);
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

}  // namespace mediaparserd
