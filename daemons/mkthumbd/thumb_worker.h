// The thumbnail daemon's work on its queue, one small step at a time, so
// that the daemon's event loop runs between photos (a SIGTERM is handled
// after the photo at hand) and so that tests can drive it without a loop.
//
// An entry of the queue is a directory (WriteThumbQueue queues a photo's
// folder). Its work is every web photo directly in it
// (BlQUVAIndexIsPhotoOnWebFile on a regular file whose name
// EntryNameShouldIndex accepts; no subfolder, no symbolic link), in name order.
// Entries are read with the library's ReadQueueHead a few at a time, and each
// one is removed with RemoveDoneQueueEntries as soon as its work is done, so a
// daemon killed in the middle redoes at most the entry it was on.
//
// Whose rights. A root daemon does each entry's file work with the
// file-system identity of the folder's owner (FsIdentity of FileOwner), so
// that the kernel decides what may be listed, read and written, exactly as
// for that user. The folder is opened once (O_PATH, O_NOFOLLOW: a link at
// the queued name is refused), its owner read from that descriptor, and it
// is opened for listing from that descriptor with the owner's identity;
// every photo and the EA directories are reached from it (thumbnailer.h).
// A daemon that is not root works with its own identity.
//
// Where. A folder is served only inside a share of the host's share
// database: the queued path must lie in a share (whole components,
// QUVAShareGetByAttrStr), and the folder actually opened must lie under
// that share's folder (its parents walked up to it), so that a link in the
// middle of the queued path cannot lead out of the share. Other entries are
// logged and removed.
//
// Entries that kill the daemon. Each time an entry is started, the queue's
// durable count of its attempts goes up; an entry started for the
// (kMaxAttempts + 1)th time has ended the daemon (a crash, the memory limit)
// kMaxAttempts times: it is logged and removed without work, so that the
// folders behind it are served. A SIGTERM in the middle of an entry counts
// as an attempt too.
//
// An entry is done when all its photos were tried; a photo that cannot be
// made (unreadable, too large, gone) is logged and skipped. When a photo
// appeared in the folder, or one of its photos was rewritten, while the
// entry was worked on (the folder is listed again and each photo's time and
// size compared with those it had when it was made), the entry goes to the
// back of the queue in the same step that removes it: WriteThumbQueue does
// not queue a folder that is still in the queue, so the scan that noticed
// the change could not queue it again. (A change in the instant between
// that last look and the removal still goes unnoticed.) Entries that are not
// absolute paths of directories are logged and removed.
//
// Cost. Each entry costs a constant number of queue operations (one read of
// the head per kBatch entries, one removal per entry), whatever the queue's
// length.
#ifndef QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_
#define QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_

#include <sys/stat.h>

#include <functional>
#include <string>
#include <vector>

#include <json/json.h>

#include "fs_identity.h"
#include "thumbnailer.h"

namespace mkthumbd {

// What a worker has done so far.
struct WorkerCounts {
  long entries_done = 0;      // removed from the queue
  long entries_requeued = 0;  // sent to the back because they changed
  long entries_refused = 0;   // no folder, outside the shares, unreadable
  long entries_given_up = 0;  // ended the daemon too often
  long photos_made = 0;
  long photos_up_to_date = 0;
  long photos_skipped = 0;
};

class ThumbWorker {
 public:
  // How a photo is made: MakePhotoThumbnails, or a test's stand-in. It is
  // called with the entry's identity in force, with the folder's descriptor
  // (opened for reading), the folder's path and the photo's name.
  using MakeFunction = std::function<PhotoResult(
      int folder_fd, const std::string& folder, const std::string& name)>;

  // Entries read from the queue at a time.
  static constexpr int kBatch = 8;
  // Attempts at an entry before it is given up.
  static constexpr int kMaxAttempts = 3;

  ThumbWorker(std::string queue, MakeFunction make);
  ~ThumbWorker();
  ThumbWorker(const ThumbWorker&) = delete;
  ThumbWorker& operator=(const ThumbWorker&) = delete;

  // The kind of step that Step just did.
  enum class Did {
    kNothing,  // the queue is empty (or unreadable): wait for a wake-up
    kRead,     // read entries from the queue's head
    kListed,   // listed an entry's folder (or refused the entry)
    kPhoto,    // made (or skipped) one photo
    kEntry,    // finished an entry and removed it from the queue
  };

  // Does the next small piece of work. Call again while the result is not
  // kNothing. Problems are logged (AppLogError, level 3; progress at 6).
  Did Step();

  const WorkerCounts& counts() const { return counts_; }

 private:
  // Opens, checks and lists the entry's folder; on a refusal, logs it.
  void StartEntry(const std::string& entry);
  // Why the entry's folder cannot be served, or "" (it is then open).
  std::string OpenFolder(const std::string& entry);
  // True when a photo appeared or changed since it was listed or made.
  bool ChangedMeanwhile() const;
  Did FinishEntry();
  void CloseFolder();

  std::string queue_;
  MakeFunction make_;
  bool root_;                  // the process may take users' identities
  Json::Value batch_;          // entries read from the head
  Json::ArrayIndex next_ = 0;  // index in batch_ of the entry at hand
  bool listed_ = false;        // the entry at hand has been started
  // What a photo looked like just before it was made.
  struct Stamp {
    struct timespec mtime;
    off_t size;
  };

  bool refused_ = false;             // the entry at hand is not served
  std::string folder_;               // its folder, without a final '/'
  int folder_fd_ = -1;               // that folder, opened for reading
  quvaidx_daemons::FsUser owner_;    // the folder's owner, with groups
  std::vector<std::string> photos_;  // its photos' names, sorted
  std::vector<Stamp> stamps_;        // of photos_[0, photo_)
  size_t photo_ = 0;                 // the next photo to make
  WorkerCounts counts_;
};

}  // namespace mkthumbd

#endif  // QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_
