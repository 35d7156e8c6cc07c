// Queueing preview work as WriteThumbQueue does, for `quvaidx thumb` and
// `quvaidx scan --queue-thumbs`, on any queue and pid file: each path's
// entry is decided here, so the tool can say what it queued or why not.
//
// A directory is queued itself; a regular file queues its folder (a web
// photo, for thumbnails) or itself (a web video, for web video); any other
// file queues nothing. An entry is refused when it lies outside every share
// (the host's share database), holds a line feed (a queue line cannot carry
// one) or is longer than kMaxQueueEntry bytes. Entries go to the queue with
// WriteIndexQueue, so none is queued twice, and the daemon named by the pid
// file is woken once, with SIGUSR1, after the last.
#ifndef QUVAIDX_TOOLS_PREVIEW_QUEUE_H_
#define QUVAIDX_TOOLS_PREVIEW_QUEUE_H_

#include <string>
#include <vector>

#include "options.h"

namespace quvaidx_cli {

// Which queue and daemon.
struct PreviewTarget {
  bool video = false;    // web video instead of thumbnails
  std::string queue;     // empty: the well-known queue of the kind
  std::string pid_file;  // empty: the well-known pid file of its daemon
};

// -q/--queue FILE and -p/--pidfile FILE, setting *target; `applies` says to
// what ("" or " (with --queue-thumbs)").
std::vector<quvaidx_tools::Option> PreviewTargetOptions(PreviewTarget* target,
                                                        const char* applies);

// Checks that `queue` can be written (or created), so that the library's
// open is not refused: it retries a refused open for sixteen seconds. Prints
// one line and returns false otherwise.
bool CheckWritableQueue(const char* command, const std::string& queue);

class PreviewQueuer {
 public:
  enum Outcome {
    kQueued,     // the entry is in the queue
    kNotWanted,  // a file of no interest: nothing to queue
    kRefused,    // an entry that must not be queued
    kFailed,     // the queue could not be written: later entries would fail
  };

  PreviewQueuer(const char* command, const PreviewTarget& target);
  PreviewQueuer(const PreviewQueuer&) = delete;
  PreviewQueuer& operator=(const PreviewQueuer&) = delete;

  // Checks that the daemon runs (its pid file names a live process) and
  // that the queue can be written. Prints why not and returns false.
  bool Ready();

  // Queues the work for `path`, a canonical absolute path. Sets *report to
  // the entry queued ("/share/a (the folder of b.jpg)") or to why nothing
  // was ("not a web photo", "outside every share").
  Outcome Queue(const std::string& path, std::string* report);

  // Wakes the daemon when anything was queued since the last call.
  void Wake();

  // "quvamkthumbd", for messages.
  const char* daemon() const { return daemon_; }

 private:
  const char* command_;
  bool video_;
  std::string queue_;
  std::string pid_file_;
  const char* daemon_;
  int pid_ = 0;          // the daemon's, once Ready
  bool queued_ = false;  // an entry was queued since the last wake
};

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_PREVIEW_QUEUE_H_
