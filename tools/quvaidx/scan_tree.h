// The walk behind `quvaidx scan`: one folder tree visited with the index's
// rules, every regular file classified, the results counted.
//
// The walk is iterative and keeps, per folder on the current path, only the
// names of the subfolders still to visit, so its memory grows with the
// depth and breadth of folders, never with the number of files. It holds
// one or two descriptors at a time, whatever the depth: it descends with
// openat and climbs back with "..", checked against the folder it left.
//
// Rules, in the order they are applied to each directory entry:
//   - "." and ".." are passed over and not counted;
//   - a name EntryNameShouldIndex refuses is skipped, with its reason;
//   - a symbolic link is never followed (counted);
//   - a folder is skipped when QUVAPathUnderRecyle holds for its path, when
//     it is a mount point (its device differs from its parent's) on a
//     network or image filesystem (IndexIsPathRemoteOrImageMount), or when
//     it is already on the current path (same device and inode: a loop);
//   - a regular file is classified by its name's extension;
//   - anything else (device, socket, pipe) is counted as special.
//
// Not thread-safe: one TreeScanner per thread.
#ifndef QUVAIDX_TOOLS_SCAN_TREE_H_
#define QUVAIDX_TOOLS_SCAN_TREE_H_

#include <stdint.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <set>
#include <string>
#include <utility>
#include <vector>

namespace quvaidx_cli {

// Why an entry was not indexed. The name reasons replay the tests of
// EntryNameShouldIndex in its order; kOtherName catches a refusal that
// none of them explains.
enum SkipReason {
  kSkipAppleDouble,   // name begins with "._"
  kSkipRecycleName,   // exactly "#recycle"
  kSkipSnapshotName,  // exactly "#snapshot"
  kSkipMetadataDir,   // the host's hidden metadata folder
  kSkipAppBundle,     // name ends in ".app"
  kSkipOtherName,     // refused by EntryNameShouldIndex for another reason
  kSkipUnderRecycle,  // a folder whose path QUVAPathUnderRecyle accepts
  kSkipMount,         // a mount point on a network or image filesystem
  kSkipSymlink,       // a symbolic link, never followed
  kSkipLoop,          // a folder already on the current path
  kSkipSpecial,       // a device, socket or pipe
  kSkipReasonCount
};

// Media tables as counted here: the index's four tables and "other" for
// MEDIA_TABLE_NONE.
enum TableIndex {
  kTableMusic,
  kTableVideo,
  kTablePhoto,
  kTablePlaylist,
  kTableOther,
  kTableCount
};

// Totals of one or more walks.
struct ScanCounts {
  uint64_t entries = 0;               // directory entries seen, dots excluded
  uint64_t folders = 0;               // folders whose entries were read
  uint64_t files = 0;                 // regular files classified
  uint64_t tables[kTableCount] = {};  // files per media table
  uint64_t web_video = 0;             // videos playable on the web
  uint64_t thumb_photos = 0;          // photos that need thumbnails
  uint64_t thumb_folders = 0;         // folders holding such photos
  uint64_t web_convert_photos = 0;    // photos converted for the web
  uint64_t skipped[kSkipReasonCount] = {};  // entries not indexed, by reason
  uint64_t unreadable = 0;                  // folders that could not be read
};

// What the walk reports as it goes. Every call is made on the walking
// thread; `path` is valid only during the call.
class ScanObserver {
 public:
  virtual ~ScanObserver() = default;
  // A regular file that passed the rules, with its table. Called only when
  // the scanner was built with `report_files`.
  virtual void OnFile(const std::string& path, TableIndex table) = 0;
  // A folder whose own files include photos that need thumbnails; called
  // once per folder, after its entries were read.
  virtual void OnThumbFolder(const std::string& path) = 0;
  // A folder that could not be opened, read or returned to, and why (the
  // text of errno, or a sentence).
  virtual void OnUnreadable(const std::string& path, const char* reason) = 0;
  // Called at every folder and every 1024 entries, for progress displays;
  // `path` is the folder being read.
  virtual void OnProgress(uint64_t entries, const std::string& path) = 0;
};

class TreeScanner {
 public:
  // `observer` must outlive the scanner. With `report_files`, OnFile is
  // called for every classified file.
  TreeScanner(ScanObserver* observer, bool report_files);

  // Walks the folder tree at `root`, an absolute path naming a directory
  // (symbolic links in it are resolved by the caller); adds to counts().
  // Folders that fail are reported to the observer and counted, and the
  // walk goes on with the rest.
  void Scan(const std::string& root);

  const ScanCounts& counts() const { return counts_; }

 private:
  // One folder on the current path.
  struct Frame {
    dev_t dev;               // its device, to spot mount points below it
    ino_t ino;               // with dev, to spot loops and to check ".."
    size_t path_length;      // length of path_ while it is the current folder
    std::string subfolders;  // names to visit, each ended by '\0'
    size_t next = 0;         // offset of the next name in `subfolders`
  };

  // Reads the entries of the open folder `fd` (path_ names it): classifies
  // its files, counts what is skipped and stores its subfolders in
  // `frame`. Does not close `fd`. A read that fails is reported; what was
  // read before it is kept.
  void ReadFolder(int fd, Frame* frame);
  // Reads the open folder `fd` (path_ names it, `st` describes it) and,
  // when it has subfolders to visit, puts it on the current path as the
  // last of `frames` and returns true: `fd` is then its descriptor. A
  // folder without subfolders is finished at once: `fd` is closed and the
  // result is false.
  bool Enter(int fd, const struct stat& st, std::vector<Frame>* frames);
  // Handles one entry of the folder being read; `type` is a DT_ value.
  void VisitEntry(int dir_fd, const char* name, unsigned char type,
                  Frame* frame, bool* has_thumb_photos);
  void ClassifyFile(const char* name, bool* has_thumb_photos);
  // Opens the subfolder `name` of the current folder (fd `parent_fd`, frame
  // `parent`) when the rules allow it; path_ already names it. Returns the
  // descriptor, or -1 when it is skipped or fails (counted and reported).
  int OpenSubfolder(int parent_fd, const Frame& parent, const char* name,
                    struct stat* st);
  // Reopens the folder of `frame` (path_ names it) after leaving a child
  // whose descriptor is `child_fd`; -1 when it moved away or failed.
  int ReturnTo(int child_fd, const Frame& frame);
  // Makes path_ its first `length` bytes followed by "/name".
  void SetPath(size_t length, const char* name);
  void Unreadable(const char* reason);
  void Progress();

  ScanObserver* observer_;
  bool report_files_;
  ScanCounts counts_;
  std::string path_;  // the folder (or file) being looked at
  std::set<std::pair<dev_t, ino_t>> on_path_;  // folders of the frames
  uint64_t next_progress_ = 0;                 // entries at the next call
};

// The names of the tables and skip reasons, for output.
const char* TableName(TableIndex table);         // "music", ..., "other"
const char* SkipKey(SkipReason reason);          // "apple_double", ...
const char* SkipDescription(SkipReason reason);  // "AppleDouble files ..."

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_SCAN_TREE_H_
