// Draining a spool queue: the consumer calls against the per-entry rewrite.
#include "spool_drain.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "bench_report.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"

namespace spool_drain {
namespace {

namespace qb = quvaidx_bench;

// Bounds: the old way is quadratic, so each of its lengths gets a few
// entries and at most this long; the new drain gives up after its limit.
constexpr double kOldSecondsPerLength = 20;
constexpr double kNewSecondsLimit = 300;
constexpr int kBatch = 8;
constexpr int kEarlyEntries = 1000;  // resident memory is first read here

struct OldLength {
  int lines;
  int entries;  // at most this many are drained
};

double NowSeconds() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec * 1e-9;
}

std::string QueuePath(const std::string& dir) { return dir + "/drain.queue"; }

// The i-th entry: a photo folder that no longer exists, about 55 bytes.
std::string Entry(int i) {
  char text[96];
  snprintf(text, sizeof(text), "/share/Multimedia/Photos/gone/%02d/album-%07d",
           1 + i % 12, i);
  return text;
}

bool WriteQueue(const std::string& path, int lines) {
  FILE* out = fopen(path.c_str(), "we");
  if (out == nullptr) return false;
  for (int i = 0; i < lines; ++i) {
    fputs(Entry(i).c_str(), out);
    fputc('\n', out);
  }
  bool ok = fflush(out) == 0 && fsync(fileno(out)) == 0;
  return fclose(out) == 0 && ok;
}

// A "VmRSS:"-style field of /proc/self/status in kB, or -1.
long StatusKb(const char* field) {
  FILE* status = fopen("/proc/self/status", "re");
  if (status == nullptr) return -1;
  char line[256];
  long kb = -1;
  const size_t length = strlen(field);
  while (fgets(line, sizeof(line), status) != nullptr) {
    if (strncmp(line, field, length) == 0) kb = atol(line + length);
  }
  fclose(status);
  return kb;
}

// What the drain through the consumer calls measured, sent by the child.
struct NewResult {
  long entries = 0;
  double seconds = 0;
  long rss_early_kb = -1;  // after kEarlyEntries entries
  long rss_end_kb = -1;
  long hwm_kb = -1;            // the child's peak
  double longest_call_ms = 0;  // longest RemoveDoneQueueEntries
  int compactions = 0;         // times the queue was a new file afterwards
  bool failed = false;
};

NewResult DrainWithConsumerCalls(const std::string& queue) {
  NewResult r;
  RemoveStaleQueueCopies(queue.c_str());
  const Json::Value none(Json::arrayValue);
  struct stat st;
  ino_t inode = stat(queue.c_str(), &st) == 0 ? st.st_ino : 0;
  const double start = NowSeconds();
  while (!r.failed && NowSeconds() - start < kNewSecondsLimit) {
    Json::Value head;
    const int n = ReadQueueHead(queue.c_str(), kBatch, head);
    if (n <= 0) {
      r.failed = n < 0;
      break;
    }
    for (const Json::Value& entry : head) {
      const std::string text = entry.asString();
      if (CountQueueAttempt(queue.c_str(), text.c_str()) < 1) {
        r.failed = true;
        break;
      }
      access(text.c_str(), F_OK);  // the work: the folder is gone
      Json::Value done(Json::arrayValue);
      done.append(entry);
      const double call = NowSeconds();
      const int removed = RemoveDoneQueueEntries(queue.c_str(), done, none);
      r.longest_call_ms =
          std::max(r.longest_call_ms, (NowSeconds() - call) * 1e3);
      if (removed != 1) {
        r.failed = true;
        break;
      }
      if (stat(queue.c_str(), &st) == 0 && st.st_ino != inode) {
        inode = st.st_ino;
        ++r.compactions;
      }
      if (++r.entries == kEarlyEntries) r.rss_early_kb = StatusKb("VmRSS:");
    }
  }
  r.seconds = NowSeconds() - start;
  r.rss_end_kb = StatusKb("VmRSS:");
  r.hwm_kb = StatusKb("VmHWM:");
  return r;
}

// Runs the drain in a child process, so that its memory is its own.
bool RunNewDrain(const std::string& queue, NewResult* result) {
  int pipe_fds[2];
  if (pipe(pipe_fds) != 0) return false;
  const pid_t child = fork();
  if (child < 0) return false;
  if (child == 0) {
    close(pipe_fds[0]);
    const NewResult r = DrainWithConsumerCalls(queue);
    const bool sent = write(pipe_fds[1], &r, sizeof(r)) == sizeof(r);
    _exit(sent ? 0 : 1);
  }
  close(pipe_fds[1]);
  const bool got = read(pipe_fds[0], result, sizeof(*result)) ==
                   static_cast<ssize_t>(sizeof(*result));
  close(pipe_fds[0]);
  int status = 0;
  waitpid(child, &status, 0);
  return got && WIFEXITED(status) && WEXITSTATUS(status) == 0 &&
         !result->failed;
}

// The first line of the locked queue, read as the old consumer did.
std::string FirstLine(int fd) {
  char block[4096];
  const ssize_t got = pread(fd, block, sizeof(block), 0);
  if (got <= 0) return "";
  const void* newline = memchr(block, '\n', static_cast<size_t>(got));
  return newline == nullptr
             ? std::string(block, static_cast<size_t>(got))
             : std::string(block, static_cast<const char*>(newline) - block);
}

// One entry the old way: read the head under the lock, do the work, then
// lock again, check the head and rewrite the queue without it.
bool OldStep(const std::string& queue) {
  int fd = open(queue.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0 || flock(fd, LOCK_EX) != 0) return false;
  const std::string entry = FirstLine(fd);
  close(fd);
  if (entry.empty() || access(entry.c_str(), F_OK) == 0) return false;
  fd = open(queue.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0 || flock(fd, LOCK_EX) != 0) return false;
  const bool ok =
      FirstLine(fd) == entry && FileRemoveHeadingLine(queue.c_str(), 1) == 0;
  close(fd);
  return ok;
}

// Entries per second of the old way on a queue of `length.lines` lines.
double OldRate(const std::string& queue, const OldLength& length) {
  if (!WriteQueue(queue, length.lines)) return -1;
  const double start = NowSeconds();
  int done = 0;
  while (done < length.entries &&
         (done < 2 || NowSeconds() - start < kOldSecondsPerLength)) {
    if (!OldStep(queue)) return -1;
    ++done;
  }
  return done / (NowSeconds() - start);
}

}  // namespace

