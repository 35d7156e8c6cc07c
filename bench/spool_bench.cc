// Spool queues: appending an entry and trimming the head, against plain
// implementations in the same binary.
//
// Queues of 1,000, 10,000 and 100,000 lines of about 55 bytes (photo album
// paths) lie in a private directory under /tmp and one under the working
// directory, which may be on another filesystem. Measured, with manual
// timing so that restoring the queue between iterations is not counted:
//   append/library   WriteIndexQueue of an entry that is not in the queue
//   append/getline   the plain way: scan with std::getline, then append
//                    under flock through O_APPEND | O_SYNC
//   scan/library     the duplicate test alone (QLIBCFileGetLine)
//   scan/getline     the std::getline scan alone
//   append/osync     the O_APPEND | O_SYNC append under flock alone
//   trim/library     FileRemoveHeadingLine of 1,000 lines of 100,000
//   trim/tail        `tail -n +1001 Q > T && mv T Q` through system()
// Then, once, a queue of 1,000,000 entries (SPOOL_DRAIN_LINES; 0 skips it)
// is drained under /tmp through the consumer calls and, for a few entries
// at 10,000, 100,000 and 1,000,000 lines, the old way (spool_drain.h).
// After each append the queue is cut back to its size, so every iteration
// sees the same queue. Before each trim the queue is made a fresh hard link
// to an unchanging master copy, so no rewrite of 5 MB (and no writeback of
// it) falls into the next measurement. Both sides of every comparison
// answer alike; that is checked before timing. All files are removed at
// exit, also on SIGINT and SIGTERM.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include "bench_support.h"
#include "quvahost/quvahost.h"
#include "quvaidx/system.h"
#include "spool_drain.h"

namespace qb = quvaidx_bench;

namespace {

constexpr int kSizes[] = {1000, 10000, 100000};
constexpr int kTrimLines = 100000;
constexpr int kTrimmed = 1000;

// The private directories ("tmp": under /tmp, "cwd": under the working
// directory) and every file made in them, for the clean-up.
struct Place {
  const char* name;
  std::string dir;
};
std::vector<Place> g_places;
std::vector<std::string> g_files;

// Removes every file of each private directory (an interrupted trim may
// have left "<queue>.XXXXXX" or "<queue>.tmp"), then the directory.
void RemoveAll() {
  for (const Place& place : g_places) {
    if (DIR* dir = opendir(place.dir.c_str())) {
      while (struct dirent* entry = readdir(dir)) {
        if (entry->d_name[0] == '.') continue;  // only ours lie here
        unlink((place.dir + "/" + entry->d_name).c_str());
      }
      closedir(dir);
    }
    rmdir(place.dir.c_str());
  }
}

// Only async-signal-safe calls: the known files, then the directories.
void OnSignal(int sig) {
  for (const std::string& file : g_files) unlink(file.c_str());
  for (const Place& place : g_places) rmdir(place.dir.c_str());
  signal(sig, SIG_DFL);
  raise(sig);
}

double NowSeconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec * 1e-9;
}

// The i-th queue line, about 55 bytes.
std::string Line(int i) {
  char text[96];
  snprintf(text, sizeof(text),
           "/share/Multimedia/Photos/2015/%02d/album-%06d/IMG_%04d", 1 + i % 12,
           i / 100, i % 10000);
  return text;
}

std::string QueueText(int lines) {
  std::string text;
  for (int i = 0; i < lines; ++i) text += Line(i) + "\n";
  return text;
}

bool WriteFile(const std::string& path, const std::string& text) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  bool ok = write(fd, text.data(), text.size()) ==
                static_cast<ssize_t>(text.size()) &&
            fsync(fd) == 0;
  return close(fd) == 0 && ok;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in),
                     std::istreambuf_iterator<char>());
}

std::string QueuePath(const Place& place, int lines) {
  return place.dir + "/queue-" + std::to_string(lines);
}

// ---------------------------------------------------------------------------
// The plain implementation

