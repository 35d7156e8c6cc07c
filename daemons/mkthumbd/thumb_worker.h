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
#ifndef QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_
#define QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_

#include <sys/stat.h>

#include <functional>
#include <string>
#include <vector>

#include <json/json.h>

#include "thumbnailer.h"

namespace mkthumbd {

// What a worker has done so far.
struct WorkerCounts {
  long entries_done = 0;      // removed from the queue
  long entries_requeued = 0;  // sent to the back because they changed
  long entries_refused = 0;   // not a directory's absolute path
  long photos_made = 0;
  long photos_up_to_date = 0;
  long photos_skipped = 0;
};

class ThumbWorker {
 public:
  // How a photo is made: MakePhotoThumbnails, or a test's stand-in.
  using MakeFunction = std::function<PhotoResult(const std::string& photo)>;

  // Entries read from the queue at a time.
  static constexpr int kBatch = 8;

  ThumbWorker(std::string queue, MakeFunction make);

  // The kind of step that Step just did.
  enum class Did {
    kNothing,  // the queue is empty (or unreadable): wait for a wake-up
    kRead,     // read entries from the queue's head
    kListed,   // listed an entry's folder
    kPhoto,    // made (or skipped) one photo
    kEntry,    // finished an entry and removed it from the queue
  };

  // Does the next small piece of work. Call again while the result is not
  // kNothing. Problems are logged (AppLogError, level 3; progress at 6).
  Did Step();

  const WorkerCounts& counts() const { return counts_; }

 private:
  void StartEntry(const std::string& entry);
  // True when a photo appeared or changed since it was listed or made.
  bool ChangedMeanwhile() const;
  Did FinishEntry();

  std::string queue_;
  MakeFunction make_;
  Json::Value batch_;          // entries read from the head
  Json::ArrayIndex next_ = 0;  // index in batch_ of the entry at hand
  bool listed_ = false;        // the entry at hand has been listed
  // What a photo looked like just before it was made.
  struct Stamp {
    struct timespec mtime;
    off_t size;
  };

  bool refused_ = false;             // the entry at hand names no folder
  std::string folder_;               // its folder, without a final '/'
  std::vector<std::string> photos_;  // its photos' names, sorted
  std::vector<Stamp> stamps_;        // of photos_[0, photo_)
  size_t photo_ = 0;                 // the next photo to make
  WorkerCounts counts_;
};

}  // namespace mkthumbd

#endif  // QUVAIDX_DAEMONS_MKTHUMBD_THUMB_WORKER_H_
