#include "thumb_worker.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>

#include <algorithm>
#include <utility>

#include <quvaidx/log.h>
#include <quvaidx/media_type.h>
#include <quvaidx/path_rules.h>
#include <quvaidx/spool_consumer.h>

namespace mkthumbd {
namespace {

constexpr char kModule[] = "quvamkthumbd";

bool SameTime(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

// The names of the web photos directly in the open directory `dir`, sorted
// bytewise. Symbolic links and anything but regular files are left out.
std::vector<std::string> ListPhotos(DIR* dir) {
  std::vector<std::string> names;
  const int fd = dirfd(dir);
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
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace

ThumbWorker::ThumbWorker(std::string queue, MakeFunction make)
    : queue_(std::move(queue)),
      make_(std::move(make)),
      batch_(Json::arrayValue) {}

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
  if (photo_ < photos_.size()) {
    const std::string photo =
        (folder_ == "/" ? "" : folder_) + "/" + photos_[photo_++];
    struct stat st;
    Stamp stamp = {{0, 0}, -1};  // a photo that is gone cannot change
    if (lstat(photo.c_str(), &st) == 0) stamp = {st.st_mtim, st.st_size};
    stamps_.push_back(stamp);
    PhotoResult result = make_(photo);
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
  return FinishEntry();
}

void ThumbWorker::StartEntry(const std::string& entry) {
  folder_.clear();
  photos_.clear();
  stamps_.clear();
  photo_ = 0;
  refused_ = true;
  const char* problem = nullptr;
  DIR* dir = nullptr;
  if (entry.empty() || entry[0] != '/') {
    problem = "not an absolute path";
  } else if ((dir = opendir(entry.c_str())) == nullptr) {
    problem = strerror(errno);
  }
  if (problem != nullptr) {
    if (dir != nullptr) closedir(dir);
    ++counts_.entries_refused;
    AppLogError(3, "%s:%d skipped queue entry '%s': %s", kModule, __LINE__,
                entry.c_str(), problem);
    return;
  }
  photos_ = ListPhotos(dir);
  closedir(dir);
  folder_ = entry;
  while (folder_.size() > 1 && folder_.back() == '/') folder_.pop_back();
  refused_ = false;
}

bool ThumbWorker::ChangedMeanwhile() const {
  if (refused_) return false;
  DIR* dir = opendir(folder_.c_str());
  if (dir == nullptr) return false;  // a folder that is gone has nothing left
  const std::vector<std::string> now = ListPhotos(dir);
  closedir(dir);
  for (const std::string& name : now) {
    if (!std::binary_search(photos_.begin(), photos_.end(), name)) return true;
  }
  for (size_t i = 0; i < stamps_.size(); ++i) {
    struct stat st;
    const std::string photo =
        (folder_ == "/" ? "" : folder_) + "/" + photos_[i];
    if (lstat(photo.c_str(), &st) == 0 &&
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
