// quvaidx thumb: asking the thumbnail or web-video daemon for previews.
//
// Each PATH is queued by its canonical absolute path, since the daemon
// reads the queue from a working directory of its own, and each gets one
// line: what was queued (stdout) or why nothing was (stderr). The daemon
// is checked first, so that when it is not running nothing at all is
// queued.
#include <stdio.h>

#include <string>
#include <vector>

#include "cli.h"
#include "commands.h"
#include "preview_queue.h"
#include "quvaidx/paths.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "thumb";

struct Options {
  PreviewTarget target;
  bool null_list = false;
};

quvaidx_tools::CommandLine MakeLine(Options* o) {
  std::vector<quvaidx_tools::Option> options = {
      quvaidx_tools::Flag("video", 0, &o->target.video,
                          "queue web-video work instead of thumbnails"),
      NullOption(&o->null_list)};
  for (quvaidx_tools::Option& option : PreviewTargetOptions(&o->target, "")) {
    options.push_back(std::move(option));
  }
  return Subcommand(
      kName, {"[--video] [OPTIONS] PATH...|-"},
      std::string("Queues preview work for each PATH, a directory or a "
                  "regular file, and\nwakes the daemon that does it:\n"
                  "  photos (default)  the folder of a web photo, or a "
                  "directory, goes to\n                    ") +
          quvaidx::kThumbSpoolQueue.queue + " for " +
          quvaidx::kThumbSpoolQueue.daemon +
          "\n  --video           a web video, or a directory, goes to\n"
          "                    " +
          quvaidx::kFlvSpoolQueue.queue + " for " +
          quvaidx::kFlvSpoolQueue.daemon +
          "\nEach PATH gets one line: what was queued, on stdout, or why "
          "nothing\nwas, on stderr (a file of no interest, a folder outside "
          "every share,\na name holding a line feed). Paths are queued as "
          "canonical absolute\npaths. With -, the PATHs are read from "
          "standard input, one per line.\nThe daemon must be running (its "
          "pid file names a live process);\notherwise nothing is queued.\n",
      options,
      "Exit status: 0 when something was queued for every PATH, 1 when\n"
      "nothing was for some PATH, 2 on a usage error, a daemon that is not\n"
      "running or a failed queue write.\n"
      "\n"
      "Examples:\n"
      "  $ quvaidx thumb /share/Photos/2015\n"
      "  $ find /share/Videos -name '*.mp4' -print0 | quvaidx thumb --video "
      "-0 -\n");
}

}  // namespace

int RunThumb(int argc, char** argv) {
  Options o;
  std::vector<std::string> paths;
  if (int status = ParseCommand(MakeLine(&o), {"PATH", 1, -1, &o.null_list},
                                argc, argv, &paths);
      status != kContinue) {
    return status;
  }
  PreviewQueuer queuer(kName, o.target);
  if (!queuer.Ready()) return kExitError;
  int status = kExitOk;
  for (const std::string& path : paths) {
    std::string resolved, report;
    PreviewQueuer::Outcome outcome = PreviewQueuer::kRefused;
    if (ResolvePath(kName, path, &resolved)) {
      outcome = queuer.Queue(resolved, &report);
    }
    if (outcome == PreviewQueuer::kQueued) {
      printf("queued %s for %s\n", report.c_str(), queuer.daemon());
      fflush(stdout);  // in step with the refusals on stderr
      continue;
    }
    status = kExitFalse;
    if (!report.empty())
      PrintError(kName, "not queued: " + path + ": " + report);
    if (outcome == PreviewQueuer::kFailed) {
      status = kExitError;
      break;
    }
  }
  fflush(stdout);
  queuer.Wake();
  return status;
}

}  // namespace quvaidx_cli
