// The preview daemons against their peers, in one run so that the ratios
// compare like with like:
//
//   thumbs/daemon-all-sizes    the thumbnail daemon's work on one 12-megapixel
//                              (4000 x 3000) JPEG: all four sizes, in process
//                              (MakePhotoThumbnails, the thumbnails removed
//                              between iterations outside the timing);
//   thumbs/vipsthumbnail-xl    one `vipsthumbnail PHOTO -s 1280` process, the
//                              largest size alone;
//   thumbs/convert-xl          one ImageMagick `convert PHOTO -thumbnail
//                              1280x1280` process;
//   plugind/handshake          one whole exchange (connect, send, receive,
//                              close) of HANDSHAKE with quvaindexplugind;
//   plugind/size-map           the same with GET_THUMB_SIZE_MAP for a photo
//                              with all four thumbnails.
//
//   previews_bench --plugind PATH_OF_QUVAINDEXPLUGIND [benchmark options]
//
// The photo is made at start with libvips (grey noise blurred a little and
// saved at quality 90, about 3.6 MB, which decodes like a camera's photo),
// in a private temporary directory removed at exit; the plug-in daemon runs
// there on a socket of its own. Goals: all sizes in at most 0.5 times one
// vipsthumbnail call; a size map in at most 1.3 times a handshake.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include <quvaidx/ipc.h>
#include <vips/vips.h>

#include "bench_process.h"
#include "bench_report.h"
#include "preview_names.h"
#include "thumbnailer.h"

namespace qb = quvaidx_bench;

namespace {

std::string g_dir;        // the private directory
std::string g_photo;      // the 12-megapixel JPEG
std::string g_sized;      // the same photo with its four thumbnails
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
  std::vector<char*> rest = {argv[0]};
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--plugind") == 0 && i + 1 < argc) {
      plugind = argv[++i];
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
  g_vipsthumb = FindProgram({"vipsthumbnail"});
  // The real ImageMagick program, not a wrapper that may stand before it.
  g_magick = FindProgram({"convert-im6.q16", "convert-im7.q16", "convert"});

  benchmark::RegisterBenchmark("thumbs/daemon-all-sizes", BM_DaemonAllSizes)
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
