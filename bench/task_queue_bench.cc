// One task through a System V message queue per iteration, in one process:
//
//   task-queue/library:   PushTaskToQueue, then PopTaskFromQueue without
//                         blocking and with one attempt; the task was just
//                         pushed, so the pop never finds the queue empty and
//                         never sleeps (a sleep fails the benchmark);
//   task-queue/raw:       msgsnd and msgrcv of a prepared 1024-byte message,
//                         the area the library sends a task of this size in;
//   task-queue/by-hand:   the library's work written out: copy the value,
//                         FastWriter write into a zeroed 1024-byte area,
//                         msgsnd, msgrcv, Reader parse;
//   task-queue/json-only: jsoncpp alone: FastWriter write and Reader parse
//                         of the same task;
//   task-queue/task-copy: copying the task value, which PushTaskToQueue does
//                         because it takes the task by value.
//
// The task is a small JSON object (about 200 bytes of compact text). The
// summary gives the library's cost over the raw calls as a multiple of
// jsoncpp's write and parse.
//
// The queues are keyed by a file in a fresh temporary directory. Both are
// removed at the end, and also when the run stops early: at exit and on
// SIGINT, SIGTERM and SIGHUP.
#include <errno.h>
#include <math.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <unistd.h>

#include <string>

#include "bench_support.h"
#include "quvaidx/task_queue.h"
#include "util/hooks.h"

namespace qb = quvaidx_bench;

