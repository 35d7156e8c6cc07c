// Answering a peer only about files it could read itself.
//
// The media parser usually runs as root, so that it can answer any user
// about that user's own media. Root may read everything; a peer must not
// learn through the daemon what it could not read itself. So the file a
// peer names is opened with the peer's rights:
//
//   - as root, the daemon takes the peer's identity for file access while
//     it opens the file (quvaidx_daemons::FsIdentity: the peer's user, group
//     and the supplementary groups the peer process holds), and the kernel
//     decides, ACLs and all, exactly as it would for the peer;
//   - as any other user, it cannot take another identity, so it checks the
//     permission bits itself: search permission on every folder of the
//     file's canonical path and read permission on the file, as owner,
//     group (the peer's primary and supplementary groups) or others.
//
// Root peers, and peers of the daemon's own user, are answered as the
// daemon's own rights allow.
//
// The identity is taken for the calling thread only, while one file is
// opened.
#ifndef MEDIAPARSERD_PEER_ACCESS_H_
#define MEDIAPARSERD_PEER_ACCESS_H_

#include <sys/stat.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "fs_identity.h"

namespace mediaparserd {

// The process that sent a request: its user, primary group and the
// supplementary groups it holds (GetPeerGroups), not those the group
// database lists for its user.
using PeerIdentity = quvaidx_daemons::FsUser;

// True when a peer's requests need a check of their own: not root and not
// the daemon's own user.
bool PeerNeedsCheck(const PeerIdentity& peer);

// True when the permission bits of `status` grant `want` (4 read, 1
// search) to a process of user `uid` in `groups`, as owner, group member or
// other, in that order of precedence.
bool ModeGrants(const struct stat& status, uid_t uid,
                const std::vector<gid_t>& groups, mode_t want);

// The check of a daemon that cannot take the peer's identity: every folder
// of `path`'s canonical form searchable and the file readable for the peer.
// False with *reason "Permission denied" (or the system's text when the
// path cannot be resolved).
bool PeerMayRead(const std::string& path, const PeerIdentity& peer,
                 std::string* reason);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_PEER_ACCESS_H_