// True when `queue` holds a line equal to `entry`, read with std::getline.
bool GetlineHolds(const std::string& queue, const std::string& entry) {
  std::ifstream in(queue);
  std::string line;
  while (std::getline(in, line)) {
    if (line == entry) return true;
  }
  return false;
}

// Appends entry and a line feed under an exclusive flock, synchronously.
bool SyncAppend(const std::string& queue, const std::string& entry) {
  int fd = open(queue.c_str(),
                O_WRONLY | O_CREAT | O_APPEND | O_SYNC | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  bool ok = flock(fd, LOCK_EX) == 0;
  std::string line = entry + "\n";
  ok = ok &&
       write(fd, line.data(), line.size()) == static_cast<ssize_t>(line.size());
  flock(fd, LOCK_UN);
  close(fd);
  return ok;
}

bool GetlineAppend(const std::string& queue, const std::string& entry) {
  if (GetlineHolds(queue, entry)) return true;
  return SyncAppend(queue, entry);
}

bool LibraryHolds(const std::string& queue, const std::string& entry) {
  char line[kMaxQueueEntry + 2];
  return QLIBCFileGetLine(queue.c_str(), entry.c_str(), line, sizeof(line),
                          QLIBC_GETLINE_EXACT) > 0;
}

// ---------------------------------------------------------------------------
// Benchmarks

enum class Append { kLibrary, kGetline, kSyncOnly };
enum class Scan { kLibrary, kGetline };

void BM_Append(benchmark::State& state, Place place, int lines, Append kind) {
  const std::string queue = QueuePath(place, lines);
  struct stat st;
  if (stat(queue.c_str(), &st) != 0) {
    state.SkipWithError("no queue file");
    return;
  }
  const off_t size = st.st_size;
  long serial = 0;
  for (auto _ : state) {
    // New every time, so the whole queue is scanned and the entry written.
    std::string entry =
        "/share/Multimedia/Photos/new/entry-" + std::to_string(serial++);
    double start = NowSeconds();
    bool ok = kind == Append::kLibrary
                  ? WriteIndexQueue(entry.c_str(), queue.c_str()) == 0
              : kind == Append::kGetline ? GetlineAppend(queue, entry)
                                         : SyncAppend(queue, entry);
    state.SetIterationTime(NowSeconds() - start);
    if (!ok || truncate(queue.c_str(), size) != 0) {
      state.SkipWithError("append failed");
      return;
    }
  }
}

void BM_Scan(benchmark::State& state, Place place, int lines, Scan kind) {
  const std::string queue = QueuePath(place, lines);
  const std::string absent = "/share/Multimedia/Photos/new/absent";
  for (auto _ : state) {
    double start = NowSeconds();
    bool held = kind == Scan::kLibrary ? LibraryHolds(queue, absent)
                                       : GetlineHolds(queue, absent);
    state.SetIterationTime(NowSeconds() - start);
    if (held) {
      state.SkipWithError("absent entry found");
      return;
    }
  }
}

// The tail baseline, through the shell as a script would do it.
bool TailTrim(const std::string& queue) {
  std::string command = "tail -n +" + std::to_string(kTrimmed + 1) + " '" +
                        queue + "' > '" + queue + ".tmp' && mv '" + queue +
                        ".tmp' '" + queue + "'";
  return system(command.c_str()) == 0;
}

bool Trim(const std::string& queue, bool library) {
  return library ? FileRemoveHeadingLine(queue.c_str(), kTrimmed) == 0
                 : TailTrim(queue);
}

// Makes `queue` a fresh name of the synced master copy.
bool ResetTrimQueue(const std::string& master, const std::string& queue) {
  unlink(queue.c_str());
  return link(master.c_str(), queue.c_str()) == 0;
}

void BM_Trim(benchmark::State& state, Place place, bool library) {
  const std::string master = place.dir + "/trim-master";
  const std::string queue = place.dir + "/trim-queue";
  for (auto _ : state) {
    if (!ResetTrimQueue(master, queue)) {
      state.SkipWithError("cannot reset the queue");
      return;
    }
    double start = NowSeconds();
    bool ok = Trim(queue, library);
    state.SetIterationTime(NowSeconds() - start);
    if (!ok) {
      state.SkipWithError("trim failed");
      return;
    }
  }
}

// ---------------------------------------------------------------------------
// Set-up and checks

bool MakePlace(const char* name, const std::string& parent) {
  std::string templ = parent + "/quvaidx-spool-bench.XXXXXX";
  if (mkdtemp(&templ[0]) == nullptr) {
    perror(templ.c_str());
    return false;
  }
  g_places.push_back({name, templ});
  Place& place = g_places.back();
  for (int lines : kSizes) {
    std::string queue = QueuePath(place, lines);
    g_files.push_back(queue);
    if (!WriteFile(queue, QueueText(lines))) return false;
  }
  for (const char* file : {"/trim-master", "/trim-queue", "/trim-queue.tmp"}) {
    g_files.push_back(place.dir + file);
  }
  return WriteFile(place.dir + "/trim-master", QueueText(kTrimLines));
}

// Both sides of each comparison agree; the queue is left as it was.
bool CheckAgreement(const Place& place) {
  const std::string queue = QueuePath(place, kSizes[0]);
  const std::string before = ReadFile(queue);
  const std::string present = Line(kSizes[0] / 2);
  if (!LibraryHolds(queue, present) || !GetlineHolds(queue, present) ||
      LibraryHolds(queue, "/absent") || GetlineHolds(queue, "/absent")) {
    fprintf(stderr, "spool_bench: the duplicate scans disagree\n");
    return false;
  }
  if (WriteIndexQueue(present.c_str(), queue.c_str()) != 0 ||
      !GetlineAppend(queue, present) || ReadFile(queue) != before) {
    fprintf(stderr, "spool_bench: a duplicate entry was appended\n");
    return false;
  }
  if (WriteIndexQueue("/new-a", queue.c_str()) != 0 ||
      !GetlineAppend(queue, "/new-b") ||
      ReadFile(queue) != before + "/new-a\n/new-b\n" ||
      truncate(queue.c_str(), static_cast<off_t>(before.size())) != 0) {
    fprintf(stderr, "spool_bench: the appends disagree\n");
    return false;
  }
  const std::string master = place.dir + "/trim-master";
  const std::string trimmed = place.dir + "/trim-queue";
  const std::string master_text = ReadFile(master);
  size_t cut = 0;
  for (int i = 0; i < kTrimmed; ++i) cut = master_text.find('\n', cut) + 1;
  for (bool library : {true, false}) {
    if (!ResetTrimQueue(master, trimmed) || !Trim(trimmed, library) ||
        ReadFile(trimmed) != master_text.substr(cut)) {
      fprintf(stderr, "spool_bench: the %s trim is wrong\n",
              library ? "library" : "tail");
      return false;
    }
  }
  if (ReadFile(master) != master_text) {
    fprintf(stderr, "spool_bench: the trim changed the master copy\n");
    return false;
  }
  return true;
}

std::string Name(const char* what, const Place& place, int lines) {
  std::string name = std::string("spool/") + what + "/" + place.name;
  if (lines > 0) name += "/" + std::to_string(lines);
  return name;
}

void Register() {
  const struct {
    const char* name;
    Append kind;
  } appends[] = {{"append/library", Append::kLibrary},
                 {"append/getline", Append::kGetline},
                 {"append/osync", Append::kSyncOnly}};
  const struct {
    const char* name;
    Scan kind;
  } scans[] = {{"scan/library", Scan::kLibrary},
               {"scan/getline", Scan::kGetline}};
  for (const Place& place : g_places) {
    for (int lines : kSizes) {
      for (const auto& a : appends) {
        benchmark::RegisterBenchmark(Name(a.name, place, lines).c_str(),
                                     BM_Append, place, lines, a.kind)
            ->UseManualTime()
            ->Unit(benchmark::kMicrosecond);
      }
      for (const auto& s : scans) {
        benchmark::RegisterBenchmark(Name(s.name, place, lines).c_str(),
                                     BM_Scan, place, lines, s.kind)
            ->UseManualTime()
            ->Unit(benchmark::kMicrosecond);
      }
    }
    for (bool library : {true, false}) {
      benchmark::RegisterBenchmark(
          Name(library ? "trim/library" : "trim/tail", place, 0).c_str(),
          BM_Trim, place, library)
          ->UseManualTime()
          ->Unit(benchmark::kMicrosecond);
    }
  }
}

void Summarise(const qb::KeepingReporter& reporter) {
  for (const Place& place : g_places) {
    printf("\nSpool queue in %s (%s), wall time per call:\n", place.dir.c_str(),
           place.name);
    for (int lines : kSizes) {
      const double lib_scan =
          reporter.NsPerOp(Name("scan/library", place, lines)) / 1e3;
      const double getline_scan =
          reporter.NsPerOp(Name("scan/getline", place, lines)) / 1e3;
      const double lib_append =
          reporter.NsPerOp(Name("append/library", place, lines)) / 1e3;
      const double getline_append =
          reporter.NsPerOp(Name("append/getline", place, lines)) / 1e3;
      const double sync_append =
          reporter.NsPerOp(Name("append/osync", place, lines)) / 1e3;
      printf(" %d lines:\n", lines);
      qb::PrintRatio("duplicate scan, library (QLIBCFileGetLine)", lib_scan,
                     "us");
      qb::PrintRatio("duplicate scan, std::getline", getline_scan, "us");
      qb::PrintRatio("WriteIndexQueue, whole append", lib_append, "us");
      qb::PrintRatio("getline scan + O_SYNC append", getline_append, "us");
      qb::PrintRatio("O_SYNC append alone", sync_append, "us");
      qb::PrintGoal("scan: getline / library", getline_scan / lib_scan, 2.5,
                    /*at_most=*/false);
      if (lines == 100000) {
        qb::PrintGoal("scan of 100,000 lines, ms", lib_scan / 1e3, 1.5,
                      /*at_most=*/true);
      }
      if (lines <= 1000) {
        qb::PrintGoal("append: WriteIndexQueue / O_SYNC append alone",
                      lib_append / sync_append, 1.3, /*at_most=*/true);
      }
      qb::PrintRatio("append: WriteIndexQueue / getline + O_SYNC",
                     lib_append / getline_append, "x");
    }
    const double lib_trim =
        reporter.NsPerOp(Name("trim/library", place, 0)) / 1e3;
    const double tail_trim =
        reporter.NsPerOp(Name("trim/tail", place, 0)) / 1e3;
    printf(" first %d of %d lines removed:\n", kTrimmed, kTrimLines);
    qb::PrintRatio("FileRemoveHeadingLine (with fsync)", lib_trim, "us");
    qb::PrintRatio("tail -n +N > T && mv T Q (no fsync)", tail_trim, "us");
    qb::PrintRatio("trim: tail / library", tail_trim / lib_trim, "x");
  }
}

}  // namespace

int main(int argc, char** argv) {
  char cwd[4096];
  if (getcwd(cwd, sizeof(cwd)) == nullptr) {
    perror("getcwd");
    return 1;
  }
  const char* tmp = getenv("TMPDIR");
  bool ok = MakePlace("tmp", tmp != nullptr && tmp[0] != '\0' ? tmp : "/tmp");
  ok = ok && MakePlace("cwd", cwd);
  atexit(RemoveAll);
  signal(SIGINT, OnSignal);
  signal(SIGTERM, OnSignal);
  if (!ok) {
    fprintf(stderr, "spool_bench: cannot write the queues\n");
    return 1;
  }
  for (const Place& place : g_places) {
    if (!CheckAgreement(place)) return 1;
  }
  const char* drain = getenv("SPOOL_DRAIN_LINES");
  const int drain_lines = drain != nullptr ? atoi(drain) : 1000000;
  for (const std::string& file : spool_drain::DrainFiles(g_places[0].dir)) {
    g_files.push_back(file);
  }
  Register();
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc != 0) return rc;
  Summarise(reporter);
  if (drain_lines > 0 &&
      !spool_drain::RunDrainComparison(g_places[0].dir, drain_lines)) {
    return 1;
  }
  return 0;
}
