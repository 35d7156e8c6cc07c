// The media-parser daemon against the least the same libraries take, and
// against ffprobe, on the media fixtures ($MEDIA_CORPUS: a folder of media
// files, e.g. tests/mediaparserd/make_fixtures.sh's). One iteration reads
// every file of the corpus once; the summary gives times per file.
//
//   parse/floor:   in this process, the library calls a naive indexer
//                  makes: avformat_open_input + avformat_find_stream_info
//                  for music and video, TagLib::FileRef (tags and audio
//                  properties) for music, exiv2 open + readMetadata for
//                  photos; the type taken from the file's extension;
//   parse/daemon:  QUVAIDX_GetMediaInfo for each file, answered by a
//                  quvamediaparserd process on a private socket (round
//                  trip, JSON and the record conversions included);
//   parse/ffprobe: `ffprobe -show_format -show_streams -of json` started
//                  once per file (slow: on at most 20 files of the corpus,
//                  one iteration);
//   daemon/rss:    the daemon's resident memory after 100 and after 10,000
//                  requests (counters rss_100_kB, rss_10000_kB).
//
// $MEDIAPARSERD names the daemon's executable (default: the one built
// beside this benchmark).
#include <dirent.h>
#include <fcntl.h>
#include <math.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

extern "C" {
#include <libavformat/avformat.h>
}
#include <taglib/fileref.h>

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
#include <exiv2/exiv2.hpp>
#pragma GCC diagnostic pop

#include "bench_process.h"
#include "bench_support.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/media_type.h"
#include "requests/index_requests_internal.h"

namespace qb = quvaidx_bench;

namespace {

struct MediaFile {
  std::string path;
  int table;  // MEDIA_TABLE_* of its extension
};

std::vector<MediaFile> g_corpus;
pid_t g_daemon = -1;
std::string g_socket;
std::string g_work;  // the daemon's private folder

std::vector<MediaFile> ReadCorpus(const std::string& dir) {
  std::vector<MediaFile> files;
  DIR* stream = opendir(dir.c_str());
  if (stream == nullptr) return files;
  while (struct dirent* entry = readdir(stream)) {
    std::string name = entry->d_name;
    int table = GetMediaTableTypeFromExt(QUVAIndexExtGet(name.c_str()));
    if (name[0] == '.' || table == MEDIA_TABLE_NONE) continue;
    files.push_back({dir + "/" + name, table});
  }
  closedir(stream);
  std::sort(
      files.begin(), files.end(),
      [](const MediaFile& a, const MediaFile& b) { return a.path < b.path; });
  return files;
}

// Runs `argv` with its output to /dev/null; returns its exit status or -1.
// With `pid_out`, only starts it and stores its pid there (0 or -1).
int Spawn(const std::vector<std::string>& argv, pid_t* pid_out = nullptr) {
  pid_t pid = quvaidx_bench::SpawnQuiet(argv);
  if (pid < 0) return -1;
  if (pid_out == nullptr) return quvaidx_bench::WaitExit(pid);
  *pid_out = pid;
  return 0;
}

void FloorOne(const MediaFile& file) {
  const char* path = file.path.c_str();
  if (file.table == MEDIA_TABLE_PHOTO) {
    try {
      Exiv2::Image::AutoPtr image = Exiv2::ImageFactory::open(path);
      image->readMetadata();
      benchmark::DoNotOptimize(image->pixelWidth());
    } catch (...) {
    }
    return;
  }
  AVFormatContext* context = nullptr;
  if (avformat_open_input(&context, path, nullptr, nullptr) == 0) {
    avformat_find_stream_info(context, nullptr);
    benchmark::DoNotOptimize(context->duration);
    avformat_close_input(&context);
  }
  if (file.table == MEDIA_TABLE_MUSIC) {
    TagLib::FileRef ref(path, true);
    if (!ref.isNull()) {
      benchmark::DoNotOptimize(ref.tag()->title().size());
      benchmark::DoNotOptimize(ref.audioProperties());
    }
  }
}

void BM_Floor(benchmark::State& state) {
  for (auto _ : state) {
    for (const MediaFile& file : g_corpus) FloorOne(file);
  }
  state.SetItemsProcessed(state.iterations() * g_corpus.size());
}

void BM_Daemon(benchmark::State& state) {
  __tag_QUVA_MEDIA_INFO record;
  for (auto _ : state) {
    for (const MediaFile& file : g_corpus) {
      if (QUVAIDX_GetMediaInfo(file.path.c_str(), &record) != 0) {
        state.SkipWithError(("no record for " + file.path).c_str());
        return;
      }
    }
  }
  state.SetItemsProcessed(state.iterations() * g_corpus.size());
}

// At most 20 files of the corpus: each costs a process.
void BM_Ffprobe(benchmark::State& state) {
  size_t step = g_corpus.size() > 20 ? g_corpus.size() / 20 : 1;
  size_t probed = 0;
  for (auto _ : state) {
    for (size_t i = 0; i < g_corpus.size(); i += step, ++probed) {
      const MediaFile& file = g_corpus[i];
      if (Spawn({"ffprobe", "-v", "error", "-show_format", "-show_streams",
                 "-of", "json", file.path}) != 0) {
        state.SkipWithError("ffprobe failed");
        return;
      }
    }
  }
  state.counters["files"] = static_cast<double>(probed / state.iterations());
}

long RssKb(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return atol(line.c_str() + 6);
  }
  return -1;
}