namespace {

constexpr int kLibraryProject = 'L';
constexpr int kRawProject = 'R';
constexpr long kType = 1;
constexpr size_t kArea = 1024;

// The queues and their key file; written before any benchmark runs and read
// by the signal handler, hence plain values of async-signal-safe use.
char g_dir[256];
char g_key_file[300];
volatile sig_atomic_t g_library_queue = -1;
volatile sig_atomic_t g_raw_queue = -1;
volatile sig_atomic_t g_sleeps = 0;

struct RawMessage {
  long type;
  char text[kArea];
};

const Json::Value& Task() {
  static const Json::Value value = [] {
    Json::Value v(Json::objectValue);
    v["command"] = "INDEX_FILE";
    v["path"] = "/share/Multimedia/Holiday 2024/Day 03/IMG_20240817_153012.mp4";
    v["share"] = "Multimedia";
    v["kind"] = "video";
    v["size"] = 411345920;
    v["mtime"] = 1723901412;
    v["priority"] = 2;
    v["retry"] = 0;
    v["force"] = false;
    return v;
  }();
  return value;
}

// Counts sleeps instead of sleeping: the pops measured must never wait.
unsigned CountSleep(unsigned) {
  g_sleeps = g_sleeps + 1;
  return 0;
}

// Removes the queues (by identifier, so no key lookup is needed), the key
// file and the directory. Only async-signal-safe calls; safe to repeat.
void RemoveQueuesAndFiles() {
  if (g_library_queue >= 0) msgctl(g_library_queue, IPC_RMID, nullptr);
  if (g_raw_queue >= 0) msgctl(g_raw_queue, IPC_RMID, nullptr);
  g_library_queue = -1;
  g_raw_queue = -1;
  if (g_key_file[0] != '\0') unlink(g_key_file);
  if (g_dir[0] != '\0') rmdir(g_dir);
}

void OnSignal(int signo) {
  RemoveQueuesAndFiles();
  signal(signo, SIG_DFL);
  raise(signo);
}

// Creates the directory, the key file and both queues. False on failure,
// with whatever was made already removed.
bool SetUp() {
  const char* tmp = getenv("TMPDIR");
  if (tmp == nullptr || tmp[0] == '\0') tmp = "/tmp";
  snprintf(g_dir, sizeof(g_dir), "%s/quvaidx-queue-bench.XXXXXX", tmp);
  if (mkdtemp(g_dir) == nullptr) {
    perror("mkdtemp");
    g_dir[0] = '\0';
    return false;
  }
  snprintf(g_key_file, sizeof(g_key_file), "%s/queue.key", g_dir);
  FILE* key = fopen(g_key_file, "w");
  if (key == nullptr) {
    perror("key file");
    g_key_file[0] = '\0';
    RemoveQueuesAndFiles();
    return false;
  }
  fclose(key);
  atexit(RemoveQueuesAndFiles);
  for (int signo : {SIGINT, SIGTERM, SIGHUP}) signal(signo, OnSignal);
  g_library_queue = CreateMessageQueue(g_key_file, kLibraryProject, 0);
  g_raw_queue = CreateMessageQueue(g_key_file, kRawProject, 0);
  if (g_library_queue < 0 || g_raw_queue < 0) {
    fprintf(stderr, "CreateMessageQueue failed\n");
    RemoveQueuesAndFiles();
    return false;
  }
  return true;
}

// The orderly end: the queues go through the library's own call, then the
// files. RemoveQueuesAndFiles at exit finds nothing left to do.
void TearDown() {
  bool ok = DeleteMessageQueue(g_key_file, kLibraryProject) == 0;
  ok = DeleteMessageQueue(g_key_file, kRawProject) == 0 && ok;
  if (!ok) fprintf(stderr, "DeleteMessageQueue failed\n");
  g_library_queue = -1;
  g_raw_queue = -1;
  RemoveQueuesAndFiles();
}

void BM_Library(benchmark::State& state) {
  const int id = g_library_queue;
  const Json::Value& task = Task();
  const sig_atomic_t sleeps_before = g_sleeps;
  for (auto _ : state) {
    Json::Value out;
    if (PushTaskToQueue(id, task, kType) != 0 ||
        PopTaskFromQueue(id, kType, /*block=*/false, /*attempts=*/1, out) !=
            0) {
      state.SkipWithError("push or pop failed");
      break;
    }
    benchmark::DoNotOptimize(out);
  }
  if (g_sleeps != sleeps_before) state.SkipWithError("a pop slept");
  state.SetItemsProcessed(state.iterations());
}

void BM_Raw(benchmark::State& state) {
  const int id = g_raw_queue;
  RawMessage message;
  memset(&message, 0, sizeof(message));
  message.type = kType;
  std::string text = Json::FastWriter().write(Task());
  memcpy(message.text, text.data(), text.size());
  RawMessage received;
  for (auto _ : state) {
    if (msgsnd(id, &message, kArea, 0) != 0 ||
        msgrcv(id, &received, kArea, kType, IPC_NOWAIT) !=
            static_cast<ssize_t>(kArea)) {
      state.SkipWithError("msgsnd or msgrcv failed");
      break;
    }
    benchmark::ClobberMemory();
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_ByHand(benchmark::State& state) {
  const int id = g_raw_queue;
  const Json::Value& task = Task();
  Json::FastWriter writer;
  Json::Reader reader;
  RawMessage message;
  RawMessage received;
  for (auto _ : state) {
    Json::Value copy = task;
    std::string text = writer.write(copy);
    if (text.size() >= kArea) {
      state.SkipWithError("task too large");
      break;
    }
    message.type = kType;
    memcpy(message.text, text.data(), text.size());
    memset(message.text + text.size(), 0, kArea - text.size());
    ssize_t got = -1;
    if (msgsnd(id, &message, kArea, 0) != 0 ||
        (got = msgrcv(id, &received, kArea, kType, IPC_NOWAIT)) < 0) {
      state.SkipWithError("msgsnd or msgrcv failed");
      break;
    }
    const void* zero = memchr(received.text, '\0', static_cast<size_t>(got));
    const char* end =
        zero != nullptr ? static_cast<const char*>(zero) : received.text + got;
    Json::Value out;
    reader.parse(received.text, end, out, true);
    benchmark::DoNotOptimize(out);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_JsonOnly(benchmark::State& state) {
  const Json::Value& task = Task();
  Json::FastWriter writer;
  Json::Reader reader;
  for (auto _ : state) {
    std::string text = writer.write(task);
    Json::Value parsed;
    reader.parse(text.data(), text.data() + text.size(), parsed, true);
    benchmark::DoNotOptimize(parsed);
  }
}

void BM_TaskCopy(benchmark::State& state) {
  const Json::Value& task = Task();
  for (auto _ : state) {
    Json::Value copy = task;
    benchmark::DoNotOptimize(copy);
  }
}

void Summarise(const qb::KeepingReporter& r) {
  printf(
      "\n== One small task through a message queue, one process "
      "(%zu bytes of JSON) ==\n",
      Json::FastWriter().write(Task()).size());
  printf(
      "  (CPU time of the one benchmark thread, user + system; wall time in "
      "brackets)\n");
  const struct {
    const char* name;
    const char* label;
  } rows[] = {
      {"task-queue/library", "library: PushTaskToQueue + PopTaskFromQueue"},
      {"task-queue/raw", "raw: msgsnd + msgrcv of 1024 bytes"},
      {"task-queue/by-hand", "by hand: copy, write, msgsnd, msgrcv, parse"},
      {"task-queue/json-only",
       "jsoncpp alone: FastWriter write + Reader parse"},
      {"task-queue/task-copy", "copy of the task value"},
  };
  for (const auto& row : rows) {
    printf("  %-64s %10.0f ns/op (%.0f)\n", row.label, r.CpuNsPerOp(row.name),
           r.NsPerOp(row.name));
  }
  double lib = r.CpuNsPerOp("task-queue/library");
  double raw = r.CpuNsPerOp("task-queue/raw");
  double hand = r.CpuNsPerOp("task-queue/by-hand");
  double json = r.CpuNsPerOp("task-queue/json-only");
  double copy = r.CpuNsPerOp("task-queue/task-copy");
  qb::PrintRatio("library / raw", lib / raw, "x");
  qb::PrintRatio("library extra over raw", lib - raw, "ns/op");
  qb::PrintRatio("(library - raw) / jsoncpp write+parse", (lib - raw) / json,
                 "x");
  qb::PrintRatio(
      "  same on wall time",
      (r.NsPerOp("task-queue/library") - r.NsPerOp("task-queue/raw")) /
          r.NsPerOp("task-queue/json-only"),
      "x");
  qb::PrintRatio("  (library - raw) / (jsoncpp + task copy)",
                 (lib - raw) / (json + copy), "x");
  // jsoncpp costs more between system calls than in a loop of its own; the
  // same work done by hand in the same place is the fair measure of what the
  // library adds.
  qb::PrintGoal("(library - raw) / (by hand - raw)", (lib - raw) / (hand - raw),
                1.2, /*at_most=*/true);
  qb::PrintRatio("  library / by hand", lib / hand, "x");
}

}  // namespace

int main(int argc, char** argv) {
  if (!SetUp()) return 1;
  quvaidx::SetSleepFunction(CountSleep);
  benchmark::RegisterBenchmark("task-queue/library", BM_Library);
  benchmark::RegisterBenchmark("task-queue/raw", BM_Raw);
  benchmark::RegisterBenchmark("task-queue/by-hand", BM_ByHand);
  benchmark::RegisterBenchmark("task-queue/json-only", BM_JsonOnly);
  benchmark::RegisterBenchmark("task-queue/task-copy", BM_TaskCopy);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  if (rc == 0) Summarise(reporter);
  quvaidx::SetSleepFunction(nullptr);
  TearDown();
  return rc;
}
