// Doing a user's file work with that user's rights.
//
// The reference daemons run as root over folders that users own. Whatever
// they read or write for a user, they do as that user, so that the kernel,
// ACLs and all, decides what may be read and written, exactly as it would
// for the user, instead of the daemon's own checks:
//
//   quvaidx_daemons::FsUser owner = quvaidx_daemons::FolderOwner(st);
//   quvaidx_daemons::FsIdentity as_owner(owner);
//   if (!as_owner.taken()) ... refuse ...
//   ... open, read, write as the owner ...
//   // the daemon's own identity is back when as_owner goes
//
// The identity is the file-system identity of the calling thread only
// (setfsuid, setfsgid and the supplementary groups, each set with the raw
// system call, which glibc would otherwise apply to every thread): other
// threads, libvips's and libavformat's among them, keep the daemon's own.
// Taking one needs root (CAP_SETUID and CAP_SETGID).
#ifndef QUVAIDX_DAEMONS_COMMON_FS_IDENTITY_H_
#define QUVAIDX_DAEMONS_COMMON_FS_IDENTITY_H_

#include <sys/stat.h>
#include <sys/types.h>

#include <vector>

namespace quvaidx_daemons {

// Whom file access is done for.
struct FsUser {
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;  // supplementary groups, the primary one aside
};

// The owner of a file or folder, with the supplementary groups that the
// user database gives that user (none when the user has no entry there).
FsUser FileOwner(const struct stat& status);

// The supplementary groups of user `uid` with primary group `gid` in the
// user database; empty when the user has no entry.
std::vector<gid_t> UserDatabaseGroups(uid_t uid, gid_t gid);

// While it lives, the calling thread's file access happens as `user`.
// Restores the thread's previous identity when destroyed. Not copyable.
class FsIdentity {
 public:
  explicit FsIdentity(const FsUser& user);
  ~FsIdentity();
  FsIdentity(const FsIdentity&) = delete;
  FsIdentity& operator=(const FsIdentity&) = delete;

  // False when the identity could not be taken (not root, or the kernel
  // refused): the thread then still works as before, and the caller must
  // not do the user's work.
  bool taken() const { return taken_; }

 private:
  bool taken_ = false;
  uid_t saved_uid_ = 0;
  gid_t saved_gid_ = 0;
  std::vector<gid_t> saved_groups_;
};

}  // namespace quvaidx_daemons

#endif  // QUVAIDX_DAEMONS_COMMON_FS_IDENTITY_H_
