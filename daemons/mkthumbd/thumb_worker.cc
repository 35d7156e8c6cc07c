#include "thumb_worker.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <utility>

#include <quvahost/quvahost.h>
#include <quvaidx/log.h>
#include <quvaidx/media_type.h>
#include <quvaidx/path_rules.h>
#include <quvaidx/spool_consumer.h>

namespace mkthumbd {
namespace {

constexpr char kModule[] = "quvamkthumbd";
// Deeper folders than this are not walked up to their share.
constexpr int kMaxDepth = 4096;

bool SameTime(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// The names of the web photos directly in the directory open as `dir_fd`,
// sorted bytewise. Symbolic links and anything but regular files are left
// out. Listed through a descriptor of its own, so `dir_fd` keeps its place.
std::vector<std::string> ListPhotos(int dir_fd) {
  std::vector<std::string> names;
  const int fd = openat(dir_fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  DIR* dir = fd < 0 ? nullptr : fdopendir(fd);
  if (dir == nullptr) {
    if (fd >= 0) close(fd);
    return names;
  }
  while (struct dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (!EntryNameShouldIndex(name) || !BlQUVAIndexIsPhotoOnWebFile(name)) {
      continue;
    }
    bool regular = entry->d_type == DT_REG;
    if (entry->d_type == DT_UNKNOWN) {  // some filesystems do not say
      struct stat st;
      regular = fstatat(fd, name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                S_ISREG(st.st_mode);
    }
    if (regular) names.push_back(name);
  }
  closedir(dir);
  std::sort(names.begin(), names.end());
  return names;
}

// The folder on disk of the share that holds `entry`, a queued path (whole
// components compared, links not resolved); false when no share does.
bool ShareOf(const std::string& entry, std::string* share) {
  ShareRecord* record = nullptr;
  const bool found =
      QUVAShareGetByAttrStr(entry.c_str(), QUVA_SHARE_ATTR_PATH, &record) == 0;
  if (found) *share = record->szPath;
  QUVAShareFree(record);
  return found;
}

// "" when the directory open as `folder_fd` is the folder `share` or lies
// under it; else why not. The folder's parents are walked up by
// descriptor, so whatever links the queued path went through, the folder
// actually opened is the one checked.
std::string OutsideShare(int folder_fd, const std::string& share) {
  struct stat top;
  if (stat(share.c_str(), &top) != 0) {
    return "its share " + share + " cannot be examined: " + strerror(errno);
  }
  int at = dup(folder_fd);
  for (int depth = 0; at >= 0 && depth < kMaxDepth; ++depth) {
    struct stat here;
    if (fstat(at, &here) != 0) break;
    if (SameFile(here, top)) {
      close(at);
      return "";
    }
    const int up = openat(at, "..", O_PATH | O_DIRECTORY | O_CLOEXEC);
    struct stat parent;
    const bool root =
        up >= 0 && fstat(up, &parent) == 0 && SameFile(parent, here);
    close(at);
    if (root) close(up);
    at = root ? -1 : up;
  }
  if (at >= 0) close(at);
  return "outside its share " + share + " (a link on the way leads out)";
}

}  // namespace

ThumbWorker::ThumbWorker(std::string queue, MakeFunction make)
    : queue_(std::move(queue)),
      make_(std::move(make)),
      root_(geteuid() == 0),
      batch_(Json::arrayValue) {}

ThumbWorker::~ThumbWorker() { CloseFolder(); }

void ThumbWorker::CloseFolder() {
  if (folder_fd_ >= 0) close(folder_fd_);
  folder_fd_ = -1;
}

ThumbWorker::Did ThumbWorker::Step() {
  if (next_ >= batch_.size()) {
    Json::Value entries;
    int n = ReadQueueHead(queue_.c_str(), kBatch, entries);
    if (n <= 0) {
      if (n < 0) {
        AppLogError(3, "%s:%d cannot read the queue %s", kModule, __LINE__,
                    queue_.c_str());
      }
      return Did::kNothing;
    }
    batch_.swap(entries);
    next_ = 0;
    listed_ = false;
    return Did::kRead;
  }
  if (!listed_) {
    StartEntry(batch_[next_].asString());
    listed_ = true;
    return Did::kListed;
  }
  if (photo_ >= photos_.size()) return FinishEntry();

  const std::string& name = photos_[photo_++];
  const std::string photo = (folder_ == "/" ? "" : folder_) + "/" + name;
  std::optional<quvaidx_daemons::FsIdentity> as_owner;
  if (root_) as_owner.emplace(owner_);
  PhotoResult result;
  if (as_owner && !as_owner->taken()) {
    stamps_.push_back({{0, 0}, -1});
    result.reason = "cannot work as user " + std::to_string(owner_.uid);
  } else {
    struct stat st;
    Stamp stamp = {{0, 0}, -1};  // a photo that is gone cannot change
    if (fstatat(folder_fd_, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
      stamp = {st.st_mtim, st.st_size};
    }
    stamps_.push_back(stamp);
    result = make_(folder_fd_, folder_, name);
  }
  switch (result.outcome) {
    case PhotoOutcome::kMade:
      ++counts_.photos_made;
      AppLogError(6, "%s:%d made thumbnails 0x%x of %s", kModule, __LINE__,
                  result.made, photo.c_str());
      if (!result.reason.empty()) {
        AppLogError(3, "%s:%d %s: %s", kModule, __LINE__, photo.c_str(),
                    result.reason.c_str());
      }
      break;
    case PhotoOutcome::kUpToDate:
      ++counts_.photos_up_to_date;
      break;
    case PhotoOutcome::kSkipped:
      ++counts_.photos_skipped;
      AppLogError(3, "%s:%d skipped %s: %s", kModule, __LINE__, photo.c_str(),
                  result.reason.c_str());
      break;
  }
  return Did::kPhoto;
}

std::string ThumbWorker::OpenFolder(const std::string& entry) {
  if (entry.empty() || entry[0] != '/') return "not an absolute path";
  std::string share;
  if (!ShareOf(entry, &share)) return "outside every share";
  // O_PATH: opening reads nothing, and needs no right the owner's identity
  // would then be checked for.
  const int at =
      open(entry.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (at < 0) {
    struct stat st;
    if ((errno == ENOTDIR || errno == ELOOP) &&
        lstat(entry.c_str(), &st) == 0 && S_ISLNK(st.st_mode)) {
      return "a symbolic link";
    }
    return strerror(errno);
  }
  struct stat st;
  std::string problem = OutsideShare(at, share);
  if (problem.empty() && fstat(at, &st) != 0) problem = strerror(errno);
  if (!problem.empty()) {
    close(at);
    return problem;
  }
  owner_ = quvaidx_daemons::FileOwner(st);
  std::optional<quvaidx_daemons::FsIdentity> as_owner;
  if (root_) {
    as_owner.emplace(owner_);
    if (!as_owner->taken()) {
      close(at);
      return "cannot work as its owner, user " + std::to_string(st.st_uid);
    }
  }
  folder_fd_ = openat(at, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  const int err = errno;
  close(at);
  if (folder_fd_ < 0) return strerror(err);
  photos_ = ListPhotos(folder_fd_);
  return "";
}

void ThumbWorker::StartEntry(const std::string& entry) {
  CloseFolder();
  folder_.clear();
  photos_.clear();
  stamps_.clear();
  photo_ = 0;
  refused_ = true;
  // The queue's durable count of the attempts at its head entry, this one
  // included. A count that cannot be kept (logged by the library) costs
  // the protection, not the entry.
  const int attempt = CountQueueAttempt(queue_.c_str(), entry.c_str());
  if (attempt > kMaxAttempts) {
    ++counts_.entries_given_up;
    AppLogError(3,
                "%s:%d gave up queue entry '%s': %d attempts at it ended the "
                "daemon",
                kModule, __LINE__, entry.c_str(), kMaxAttempts);
    return;
  }
  const std::string problem = OpenFolder(entry);
  if (!problem.empty()) {
    CloseFolder();
    ++counts_.entries_refused;
    AppLogError(3, "%s:%d skipped queue entry '%s': %s", kModule, __LINE__,
                entry.c_str(), problem.c_str());
    return;
  }
  folder_ = entry;
  while (folder_.size() > 1 && folder_.back() == '/') folder_.pop_back();
  refused_ = false;
}

bool ThumbWorker::ChangedMeanwhile() const {
  if (refused_) return false;
  std::optional<quvaidx_daemons::FsIdentity> as_owner;
  if (root_) as_owner.emplace(owner_);
  const std::vector<std::string> now = ListPhotos(folder_fd_);
  for (const std::string& name : now) {
    if (!std::binary_search(photos_.begin(), photos_.end(), name)) return true;
  }
  for (size_t i = 0; i < stamps_.size(); ++i) {
    struct stat st;
    if (fstatat(folder_fd_, photos_[i].c_str(), &st, AT_SYMLINK_NOFOLLOW) ==
            0 &&
        (!SameTime(st.st_mtim, stamps_[i].mtime) ||
         st.st_size != stamps_[i].size)) {
      return true;
    }
  }
  return false;
}

ThumbWorker::Did ThumbWorker::FinishEntry() {
  const Json::Value& entry = batch_[next_];
  const bool changed = ChangedMeanwhile();
  CloseFolder();
  Json::Value done(Json::arrayValue);
  done.append(entry);
  Json::Value again(Json::arrayValue);
  if (changed) again.append(entry);
  if (RemoveDoneQueueEntries(queue_.c_str(), done, again) < 0) {
    // The entry stays at the head: leave the rest of the batch until the
    // next wake-up rather than redo it at once, forever.
    AppLogError(3, "%s:%d cannot remove '%s' from the queue %s", kModule,
                __LINE__, entry.asCString(), queue_.c_str());
    batch_ = Json::Value(Json::arrayValue);
    next_ = 0;
    listed_ = false;
    return Did::kNothing;
  }
  ++counts_.entries_done;
  if (changed) {
    ++counts_.entries_requeued;
    AppLogError(6, "%s:%d %s changed meanwhile: queued again", kModule,
                __LINE__, entry.asCString());
  }
  ++next_;
  listed_ = false;
  return Did::kEntry;
}

}  // namespace mkthumbd