void BM_DaemonRss(benchmark::State& state) {
  __tag_QUVA_MEDIA_INFO record;
  long rss_100 = 0, rss_10000 = 0;
  for (auto _ : state) {
    for (int i = 1; i <= 10000; ++i) {
      const MediaFile& file = g_corpus[i % g_corpus.size()];
      if (QUVAIDX_GetMediaInfo(file.path.c_str(), &record) != 0) {
        state.SkipWithError("request failed");
        return;
      }
      if (i == 100) rss_100 = RssKb(g_daemon);
    }
    rss_10000 = RssKb(g_daemon);
  }
  state.counters["rss_100_kB"] = static_cast<double>(rss_100);
  state.counters["rss_10000_kB"] = static_cast<double>(rss_10000);
}

bool StartDaemon() {
  const char* binary = getenv("MEDIAPARSERD");
  std::string daemon = binary != nullptr ? binary : QUVAIDX_MEDIAPARSERD;
  char dir[] = "/tmp/quvaidx-mpbench-XXXXXX";
  if (mkdtemp(dir) == nullptr) return false;
  g_work = dir;
  g_socket = g_work + "/mp.sock";
  // The host's code page for legacy tags, in a private settings folder.
  std::ofstream(g_work + "/host.conf")
      << "[system]\ncode_page = windows-1251\n";
  setenv("QUVA_HOST_ETC", g_work.c_str(), 1);
  if (Spawn({daemon, "--foreground", "--socket", g_socket, "--pidfile",
             g_work + "/mp.pid"},
            &g_daemon) != 0) {
    return false;
  }
  static quvaidx::IndexSockets sockets = {g_socket.c_str(), nullptr};
  quvaidx::SetIndexSockets(sockets);
  for (int i = 0; i < 500; ++i) {  // at most 5 s
    int fd = qb::RawConnect(g_socket);
    if (fd >= 0) {
      close(fd);
      return true;
    }
    usleep(10000);
  }
  return false;
}

void StopDaemon() {
  if (g_daemon > 0) {
    kill(g_daemon, SIGTERM);
    waitpid(g_daemon, nullptr, 0);
  }
  if (!g_work.empty()) {
    unlink((g_work + "/host.conf").c_str());
    unlink((g_work + "/mp.pid").c_str());
    unlink(g_socket.c_str());
    rmdir(g_work.c_str());
  }
}

void Summarise(const qb::KeepingReporter& r) {
  double files = static_cast<double>(g_corpus.size());
  double floor = r.NsPerOp("parse/floor") / files / 1e6;
  double daemon = r.NsPerOp("parse/daemon") / files / 1e6;
  double ffprobe =
      r.NsPerOp("parse/ffprobe") / r.Counter("parse/ffprobe", "files") / 1e6;
  double rss_100 = r.Counter("daemon/rss", "rss_100_kB");
  double rss_10000 = r.Counter("daemon/rss", "rss_10000_kB");
  printf("\n== media parser summary (%zu files; median wall ms per file)\n",
         g_corpus.size());
  qb::PrintRatio("floor: the library calls in one process", floor, "ms");
  qb::PrintRatio("daemon: QUVAIDX_GetMediaInfo per file", daemon, "ms");
  qb::PrintRatio("ffprobe started per file", ffprobe, "ms");
  qb::PrintRatio("daemon RSS after 100 requests", rss_100, "kB");
  qb::PrintRatio("daemon RSS after 10,000 requests", rss_10000, "kB");
  qb::PrintGoal("daemon / floor", daemon / floor, 1.25, true);
  qb::PrintGoal("ffprobe / daemon", ffprobe / daemon, 50, false);
  qb::PrintGoal("RSS after 10,000 / after 100", rss_10000 / rss_100, 1.10,
                true);
  qb::PrintGoal("RSS after 10,000 requests (MB)", rss_10000 / 1024, 40, true);
  printf("  MEDIAPARSER_MS_PER_FILE %.4f\n", daemon);  // for bench.sh
}

}  // namespace

int main(int argc, char** argv) {
  const char* corpus = getenv("MEDIA_CORPUS");
  g_corpus = ReadCorpus(corpus != nullptr ? corpus : "");
  if (g_corpus.empty()) {
    fprintf(stderr, "%s: set MEDIA_CORPUS to a folder of media files\n",
            argv[0]);
    return 2;
  }
  av_log_set_level(AV_LOG_QUIET);
  Exiv2::LogMsg::setLevel(Exiv2::LogMsg::mute);
  if (!StartDaemon()) {
    fprintf(stderr, "%s: the media-parser daemon did not start\n", argv[0]);
    StopDaemon();
    return 1;
  }
  benchmark::RegisterBenchmark("parse/floor", BM_Floor);
  benchmark::RegisterBenchmark("parse/daemon", BM_Daemon);
  benchmark::RegisterBenchmark("parse/ffprobe", BM_Ffprobe)->Iterations(1);
  benchmark::RegisterBenchmark("daemon/rss", BM_DaemonRss)
      ->Iterations(1)
      ->Repetitions(1);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc == 0) Summarise(reporter);
  StopDaemon();
  return rc;
}
