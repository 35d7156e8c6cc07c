#include "preview_queue.h"

#include <errno.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "cli.h"
#include "quvahost/quvahost.h"
#include "quvaidx/media_type.h"
#include "quvaidx/paths.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

// The directory part of `path`: "." when it has none.
std::string DirectoryOf(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

bool InsideAShare(const std::string& path) {
  ShareRecord* share = nullptr;
  bool inside =
      QUVAShareGetByAttrStr(path.c_str(), QUVA_SHARE_ATTR_PATH, &share) == 0;
  QUVAShareFree(share);
  return inside;
}

}  // namespace

std::vector<quvaidx_tools::Option> PreviewTargetOptions(PreviewTarget* target,
                                                        const char* applies) {
  using quvaidx_tools::Text;
  return {
      Text("queue", 'q', "FILE", &target->queue,
           std::string("the queue to write") + applies + " (default\n" +
               quvaidx::kThumbSpoolQueue.queue +
               ", with "
               "--video " +
               quvaidx::kFlvSpoolQueue.queue + ")"),
      Text("pidfile", 'p', "FILE", &target->pid_file,
           std::string("the pid file of the daemon to wake") + applies +
               "\n(default " + quvaidx::kThumbSpoolQueue.pid_file +
               ", with\n"
               "--video " +
               quvaidx::kFlvSpoolQueue.pid_file + ")"),
  };
}

bool CheckWritableQueue(const char* command, const std::string& queue) {
  struct stat st;
  if (stat(queue.c_str(), &st) == 0) {
    if (!S_ISREG(st.st_mode)) {
      PrintError(command, queue + " is not a regular file");
      return false;
    }
    if (access(queue.c_str(), W_OK) != 0) {
      PrintError(command, queue + ": " + strerror(errno));
      return false;
    }
    return true;
  }
  if (errno != ENOENT) {
    PrintError(command, queue + ": " + strerror(errno));
    return false;
  }
  std::string dir = DirectoryOf(queue);
  if (access(dir.c_str(), W_OK | X_OK) != 0) {
    PrintError(command,
               "cannot create " + queue + ": " + dir + ": " + strerror(errno));
    return false;
  }
  return true;
}

PreviewQueuer::PreviewQueuer(const char* command, const PreviewTarget& target)
    : command_(command), video_(target.video) {
  const quvaidx::SpoolQueuePaths& known =
      video_ ? quvaidx::kFlvSpoolQueue : quvaidx::kThumbSpoolQueue;
  queue_ = target.queue.empty() ? known.queue : target.queue;
  pid_file_ = target.pid_file.empty() ? known.pid_file : target.pid_file;
  daemon_ = known.daemon;
}

bool PreviewQueuer::Ready() {
  // A pid file naming a dead or recycled pid counts as no daemon: a signal
  // would reach whatever unrelated process holds that pid now.
  pid_ = QLIBCReadPidFile(pid_file_.c_str());
  if (pid_ <= 0 || QLIBCProcAliveByPidFile(pid_file_.c_str()) != 1) {
    PrintError(command_,
               std::string("the ") + (video_ ? "web-video" : "thumbnail") +
                   " daemon (" + daemon_ + ") is not running: " + pid_file_ +
                   " names no live process; nothing was queued");
    return false;
  }
  return CheckWritableQueue(command_, queue_);
}

PreviewQueuer::Outcome PreviewQueuer::Queue(const std::string& path,
                                            std::string* report) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) {
    *report = strerror(errno);
    return kRefused;
  }
  std::string entry;
  if (S_ISDIR(st.st_mode)) {
    entry = path;
  } else if (!S_ISREG(st.st_mode)) {
    *report = "neither a directory nor a regular file";
    return kRefused;
  } else if (!video_ && BlQUVAIndexIsPhotoOnWebFile(path.c_str())) {
    entry = DirectoryOf(path);
  } else if (video_ && BlQUVAIndexIsVideoOnWebFile(path.c_str())) {
    entry = path;
  } else {
    *report = video_ ? "not a web video" : "not a web photo";
    return kNotWanted;
  }
  if (entry.find('\n') != std::string::npos) {
    *report = "the name holds a line feed, which a queue line cannot carry";
    return kRefused;
  }
  if (entry.size() > static_cast<size_t>(kMaxQueueEntry)) {
    *report = "longer than a queue line (" + std::to_string(kMaxQueueEntry) +
              " bytes)";
    return kRefused;
  }
  if (!InsideAShare(entry)) {
    *report = entry == path ? "outside every share"
                            : entry + " is outside every share";
    return kRefused;
  }
  if (WriteIndexQueue(entry.c_str(), queue_.c_str()) != 0) {
    *report = "cannot write " + queue_ +
              " (--verbose shows the library's "
              "report)";
    return kFailed;
  }
  queued_ = true;
  *report = entry;
  if (entry != path) {
    *report += " (the folder of " + path.substr(entry.size() + 1) + ")";
  }
  return kQueued;
}

void PreviewQueuer::Wake() {
  if (!queued_) return;
  queued_ = false;
  // Checked again: the daemon may have ended since Ready.
  if (QLIBCProcAliveByPidFile(pid_file_.c_str()) == 1) kill(pid_, SIGUSR1);
}

}  // namespace quvaidx_cli
