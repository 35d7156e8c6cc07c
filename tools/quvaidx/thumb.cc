// quvaidx thumb: asking the thumbnail or web-video daemon for previews.
//
// Each PATH goes to WriteThumbQueue by its canonical absolute path, since
// the daemon reads the queue from a working directory of its own. The
// paths and the daemon are checked first, so that a missing path or a
// daemon that is not running is reported on one line and nothing at all is
// queued.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "cli.h"
#include "commands.h"
#include "quvahost/quvahost.h"
#include "quvaidx/paths.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "thumb";

// The daemons that serve the two queues, from the library's table of
// well-known paths.
struct PreviewDaemon {
  const char* name;
  const char* pid_file;
  const char* queue;
  const char* work;  // the kind of daemon, for messages
};
constexpr PreviewDaemon kPhotoDaemon = {
    quvaidx::kThumbSpoolQueue.daemon, quvaidx::kThumbSpoolQueue.pid_file,
    quvaidx::kThumbSpoolQueue.queue, "thumbnail"};
constexpr PreviewDaemon kVideoDaemon = {
    quvaidx::kFlvSpoolQueue.daemon, quvaidx::kFlvSpoolQueue.pid_file,
    quvaidx::kFlvSpoolQueue.queue, "web-video"};

quvaidx_tools::CommandLine MakeLine(bool* video) {
  return Subcommand(
      kName, {"[--video] PATH..."},
      std::string("Queues preview work for each PATH, a directory or a "
                  "regular file, and\nwakes the daemon that does it:\n"
                  "  photos (default)  the folder of a web photo, or a "
                  "directory, goes to\n                    ") +
          kPhotoDaemon.queue + " for " + kPhotoDaemon.name +
          "\n  --video           a web video, or a directory, goes to\n"
          "                    " +
          kVideoDaemon.queue + " for " + kVideoDaemon.name +
          "\nFiles of no interest queue nothing. Paths are queued as "
          "canonical\nabsolute paths. The daemon must be running (its pid "
          "file names a live\nprocess); otherwise nothing is queued.\n",
      {quvaidx_tools::Flag("video", 'V', video,
                           "queue web-video work instead of thumbnails")},
      "Exit status: 0 when every PATH was handled, 2 on a usage error, a\n"
      "missing PATH, a daemon that is not running or a failed queue "
      "write.\n");
}

// The canonical absolute path of `path`, which must name a directory or a
// regular file. Prints one line and returns false otherwise.
bool ResolvePath(const char* path, std::string* resolved) {
  struct stat st;
  if (stat(path, &st) != 0) {
    PrintError(kName, std::string(path) + ": " + strerror(errno));
    return false;
  }
  if (!S_ISDIR(st.st_mode) && !S_ISREG(st.st_mode)) {
    PrintError(kName, std::string(path) +
                          " is neither a directory nor a regular file");
    return false;
  }
  char* real = GetRealPath(path);
  if (real == nullptr) {
    PrintError(kName, std::string("cannot resolve ") + path);
    return false;
  }
  *resolved = real;
  free(real);
  return true;
}

}  // namespace

int RunThumb(int argc, char** argv) {
  bool video = false;
  int first = 0;
  int status = ParseArguments(MakeLine(&video), argc, argv, &first);
  if (status != kContinue) return status;
  if (first >= argc) return UsageError(kName, "missing PATH");
  std::vector<std::string> paths;
  for (int i = first; i < argc; ++i) {
    std::string resolved;
    if (!ResolvePath(argv[i], &resolved)) return kExitError;
    paths.push_back(resolved);
  }
  const PreviewDaemon& daemon = video ? kVideoDaemon : kPhotoDaemon;
  // The library makes the same check, but reports it only to the system log.
  if (QLIBCProcAliveByPidFile(daemon.pid_file) != 1) {
    PrintError(kName, std::string("the ") + daemon.work + " daemon (" +
                          daemon.name + ") is not running: " + daemon.pid_file +
                          " names no live process; nothing was queued");
    return kExitError;
  }
  const _tag_THUMB_TYPE_ type = video ? THUMB_TYPE_VIDEO : THUMB_TYPE_PHOTO;
  for (const std::string& path : paths) {
    if (WriteThumbQueue(path.c_str(), type) != 0) {
      PrintError(kName, "cannot queue " + path + " for " + daemon.name +
                            " (--verbose shows the library's report)");
      return kExitError;
    }
  }
  return kExitOk;
}

}  // namespace quvaidx_cli
