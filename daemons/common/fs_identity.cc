#include "fs_identity.h"

#include <grp.h>
#include <pwd.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>

namespace quvaidx_daemons {
namespace {

// setfsuid and setfsgid report the previous value, never an error; an id
// that cannot be set (-1) asks what is in force without changing it.
uid_t CurrentFsUid() {
  return static_cast<uid_t>(syscall(SYS_setfsuid, static_cast<uid_t>(-1)));
}
gid_t CurrentFsGid() {
  return static_cast<gid_t>(syscall(SYS_setfsgid, static_cast<gid_t>(-1)));
}

// The raw calls change the calling thread alone.
bool SetThreadGroups(const std::vector<gid_t>& groups) {
  return syscall(SYS_setgroups, groups.size(), groups.data()) == 0;
}

bool SetThreadFsIds(uid_t uid, gid_t gid) {
  syscall(SYS_setfsgid, gid);
  syscall(SYS_setfsuid, uid);
  return CurrentFsUid() == uid && CurrentFsGid() == gid;
}

}  // namespace

std::vector<gid_t> UserDatabaseGroups(uid_t uid, gid_t gid) {
  struct passwd entry;
  struct passwd* found = nullptr;
  std::vector<char> buffer(16384);
  if (getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &found) != 0 ||
      found == nullptr) {
    return {};
  }
  std::vector<gid_t> groups(64);
  int count = static_cast<int>(groups.size());
  if (getgrouplist(entry.pw_name, gid, groups.data(), &count) < 0) {
    groups.resize(static_cast<size_t>(count));  // count now says how many
    if (getgrouplist(entry.pw_name, gid, groups.data(), &count) < 0) return {};
  }
  groups.resize(static_cast<size_t>(count));
  groups.erase(std::remove(groups.begin(), groups.end(), gid), groups.end());
  return groups;
}

FsUser FileOwner(const struct stat& status) {
  FsUser user;
  user.uid = status.st_uid;
  user.gid = status.st_gid;
  // The owner's own primary group, not the file's: a folder of group
  // "users" owned by alice is worked on as alice with alice's groups.
  struct passwd entry;
  struct passwd* found = nullptr;
  std::vector<char> buffer(16384);
  if (getpwuid_r(status.st_uid, &entry, buffer.data(), buffer.size(), &found) ==
          0 &&
      found != nullptr) {
    user.gid = entry.pw_gid;
  }
  user.groups = UserDatabaseGroups(user.uid, user.gid);
  return user;
}

FsIdentity::FsIdentity(const FsUser& user) {
  saved_uid_ = CurrentFsUid();
  saved_gid_ = CurrentFsGid();
  int count = getgroups(0, nullptr);
  if (count < 0) return;
  saved_groups_.resize(static_cast<size_t>(count));
  if (getgroups(count, saved_groups_.data()) != count) return;
  if (!SetThreadGroups(user.groups)) return;
  if (!SetThreadFsIds(user.uid, user.gid)) {
    SetThreadFsIds(saved_uid_, saved_gid_);
    SetThreadGroups(saved_groups_);
    return;
  }
  taken_ = true;
}

FsIdentity::~FsIdentity() {
  if (!taken_) return;
  SetThreadFsIds(saved_uid_, saved_gid_);
  SetThreadGroups(saved_groups_);
}

}  // namespace quvaidx_daemons
