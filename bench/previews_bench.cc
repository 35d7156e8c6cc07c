// The preview daemons against their peers, in one run so that the ratios
// compare like with like:
//
//   thumbs/daemon-all-sizes    the thumbnail daemon's work on one 12-megapixel
//                              (4000 x 3000) JPEG: all four sizes, in process
//                              (MakePhotoThumbnails, the thumbnails removed
//                              between iterations outside the timing), with
//                              the process's own identity;
//   thumbs/daemon-as-owner     the same as the daemon does it for a folder of
//                              another user: the folder owner's file-system
//                              identity taken around each photo (as root
//                              only; the folder and photo belong to nobody);
//   thumbs/vipsthumbnail-xl    one `vipsthumbnail PHOTO -s 1280` process, the
//                              largest size alone;
//   thumbs/convert-xl          one ImageMagick `convert PHOTO -thumbnail
//                              1280x1280` process;
//   plugind/handshake          one whole exchange (connect, send, receive,
//                              close) of HANDSHAKE with quvaindexplugind;
//   plugind/size-map           the same with GET_THUMB_SIZE_MAP for a photo
//                              with all four thumbnails.
//
// and, before them, the thumbnail daemon's worker (ThumbWorker) draining a
// queue of --queue-entries folders that no longer exist (default 1,000,000;
// 0 skips it), against the consumer that rewrote the whole queue for each
// finished entry (ReadQueueHead and FileRemoveHeadingLine), run on the same
// queue for 10 s; each in a child process, for its own peak memory. Goals:
// at least 100 times the old rate; the worker's peak on the full queue at
// most 1.1 times its peak on a queue of 10,000.
//
//   previews_bench --plugind PATH_OF_QUVAINDEXPLUGIND [--queue-entries N]
//                  [benchmark options]
//
// The photo is made at start with libvips (grey noise blurred a little and
// saved at quality 90, about 3.6 MB, which decodes like a camera's photo),
// in a private temporary directory removed at exit; the plug-in daemon runs
// there on a socket of its own. Goals: all sizes in at most 0.5 times one
// vipsthumbnail call; as the folder's owner no slower than with the own
// identity, beyond noise (at most 1.05 times); a size map in at most 1.3
// times a handshake.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include <quvaidx/ipc.h>
#include <quvaidx/spool_consumer.h>
#include <quvaidx/system.h>
#include <vips/vips.h>

#include "bench_process.h"
#include "bench_report.h"
#include "fs_identity.h"
#include "preview_names.h"
#include "thumb_worker.h"
#include "thumbnailer.h"

namespace qb = quvaidx_bench;

namespace {

std::string g_dir;        // the private directory
std::string g_photo;      // the 12-megapixel JPEG
std::string g_sized;      // the same photo with its four thumbnails
std::string g_owned;      // a folder of nobody's holding a copy of the photo
std::string g_vipsthumb;  // vipsthumbnail, or "" when missing
std::string g_magick;     // ImageMagick's convert, or "" when missing
std::string g_socket;     // the plug-in daemon's
pid_t g_plugind = -1;

// The first of `names` found on PATH, or "".
std::string FindProgram(std::initializer_list<const char*> names) {
  const char* path = getenv("PATH");
  for (const char* name : names) {
    std::string dirs = path != nullptr ? path : "/usr/bin:/bin";
    size_t start = 0;
    while (start <= dirs.size()) {
      size_t end = dirs.find(':', start);
      if (end == std::string::npos) end = dirs.size();
      std::string candidate = dirs.substr(start, end - start) + "/" + name;
      if (access(candidate.c_str(), X_OK) == 0) return candidate;
      start = end + 1;
    }
  }
  return "";
}

// Runs `argv` with its output thrown away and waits. True on exit status 0.
bool Run(const std::vector<std::string>& argv) {
  pid_t pid = quvaidx_bench::SpawnQuiet(argv);
  return pid >= 0 && quvaidx_bench::WaitExit(pid) == 0;
}

bool MakePhoto(const std::string& path) {
  VipsImage* bands[3] = {};
  for (int i = 0; i < 3; ++i) {
    if (vips_gaussnoise(&bands[i], 4000, 3000, "mean", 128.0 - 20 * i, "sigma",
                        50.0, nullptr) != 0) {
      return false;
    }
  }
  VipsImage *joined = nullptr, *blurred = nullptr, *cast = nullptr;
  bool ok = vips_bandjoin(bands, &joined, 3, nullptr) == 0 &&
            vips_gaussblur(joined, &blurred, 1.5, nullptr) == 0 &&
            vips_cast(blurred, &cast, VIPS_FORMAT_UCHAR, nullptr) == 0;
  if (ok) {
    cast->Type = VIPS_INTERPRETATION_sRGB;
    ok = vips_jpegsave(cast, path.c_str(), "Q", 90, nullptr) == 0;
  }
  for (VipsImage* image :
       {bands[0], bands[1], bands[2], joined, blurred, cast}) {
    if (image != nullptr) g_object_unref(image);
  }
  return ok;
}

void RemoveThumbnails() {
  std::error_code ignored;
  std::filesystem::remove_all(g_dir + "/.quvameta/photo.jpg", ignored);
}

void BM_DaemonAllSizes(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    RemoveThumbnails();
    state.ResumeTiming();
    mkthumbd::PhotoResult result = mkthumbd::MakePhotoThumbnails(g_photo);
    if (result.made != quvaidx_daemons::kAllThumbSizes) {
      state.SkipWithError(("not made: " + result.reason).c_str());
      break;
    }
  }
}