std::vector<std::string> DrainFiles(const std::string& dir) {
  return {QueuePath(dir), QueuePath(dir) + ".consumer"};
}

bool RunDrainComparison(const std::string& dir, int lines) {
  const std::string queue = QueuePath(dir);
  printf("\nDraining a queue of %d entries of folders that are gone, in %s:\n",
         lines, dir.c_str());
  fflush(stdout);
  NewResult r;
  if (!WriteQueue(queue, lines) || !RunNewDrain(queue, &r)) {
    fprintf(stderr, "spool_bench: the drain through the consumer failed\n");
    return false;
  }
  const double new_rate = r.entries / r.seconds;
  qb::PrintRatio("consumer calls, entries per second", new_rate, "/s");
  qb::PrintRatio("consumer calls, whole drain", r.seconds, "s");
  qb::PrintRatio("longest RemoveDoneQueueEntries (lock held)",
                 r.longest_call_ms, "ms");
  qb::PrintRatio("compactions", r.compactions, "");
  qb::PrintRatio("resident memory after 1,000 entries",
                 static_cast<double>(r.rss_early_kb), "kB");
  qb::PrintRatio("resident memory at the end",
                 static_cast<double>(r.rss_end_kb), "kB");
  qb::PrintRatio("peak resident memory", static_cast<double>(r.hwm_kb), "kB");
  if (r.entries != lines) {
    fprintf(stderr, "spool_bench: drained %ld of %d entries in time\n",
            r.entries, lines);
    return false;
  }
  const OldLength old_lengths[] = {{10000, 300}, {100000, 40}, {lines, 6}};
  double old_rate = -1;
  for (const OldLength& length : old_lengths) {
    old_rate = OldRate(queue, length);
    if (old_rate < 0) {
      fprintf(stderr, "spool_bench: the old drain failed\n");
      return false;
    }
    char label[96];
    snprintf(label, sizeof(label),
             "old per-entry rewrite at %d lines, entries per second",
             length.lines);
    qb::PrintRatio(label, old_rate, "/s");
  }
  unlink(queue.c_str());
  qb::PrintGoal("drain speed at the full length: consumer calls / old",
                new_rate / old_rate, 100, /*at_most=*/false);
  qb::PrintGoal("resident memory growth over the drain, kB",
                static_cast<double>(r.rss_end_kb - r.rss_early_kb), 1024,
                /*at_most=*/true);
  return true;
}

}  // namespace spool_drain
