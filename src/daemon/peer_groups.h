// The supplementary groups of the process at the other end of a connection,
// as the kernel holds them, for GetPeerGroups. Internal to the event server;
// the status-text parser is apart so that it can be tested and fuzzed
// without /proc.
#ifndef QUVAIDX_DAEMON_PEER_GROUPS_H_
#define QUVAIDX_DAEMON_PEER_GROUPS_H_

#include <stddef.h>
#include <sys/socket.h>
#include <sys/types.h>

#include <vector>

namespace quvaidx {

// Most bytes of /proc/PID/status read: room for the longest "Groups:" line
// (65536 groups of up to 10 digits each) and the rest of the text.
constexpr size_t kMaxStatusBytes = 1024 * 1024;
// Most supplementary groups a process can hold (NGROUPS_MAX).
constexpr size_t kMaxPeerGroups = 65536;

// What the status text of a process says of its identity.
struct StatusIds {
  uid_t uid[4];  // real, effective, saved, file system
  gid_t gid[4];
  std::vector<gid_t> groups;  // supplementary, as listed
};

// Reads the lines "Uid:", "Gid:" (four ids each) and "Groups:" (any number
// of ids, up to kMaxPeerGroups) of text[0, length), each a label at the start
// of a line followed by decimal ids separated by blanks. An id must fit an
// id type and not be (id_t)-1. The text need not end in a zero byte; nothing
// is read past `length`.
// Returns true with *ids filled when all three lines were found and well
// formed (the first of each label counts); false otherwise, with *ids in an
// unspecified state.
bool ParseStatusIds(const char* text, size_t length, StatusIds* ids);

// The supplementary groups of the process connected to socket `fd`, whose
// credentials (SO_PEERCRED) are `peer`: those the kernel recorded with the
// connection (SO_PEERGROUPS), else, where the system cannot tell them, those
// of /proc/PID/status, taken only while that process's effective ids are
// still those of `peer`. Returns true with *groups set; false (logged at
// level 3 for the fallback's refusals) with *groups unchanged.
bool PeerSocketGroups(int fd, const struct ucred& peer,
                      std::vector<gid_t>* groups);

// PeerSocketGroups without the connection's record: from the status text at
// `status_path` (/proc/PID/status). Exposed so that the fallback is tested
// on its own.
bool StatusFileGroups(const char* status_path, const struct ucred& peer,
                      std::vector<gid_t>* groups);

}  // namespace quvaidx

#endif  // QUVAIDX_DAEMON_PEER_GROUPS_H_