// As the worker does it: the folder opened, its owner's identity taken for
// the photo, the photo made from the folder's descriptor.
void BM_DaemonAsOwner(benchmark::State& state) {
  if (g_owned.empty()) {
    state.SkipWithError("needs root");
    return;
  }
  const int folder = open(g_owned.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  struct stat st;
  if (folder < 0 || fstat(folder, &st) != 0) {
    state.SkipWithError("cannot open the folder");
    return;
  }
  const quvaidx_daemons::FsUser owner = quvaidx_daemons::FileOwner(st);
  for (auto _ : state) {
    state.PauseTiming();
    std::error_code ignored;
    std::filesystem::remove_all(g_owned + "/.quvameta", ignored);
    state.ResumeTiming();
    quvaidx_daemons::FsIdentity as_owner(owner);
    mkthumbd::PhotoResult result =
        mkthumbd::MakePhotoThumbnails(folder, g_owned, "photo.jpg");
    if (!as_owner.taken() || result.made != quvaidx_daemons::kAllThumbSizes) {
      state.SkipWithError(("not made: " + result.reason).c_str());
      break;
    }
  }
  close(folder);
}

void BM_Program(benchmark::State& state, const std::string* program,
                bool vips) {
  if (program->empty()) {
    state.SkipWithError("not installed");
    return;
  }
  const std::string out = g_dir + "/peer.jpg";
  std::vector<std::string> argv =
      vips
          ? std::vector<std::string>{*program, g_photo, "-s", "1280", "-o", out}
          : std::vector<std::string>{*program, g_photo, "-thumbnail",
                                     "1280x1280", out};
  for (auto _ : state) {
    if (!Run(argv)) {
      state.SkipWithError("the program failed");
      break;
    }
  }
}

void BM_Exchange(benchmark::State& state, const char* command) {
  Json::Value request(Json::objectValue);
  request["command"] = command;
  if (strcmp(command, "HANDSHAKE") != 0) {
    request["path"] = g_sized;
    request["type"] = 1;
  }
  Json::Value value;
  for (auto _ : state) {
    value = request;
    if (AutoSendRecvPacket(g_socket.c_str(), -1, value, 1) != 0) {
      state.SkipWithError("exchange failed");
      break;
    }
  }
  if (!value["success"].asBool()) state.SkipWithError("refused");
}

bool StartPlugind(const std::string& program) {
  g_socket = g_dir + "/plugind.sock";
  std::vector<std::string> argv = {program,     "--foreground",
                                   "--socket",  g_socket,
                                   "--pidfile", g_dir + "/plugind.pid"};
  g_plugind = quvaidx_bench::SpawnQuiet(argv, true);
  if (g_plugind < 0) return false;
  for (int i = 0; i < 500; ++i) {  // at most 5 s
    Json::Value value(Json::objectValue);
    value["command"] = "HANDSHAKE";
    struct stat st;
    if (stat(g_socket.c_str(), &st) == 0 &&
        AutoSendRecvPacket(g_socket.c_str(), -1, value, 1) == 0) {
      return true;
    }
    usleep(10 * 1000);
  }
  return false;
}

// What a drain of a queue did, measured in its child process.
struct Drain {
  long entries = 0;    // removed from the queue
  double seconds = 0;  // taken
  long peak_kb = 0;    // the child's VmHWM at the end
  bool ok = false;
};

long PeakKb() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmHWM:", 0) == 0) return atol(line.c_str() + 6);
  }
  return 0;
}

// Writes a queue of `entries` folders of the share that do not exist.
bool WriteGoneQueue(const std::string& queue, long entries) {
  std::ofstream out(queue, std::ios::trunc);
  for (long i = 0; i < entries; ++i)
    out << g_dir << "/share/gone/" << i << "\n";
  return static_cast<bool>(out);
}

