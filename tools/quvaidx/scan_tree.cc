#include "scan_tree.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <vector>

#include "quvahost/quvahost.h"
#include "quvaidx/media_type.h"
#include "quvaidx/path_rules.h"

namespace quvaidx_cli {
namespace {

constexpr uint64_t kProgressEvery = 1024;  // entries between progress calls

struct ReasonText {
  const char* key;          // JSON member
  const char* description;  // summary line
};

// Indexed by SkipReason.
constexpr ReasonText kReasonTexts[kSkipReasonCount] = {
    {"apple_double", "AppleDouble files (\"._\" names)"},
    {"recycle_bin", "recycle bins (\"#recycle\")"},
    {"snapshot", "snapshot folders (\"#snapshot\")"},
    {"metadata_folder", "metadata folders (\"" QUVA_EA_HIDDEN_DIR "\")"},
    {"app_bundle", "application bundles (\".app\")"},
    {"other_name", "other names the index refuses"},
    {"under_recycle_bin", "folders inside a share's recycle bin"},
    {"remote_or_image_mount", "network or image mounts"},
    {"symlink", "symbolic links (never followed)"},
    {"loop", "folder loops"},
    {"special", "devices, sockets and pipes"},
};

// Indexed by TableIndex.
constexpr const char* kTableNames[kTableCount] = {"music", "video", "photo",
                                                  "playlist", "other"};

// Which test of EntryNameShouldIndex refused `name`, replayed in its order.
SkipReason NameSkipReason(const char* name) {
  if (name[0] == '.' && name[1] == '_') return kSkipAppleDouble;
  if (strcmp(name, "#recycle") == 0) return kSkipRecycleName;
  if (strcmp(name, "#snapshot") == 0) return kSkipSnapshotName;
  if (QUVAEAIsHiddenDir(name)) return kSkipMetadataDir;
  const char* dot = strrchr(name, '.');
  if (dot != nullptr && strcmp(dot, ".app") == 0) return kSkipAppBundle;
  return kSkipOtherName;
}

TableIndex TableOf(int media_table) {
  switch (media_table) {
    case MEDIA_TABLE_MUSIC:
      return kTableMusic;
    case MEDIA_TABLE_VIDEO:
      return kTableVideo;
    case MEDIA_TABLE_PHOTO:
      return kTablePhoto;
    case MEDIA_TABLE_PLAYLIST:
      return kTablePlaylist;
    default:
      return kTableOther;
  }
}

bool IsDotOrDotDot(const char* name) {
  return name[0] == '.' &&
         (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

void CloseIfOpen(int fd) {
  if (fd >= 0) close(fd);
}

}  // namespace

const char* TableName(TableIndex table) { return kTableNames[table]; }
const char* SkipKey(SkipReason reason) { return kReasonTexts[reason].key; }
const char* SkipDescription(SkipReason reason) {
  return kReasonTexts[reason].description;
}

TreeScanner::TreeScanner(ScanObserver* observer, bool report_files)
    : observer_(observer), report_files_(report_files) {}

void TreeScanner::Scan(const std::string& root) {
  path_ = root;
  if (QUVAPathUnderRecyle(path_.c_str())) {
    ++counts_.skipped[kSkipUnderRecycle];
    return;
  }
  // The root may itself be a symbolic link: the caller named it.
  int fd = open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  struct stat st;
  if (fd < 0 || fstat(fd, &st) != 0) {
    Unreadable(strerror(errno));
    CloseIfOpen(fd);
    return;
  }
  // No parent to compare devices with: the root is always asked.
  if (IndexIsPathRemoteOrImageMount(path_.c_str())) {
    ++counts_.skipped[kSkipMount];
    close(fd);
    return;
  }

  std::vector<Frame> frames;
  if (!Enter(fd, st, &frames)) return;
  int current = fd;  // the folder of frames.back(), or -1 when lost

  while (!frames.empty()) {
    Frame& top = frames.back();
    if (top.next < top.subfolders.size()) {
      const char* name = top.subfolders.c_str() + top.next;
      top.next += strlen(name) + 1;
      SetPath(top.path_length, name);
      int child = OpenSubfolder(current, top, name, &st);
      // A folder without subfolders is finished at once: no need to
      // descend into it and climb back.
      if (child < 0 || !Enter(child, st, &frames)) continue;
      // `top` is invalid from here.
      CloseIfOpen(current);
      current = child;
      continue;
    }
    on_path_.erase({top.dev, top.ino});
    frames.pop_back();
    if (frames.empty()) break;
    Frame& parent = frames.back();
    path_.resize(parent.path_length);
    int parent_fd = ReturnTo(current, parent);
    CloseIfOpen(current);
    current = parent_fd;
    if (current < 0) {
      // Its remaining subfolders cannot be reached safely by name: the
      // folder now at this path is not the one whose entries were read.
      Unreadable("it was moved or replaced during the scan");
      parent.next = parent.subfolders.size();
    }
  }
  CloseIfOpen(current);
}

bool TreeScanner::Enter(int fd, const struct stat& st,
                        std::vector<Frame>* frames) {
  Frame frame{st.st_dev, st.st_ino, path_.size(), {}};
  ReadFolder(fd, &frame);
  if (frame.subfolders.empty()) {
    close(fd);
    return false;
  }
  on_path_.emplace(frame.dev, frame.ino);
  frames->push_back(std::move(frame));
  return true;
}

void TreeScanner::ReadFolder(int fd, Frame* frame) {
  observer_->OnProgress(counts_.entries, path_);
  // readdir closes the descriptor it reads from; `fd` stays open for
  // opening the subfolders.
  int read_fd = fcntl(fd, F_DUPFD_CLOEXEC, 0);
  DIR* dir = read_fd < 0 ? nullptr : fdopendir(read_fd);
  if (dir == nullptr) {
    Unreadable(strerror(errno));
    CloseIfOpen(read_fd);
    return;
  }
  ++counts_.folders;
  bool has_thumb_photos = false;
  int error = 0;
  for (;;) {
    errno = 0;
    struct dirent* entry = readdir(dir);
    if (entry == nullptr) {
      error = errno;
      break;
    }
    VisitEntry(read_fd, entry->d_name, entry->d_type, frame, &has_thumb_photos);
  }
  closedir(dir);
  if (error != 0) Unreadable(strerror(error));
  if (has_thumb_photos) {
    ++counts_.thumb_folders;
    observer_->OnThumbFolder(path_);
  }
}

void TreeScanner::VisitEntry(int dir_fd, const char* name, unsigned char type,
                             Frame* frame, bool* has_thumb_photos) {
  if (IsDotOrDotDot(name)) return;
  if (++counts_.entries >= next_progress_) Progress();
  if (!EntryNameShouldIndex(name)) {
    ++counts_.skipped[NameSkipReason(name)];
    return;
  }
  if (type == DT_UNKNOWN) {
    // The filesystem does not give the type in the listing.
    struct stat st;
    if (fstatat(dir_fd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
      return;  // gone since it was listed
    }
    type = IFTODT(st.st_mode);
  }
  switch (type) {
    case DT_REG:
      ClassifyFile(name, has_thumb_photos);
      break;
    case DT_DIR:
      frame->subfolders.append(name);
      frame->subfolders.push_back('\0');
      break;
    case DT_LNK:
      ++counts_.skipped[kSkipSymlink];
      break;
    default:
      ++counts_.skipped[kSkipSpecial];
      break;
  }
}

void TreeScanner::ClassifyFile(const char* name, bool* has_thumb_photos) {
  ++counts_.files;
  // The extension is taken from the entry name, never from the whole path,
  // so that a dot in a folder name cannot lend a file an extension.
  TableIndex table = TableOf(GetMediaTableTypeFromExt(QUVAIndexExtGet(name)));
  ++counts_.tables[table];
  // Every web video extension is a video extension, and every web photo
  // extension a photo extension: files of other tables need no more tests.
  if (table == kTableVideo && BlQUVAIndexIsVideoOnWebFile(name)) {
    ++counts_.web_video;
  } else if (table == kTablePhoto) {
    if (BlQUVAIndexIsPhotoOnWebFile(name)) {
      ++counts_.thumb_photos;
      *has_thumb_photos = true;
    }
    if (BlQUVAIndexIsPhotoOnWebConvertFile(name)) {
      ++counts_.web_convert_photos;
    }
  }
  if (report_files_) {
    size_t length = path_.size();
    SetPath(length, name);
    observer_->OnFile(path_, table);
    path_.resize(length);
  }
}

int TreeScanner::OpenSubfolder(int parent_fd, const Frame& parent,
                               const char* name, struct stat* st) {
  if (QUVAPathUnderRecyle(path_.c_str())) {
    ++counts_.skipped[kSkipUnderRecycle];
    return -1;
  }
  if (parent_fd < 0) return -1;
  int fd =
      openat(parent_fd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) {
    int error = errno;
    if (error == ELOOP) {
      ++counts_.skipped[kSkipSymlink];  // replaced by a link since listed
    } else if (error != ENOENT && error != ENOTDIR) {  // else: gone
      Unreadable(strerror(error));
    }
    return -1;
  }
  if (fstat(fd, st) != 0) {
    Unreadable(strerror(errno));
    close(fd);
    return -1;
  }
  // Only a mount point can change the filesystem, so only there is the
  // host asked, which keeps the test to one statfs per mount.
  if (st->st_dev != parent.dev &&
      IndexIsPathRemoteOrImageMount(path_.c_str())) {
    ++counts_.skipped[kSkipMount];
    close(fd);
    return -1;
  }
  if (on_path_.count({st->st_dev, st->st_ino}) != 0) {
    ++counts_.skipped[kSkipLoop];  // e.g. a bind mount of an ancestor
    close(fd);
    return -1;
  }
  return fd;
}

int TreeScanner::ReturnTo(int child_fd, const Frame& frame) {
  struct stat st;
  if (child_fd >= 0) {
    int fd = openat(child_fd, "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd >= 0) {
      if (fstat(fd, &st) == 0 && st.st_dev == frame.dev &&
          st.st_ino == frame.ino) {
        return fd;
      }
      close(fd);
    }
  }
  // The child was moved elsewhere: the folder may still be at its path.
  int fd = open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd >= 0) {
    if (fstat(fd, &st) == 0 && st.st_dev == frame.dev &&
        st.st_ino == frame.ino) {
      return fd;
    }
    close(fd);
  }
  return -1;
}

void TreeScanner::SetPath(size_t length, const char* name) {
  path_.resize(length);
  if (path_.empty() || path_.back() != '/') path_.push_back('/');
  path_.append(name);
}

void TreeScanner::Unreadable(const char* reason) {
  ++counts_.unreadable;
  observer_->OnUnreadable(path_, reason);
}

void TreeScanner::Progress() {
  next_progress_ = counts_.entries + kProgressEvery;
  observer_->OnProgress(counts_.entries, path_);
}

}  // namespace quvaidx_cli
