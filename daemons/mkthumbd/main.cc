// quvamkthumbd: the thumbnail daemon. It serves the thumbnail queue that
// WriteThumbQueue feeds, making the thumbnails of preview_names.h for every
// photo of every queued folder (see thumb_worker.h and thumbnailer.h).
//
// Its life is the common one of daemons/common, without a socket. It sleeps
// in its event loop until SIGUSR1 (a libevent signal event) says the queue
// has grown, then works through the queue one photo per loop turn, so a
// SIGTERM or SIGINT ends it after the photo at hand, with that photo's
// thumbnails complete and its entry still queued. At start it looks at the
// queue once, for entries left from before, after removing the copies of
// the queue that a rewrite killed half-way may have left.
#include <signal.h>
#include <stdio.h>
#include <sys/time.h>

#include <string>

#include <event2/event.h>
#include <quvaidx/log.h>
#include <quvaidx/spool_consumer.h>

#include "daemon_runner.h"
#include "preview_names.h"
#include "thumb_worker.h"
#include "thumbnailer.h"

namespace {

constexpr char kProgram[] = "quvamkthumbd";
constexpr char kPidFile[] = QUVAIDX_THUMB_PID_FILE;

struct Daemon {
  std::string queue = quvaidx_daemons::kThumbQueue;
  int throttle_ms = 0;  // pause after each photo
  mkthumbd::ThumbWorker* worker = nullptr;
  event* wake = nullptr;  // SIGUSR1
  event* work = nullptr;  // the next step of the work
  bool working = false;   // `work` is scheduled
};

void Schedule(Daemon* daemon, int delay_ms) {
  timeval delay = {delay_ms / 1000, (delay_ms % 1000) * 1000};
  evtimer_add(daemon->work, &delay);
  daemon->working = true;
}

void OnWork(evutil_socket_t, short, void* arg) {
  Daemon* daemon = static_cast<Daemon*>(arg);
  using Did = mkthumbd::ThumbWorker::Did;
  Did did = daemon->worker->Step();
  if (did == Did::kNothing) {
    daemon->working = false;
    AppLogError(6, "%s:%d queue empty: asleep until SIGUSR1", kProgram,
                __LINE__);
    return;
  }
  Schedule(daemon, did == Did::kPhoto ? daemon->throttle_ms : 0);
}

void OnWake(evutil_socket_t, short, void* arg) {
  Daemon* daemon = static_cast<Daemon*>(arg);
  // While working, the worker reads the queue again when its entries run
  // out, so the new entries are found anyway.
  if (!daemon->working) Schedule(daemon, 0);
}

int Start(event_base* base, void* context) {
  Daemon* daemon = static_cast<Daemon*>(context);
  std::string error;
  if (!mkthumbd::InitThumbnailer(kProgram, &error)) {
    fprintf(stderr, "%s: cannot start libvips: %s\n", kProgram, error.c_str());
    return 1;
  }
  daemon->worker = new mkthumbd::ThumbWorker(
      daemon->queue,
      [](int folder_fd, const std::string& folder, const std::string& name) {
        return mkthumbd::MakePhotoThumbnails(folder_fd, folder, name);
      });
  daemon->wake = evsignal_new(base, SIGUSR1, OnWake, daemon);
  daemon->work = evtimer_new(base, OnWork, daemon);
  if (daemon->wake == nullptr || daemon->work == nullptr ||
      evsignal_add(daemon->wake, nullptr) != 0) {
    fprintf(stderr, "%s: cannot watch SIGUSR1\n", kProgram);
    return 1;
  }
  // Copies of the queue that a rewrite killed half-way left; logged by the
  // library, and nothing else is touched, so the result does not matter.
  RemoveStaleQueueCopies(daemon->queue.c_str());
  Schedule(daemon, 0);  // entries queued before we started
  return 0;
}

void Stop(void* context) {
  Daemon* daemon = static_cast<Daemon*>(context);
  if (daemon->wake != nullptr) event_free(daemon->wake);
  if (daemon->work != nullptr) event_free(daemon->work);
  const mkthumbd::WorkerCounts counts = daemon->worker->counts();
  AppLogError(6,
              "%s:%d stopping: %ld entries done (%ld queued again, %ld "
              "refused, %ld given up), %ld photos made, %ld up to date, %ld "
              "skipped",
              kProgram, __LINE__, counts.entries_done, counts.entries_requeued,
              counts.entries_refused, counts.entries_given_up,
              counts.photos_made, counts.photos_up_to_date,
              counts.photos_skipped);
  delete daemon->worker;
  mkthumbd::ShutdownThumbnailer();
}

}  // namespace

int main(int argc, char** argv) {
  // Between the pid file and the start hook a SIGUSR1 from WriteThumbQueue
  // would end the process (the default action): ignored until the loop
  // watches it. The look at the queue at start finds what it announced.
  signal(SIGUSR1, SIG_IGN);
  static Daemon daemon;
  quvaidx_daemons::DaemonSpec spec;
  spec.program = kProgram;
  spec.summary = "the thumbnail daemon of the media index";
  spec.description =
      "Serves the thumbnail queue: for every folder queued there (by\n"
      "WriteThumbQueue, e.g. 'quvaidx scan --queue-thumbs') inside a share,\n"
      "makes the thumbnails of each web photo directly in it, in the photo's\n"
      "metadata (EA) directory: QUVAPHOTO_THUMB_XL.jpg (1280 pixels on the\n"
      "long side), _B (640), _M (320) and _S (120), as readable as the photo.\n"
      "Works with the rights of each folder's owner and follows no link.\n"
      "Thumbnails newer than their photo are kept. Sleeps until SIGUSR1;\n"
      "ends after the photo at hand on SIGTERM or SIGINT.\n";
  spec.default_socket = nullptr;
  spec.default_pidfile = kPidFile;
  spec.handler = nullptr;
  spec.context = &daemon;
  spec.options = {
      quvaidx_daemons::PathOption("queue", 'q', "FILE", &daemon.queue,
                                  std::string("the queue to serve (default ") +
                                      quvaidx_daemons::kThumbQueue + ")"),
      quvaidx_tools::Number("throttle", 't', "MS", 0, 60000,
                            &daemon.throttle_ms,
                            "pause MS milliseconds after each photo, to\n"
                            "spare the disks (default 0)"),
  };
  spec.epilog =
      "Photos larger than 100 million pixels, photos whose decoding would\n"
      "take more than 384 MiB (large progressive JPEGs, GIFs, lossless WebPs,\n"
      "HEIFs), photos the folder's owner cannot read and photos libvips\n"
      "cannot read are logged and skipped. A queue entry that ended the\n"
      "daemon 3 times is logged and dropped at the next start.\n";
  spec.start = Start;
  spec.stop = Stop;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