// Drains `queue` in a child: with the worker, or (`old`) as the consumer
// did before, for at most `seconds`.
Drain DrainQueue(const std::string& queue, bool old, double seconds) {
  int result[2];
  Drain drain;
  if (pipe(result) != 0) return drain;
  const pid_t child = fork();
  if (child == 0) {
    close(result[0]);
    alarm(900);  // whatever happens, the child ends
    const auto start = std::chrono::steady_clock::now();
    const auto end = start + std::chrono::duration<double>(seconds);
    Drain done;
    if (old) {
      Json::Value head;
      while (std::chrono::steady_clock::now() < end &&
             ReadQueueHead(queue.c_str(), 1, head) > 0 &&
             FileRemoveHeadingLine(queue.c_str(), 1) == 0) {
        ++done.entries;
      }
    } else {
      mkthumbd::ThumbWorker worker(
          queue, [](int, const std::string&, const std::string&) {
            return mkthumbd::PhotoResult();  // never called: no folder
          });
      while (std::chrono::steady_clock::now() < end &&
             worker.Step() != mkthumbd::ThumbWorker::Did::kNothing) {
      }
      done.entries = worker.counts().entries_done;
    }
    done.seconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start)
            .count();
    done.peak_kb = PeakKb();
    done.ok = true;
    _exit(write(result[1], &done, sizeof(done)) == sizeof(done) ? 0 : 1);
  }
  close(result[1]);
  if (child > 0 && read(result[0], &drain, sizeof(drain)) != sizeof(drain)) {
    drain.ok = false;
  }
  close(result[0]);
  int status;
  if (child > 0) waitpid(child, &status, 0);
  return drain;
}

// The drain figures: the worker on a small and on the full queue, the old
// consumer on the full queue for 10 s.
void QueueDrains(long entries) {
  const std::string etc = g_dir + "/etc";
  mkdir(etc.c_str(), 0755);
  std::ofstream(etc + "/shares.conf")
      << "[share]\npath = " << g_dir << "/share\n";
  mkdir((g_dir + "/share").c_str(), 0755);
  setenv("QUVA_HOST_ETC", etc.c_str(), 1);
  const std::string queue = g_dir + "/drain.queue";
  const long small = std::min(entries, 10000L);
  printf("== Draining a queue of folders that are gone ==\n");
  Drain worker_small, worker_full, old_full;
  if (WriteGoneQueue(queue, small))
    worker_small = DrainQueue(queue, false, 600);
  if (WriteGoneQueue(queue, entries))
    worker_full = DrainQueue(queue, false, 600);
  if (WriteGoneQueue(queue, entries)) old_full = DrainQueue(queue, true, 10);
  unlink(queue.c_str());
  unsetenv("QUVA_HOST_ETC");
  if (!worker_small.ok || !worker_full.ok || !old_full.ok) {
    printf("  a drain failed\n");
    return;
  }
  const double new_rate = worker_full.entries / worker_full.seconds;
  const double old_rate = old_full.entries / old_full.seconds;
  printf("  worker, %ld entries: %.1f s, %.0f entries/s, peak %ld kB\n",
         worker_full.entries, worker_full.seconds, new_rate,
         worker_full.peak_kb);
  printf("  worker, %ld entries: %.2f s, peak %ld kB\n", worker_small.entries,
         worker_small.seconds, worker_small.peak_kb);
  printf(
      "  old consumer, the same queue: %ld entries in %.1f s, %.1f "
      "entries/s, peak %ld kB\n",
      old_full.entries, old_full.seconds, old_rate, old_full.peak_kb);
  qb::PrintGoal("worker rate / old consumer's rate", new_rate / old_rate, 100,
                false);
  qb::PrintGoal("worker peak, full queue / 10,000 entries",
                static_cast<double>(worker_full.peak_kb) / worker_small.peak_kb,
                1.1, true);
  printf("\n");
}

void Cleanup() {
  if (g_plugind > 0) {
    kill(g_plugind, SIGTERM);
    int status;
    waitpid(g_plugind, &status, 0);
  }
  std::error_code ignored;
  if (!g_dir.empty()) std::filesystem::remove_all(g_dir, ignored);
}

void Summarise(const qb::KeepingReporter& r) {
  printf("\n== Thumbnails of a 4000 x 3000 JPEG ==\n");
  double ours = r.NsPerOp("thumbs/daemon-all-sizes");
  double vips = r.NsPerOp("thumbs/vipsthumbnail-xl");
  double magick = r.NsPerOp("thumbs/convert-xl");
  qb::PrintRatio("daemon, all four sizes from one decode", ours / 1e6, "ms");
  qb::PrintRatio("vipsthumbnail process, XL alone", vips / 1e6, "ms");
  qb::PrintRatio("ImageMagick convert -thumbnail process, XL alone",
                 magick / 1e6, "ms");
  qb::PrintRatio("daemon all sizes / vipsthumbnail XL", ours / vips, "x");
  qb::PrintRatio("daemon all sizes / convert XL", ours / magick, "x");
  qb::PrintGoal("all sizes / one vipsthumbnail call", ours / vips, 0.5, true);
  double as_owner = r.NsPerOp("thumbs/daemon-as-owner");
  qb::PrintRatio("daemon all sizes, as the folder's owner", as_owner / 1e6,
                 "ms");
  qb::PrintGoal("as the folder's owner / own identity", as_owner / ours, 1.05,
                true);
  printf("\n== Plug-in daemon, one whole exchange ==\n");
  double handshake = r.NsPerOp("plugind/handshake");
  double size_map = r.NsPerOp("plugind/size-map");
  qb::PrintRatio("HANDSHAKE", handshake / 1e3, "us");
  qb::PrintRatio("GET_THUMB_SIZE_MAP", size_map / 1e3, "us");
  qb::PrintGoal("GET_THUMB_SIZE_MAP / HANDSHAKE", size_map / handshake, 1.3,
                true);
}

}  // namespace

int main(int argc, char** argv) {
  std::string plugind;
  long queue_entries = 1000000;
  std::vector<char*> rest = {argv[0]};
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--plugind") == 0 && i + 1 < argc) {
      plugind = argv[++i];
    } else if (strcmp(argv[i], "--queue-entries") == 0 && i + 1 < argc) {
      queue_entries = atol(argv[++i]);
    } else {
      rest.push_back(argv[i]);
    }
  }
  if (plugind.empty()) {
    fprintf(stderr, "usage: %s --plugind QUVAINDEXPLUGIND [options]\n",
            argv[0]);
    return 2;
  }
  std::string error;
  if (!mkthumbd::InitThumbnailer(argv[0], &error)) {
    fprintf(stderr, "libvips: %s\n", error.c_str());
    return 1;
  }
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp != nullptr && *tmp ? tmp : "/tmp") +
                      "/quvaidx-previews-bench.XXXXXX";
  if (mkdtemp(templ.data()) == nullptr) return 1;
  g_dir = templ;
  g_photo = g_dir + "/photo.jpg";
  if (queue_entries > 0) QueueDrains(queue_entries);
  if (!MakePhoto(g_photo) || !StartPlugind(plugind)) {
    fprintf(stderr, "cannot make the photo or start %s\n", plugind.c_str());
    Cleanup();
    return 1;
  }
  // A second name of the photo keeps its thumbnails for the size maps.
  g_sized = g_dir + "/sized.jpg";
  if (link(g_photo.c_str(), g_sized.c_str()) != 0 ||
      mkthumbd::MakePhotoThumbnails(g_sized).made !=
          quvaidx_daemons::kAllThumbSizes) {
    fprintf(stderr, "cannot make the thumbnails of %s\n", g_sized.c_str());
    Cleanup();
    return 1;
  }
  // A folder and a copy of the photo that belong to nobody, for the work
  // done as a folder's owner.
  if (geteuid() == 0) {
    const std::string owned = g_dir + "/nobody";
    std::error_code error_code;
    if (mkdir(owned.c_str(), 0755) == 0 &&
        std::filesystem::copy_file(g_photo, owned + "/photo.jpg", error_code) &&
        chown(owned.c_str(), 65534, 65534) == 0 &&
        chown((owned + "/photo.jpg").c_str(), 65534, 65534) == 0) {
      g_owned = owned;
    }
  }
  g_vipsthumb = FindProgram({"vipsthumbnail"});
  // The real ImageMagick program, not a wrapper that may stand before it.
  g_magick = FindProgram({"convert-im6.q16", "convert-im7.q16", "convert"});

  benchmark::RegisterBenchmark("thumbs/daemon-all-sizes", BM_DaemonAllSizes)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("thumbs/daemon-as-owner", BM_DaemonAsOwner)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("thumbs/vipsthumbnail-xl", BM_Program,
                               &g_vipsthumb, true)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("thumbs/convert-xl", BM_Program, &g_magick,
                               false)
      ->Unit(benchmark::kMillisecond);
  benchmark::RegisterBenchmark("plugind/handshake", BM_Exchange, "HANDSHAKE")
      ->Unit(benchmark::kMicrosecond);
  benchmark::RegisterBenchmark("plugind/size-map", BM_Exchange,
                               "GET_THUMB_SIZE_MAP")
      ->Unit(benchmark::kMicrosecond);
  qb::KeepingReporter reporter;
  int count = static_cast<int>(rest.size());
  int status = qb::RunAll(count, rest.data(), &reporter);
  Summarise(reporter);
  Cleanup();
  return status;
}
