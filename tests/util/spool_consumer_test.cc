// The consumer side of spool queues: what the head reads as, what removal
// may and may not take, a replaced queue, writers racing a consumer, the
// bookkeeping (blanked entries, the side file, cutting and compaction,
// attempts) and what a killed consumer leaves.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <fstream>
#include <map>
#include <random>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "util/queue_state.h"

namespace {

using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

Json::Value Strings(std::initializer_list<std::string> items) {
  Json::Value array(Json::arrayValue);
  for (const std::string& item : items) array.append(item);
  return array;
}

std::vector<std::string> AsVector(const Json::Value& array) {
  std::vector<std::string> out;
  for (const Json::Value& item : array) out.push_back(item.asString());
  return out;
}

// The entry lines of a queue's text, each with its line feed: what a
// consumer sees, whatever blank lines the bookkeeping left.
std::string Live(const std::string& text) {
  std::string live;
  size_t at = 0;
  while (at < text.size()) {
    size_t end = text.find('\n', at);
    if (end == std::string::npos) end = text.size();
    if (end > at) live += text.substr(at, end - at) + "\n";
    at = end + 1;
  }
  return live;
}

// Compares texts of megabytes without gtest's line diff (which would need
// memory quadratic in their lines): says where they part.
testing::AssertionResult SameText(const std::string& a, const std::string& b) {
  if (a == b) return testing::AssertionSuccess();
  const auto at = std::mismatch(a.begin(), a.end(), b.begin(), b.end());
  return testing::AssertionFailure()
         << "sizes " << a.size() << " and " << b.size() << ", first "
         << "difference at byte " << (at.first - a.begin());
}

struct stat StatOf(const std::string& path) {
  struct stat st = {};
  EXPECT_EQ(0, stat(path.c_str(), &st)) << path;
  return st;
}

// Names in `dir` that have the form of a temporary copy of `base`.
int CopiesOf(const std::string& dir, const std::string& base) {
  const std::regex copy(base + "\\.[A-Za-z0-9]{6}");
  int count = 0;
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* entry = readdir(d)) {
      count += std::regex_match(entry->d_name, copy);
    }
    closedir(d);
  }
  return count;
}

// `lines` entries "/share/Photos/album-NNNNNN/...", 46 bytes each.
std::string PhotoQueue(int lines, int first = 0) {
  std::string text;
  for (int i = first; i < first + lines; ++i) {
    char line[96];
    snprintf(line, sizeof(line), "/share/Photos/album-%06d/2015-summer-%06d\n",
             i, i);
    text += line;
  }
  return text;
}

class SpoolConsumerTest : public ::testing::Test {
 protected:
  std::vector<std::string> All() {
    Json::Value entries;
    EXPECT_GE(ReadQueueHead(queue_.c_str(), 1 << 20, entries), 0);
    return AsVector(entries);
  }

  TempDir dir_;
  std::string queue_ = dir_.File("thumb.queue");
};

// Lines no writer of the library produces must come back as "" (so the
// consumer skips them and can still remove them), never cut, glued or
// split; empty lines (finished entries) are no entries; a last line
// without its line feed still counts.
TEST_F(SpoolConsumerTest, HeadReadsWholeLinesSkipsEmptyOnesBlanksForeignOnes) {
  const std::string longest(kMaxQueueEntry, 'x');
  struct Case {
    std::string content;
    int max;
    std::vector<std::string> expected;
  } cases[] = {
      {"/a\n/b\n/c\n", 2, {"/a", "/b"}},
      {"/a\n/b\n", 8, {"/a", "/b"}},
      {"/a\n/unfinished", 8, {"/a", "/unfinished"}},
      {"\n/a\n\n\n/b", 8, {"/a", "/b"}},
      {"\n\n\n", 8, {}},
      {longest + "\n" + longest + "y\n/after\n", 8, {longest, "", "/after"}},
      {std::string("/nul\0here\n/b\n", 12), 8, {"", "/b"}},
      {std::string("\0\0\0\n\0\n\n/b\n", 10), 8, {"", "", "/b"}},
      {"", 8, {}},
  };
  for (const Case& c : cases) {
    WriteFile(queue_, c.content);
    Json::Value entries = Strings({"stale"});
    EXPECT_EQ(ReadQueueHead(queue_.c_str(), c.max, entries),
              static_cast<int>(c.expected.size()));
    EXPECT_EQ(AsVector(entries), c.expected) << c.content.substr(0, 40);
    EXPECT_EQ(ReadFile(queue_), c.content);  // reading changes nothing
  }
}

// A missing queue is empty; a FIFO in the queue's place must not block the
// daemon, and bad arguments leave the output alone.
TEST_F(SpoolConsumerTest, MissingQueueIsEmptyAndOddFilesAreRefused) {
  LogCapture log;
  FdLeakCheck fds;
  Json::Value entries = Strings({"kept"});
  EXPECT_EQ(ReadQueueHead(queue_.c_str(), 4, entries), 0);
  EXPECT_EQ(entries, Json::Value(Json::arrayValue));
  entries = Strings({"kept"});
  std::string fifo = dir_.File("fifo.queue");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  for (const std::string& odd : {fifo, dir_.path()}) {
    EXPECT_EQ(ReadQueueHead(odd.c_str(), 4, entries), -1);
    EXPECT_EQ(RemoveDoneQueueEntries(odd.c_str(), Strings({"/a"}), Strings({})),
              -1);
    EXPECT_EQ(TrimQueueHead(odd.c_str(), 1), -1);
    EXPECT_EQ(CountQueueAttempt(odd.c_str(), "/a"), -1);
    EXPECT_EQ(RemoveStaleQueueCopies(odd.c_str()), -1);
  }
  EXPECT_EQ(ReadQueueHead(queue_.c_str(), 0, entries), -1);
  EXPECT_EQ(ReadQueueHead(nullptr, 4, entries), -1);
  EXPECT_EQ(entries, Strings({"kept"}));
  EXPECT_EQ(
      RemoveDoneQueueEntries(queue_.c_str(), Json::Value("/a"), Strings({})),
      -1);
  EXPECT_EQ(RemoveDoneQueueEntries(queue_.c_str(), Strings({}),
                                   Json::Value(Json::objectValue)),
            -1);
  EXPECT_EQ(TrimQueueHead(queue_.c_str(), 1), -1);  // missing
  EXPECT_EQ(CountQueueAttempt(queue_.c_str(), "/a"), -1);
  EXPECT_EQ(CountQueueAttempt(queue_.c_str(), nullptr), -1);
  EXPECT_EQ(RemoveStaleQueueCopies(queue_.c_str()), 0);
  EXPECT_TRUE(fds.NoLeak());
}

// Removal takes only the head entries the caller names, in order: an entry
// trimmed by someone else, an entry re-queued meanwhile or a line the
// consumer never read must survive. What is left is text without a zero
// byte, and a queue left without entries is empty.
TEST_F(SpoolConsumerTest, RemovesOnlyTheNamedHeadEntries) {
  const std::string overlong(kMaxQueueEntry + 1, 'y');
  struct Case {
    const char* fault;
    std::string content;
    Json::Value done;
    Json::Value requeue;
    int removed;
    std::string after;
  } cases[] = {
      {"removes the done prefix only", "/a\n/b\n/c\n", Strings({"/a", "/b"}),
       Strings({}), 2, "/c\n"},
      {"head trimmed by another process", "/b\n/c\n", Strings({"/a", "/b"}),
       Strings({}), 0, "/b\n/c\n"},
      {"stops at the first differing line", "/a\n/x\n/b\n",
       Strings({"/a", "/b"}), Strings({}), 1, "/x\n/b\n"},
      {"an entry appended meanwhile stays", "/a\n/new\n", Strings({"/a"}),
       Strings({}), 1, "/new\n"},
      {"foreign lines are removed as read",
       "\n" + overlong + std::string("\n\n/nul\0\n/a\n", 11), Strings({"", ""}),
       Strings({}), 2, "/a\n"},
      {"blank lines are not entries", "\n\n/a\n\n/b\n", Strings({"/a", "/b"}),
       Strings({}), 2, ""},
      {"requeue goes to the tail, even as a duplicate", "/a\n/b\n",
       Strings({"/a"}), Strings({"/a"}), 1, "/b\n/a\n"},
      {"requeue refuses what would corrupt the queue", "/a\n", Strings({"/a"}),
       Strings({"", "two\nlines", overlong, "/ok"}), 1, "/ok\n"},
      {"nothing named, nothing removed", "/a\n", Strings({}), Strings({}), 0,
       "/a\n"},
  };
  for (const Case& c : cases) {
    WriteFile(queue_, c.content);
    EXPECT_EQ(RemoveDoneQueueEntries(queue_.c_str(), c.done, c.requeue),
              c.removed)
        << c.fault;
    const std::string after = ReadFile(queue_);
    EXPECT_EQ(Live(after), c.after) << c.fault;
    EXPECT_EQ(c.after.empty(), after.empty()) << c.fault;
    EXPECT_EQ(std::string::npos, after.find('\0')) << c.fault;
  }
  unlink(queue_.c_str());
  EXPECT_EQ(
      RemoveDoneQueueEntries(queue_.c_str(), Strings({"/a"}), Strings({})), 0);
  EXPECT_EQ(
      RemoveDoneQueueEntries(queue_.c_str(), Strings({}), Strings({"/back"})),
      0);
  EXPECT_EQ(ReadFile(queue_), "/back\n");
}

// A consumer that waited for the lock while the queue was replaced must
// read and trim the new file, not the unlinked old one.
TEST_F(SpoolConsumerTest, WaiterFollowsAQueueReplacedWhileItWaited) {
  WriteFile(queue_, "/old\n");
  int holder = open(queue_.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(holder, 0);
  ASSERT_EQ(flock(holder, LOCK_EX), 0);
  Json::Value entries;
  int read = -2;
  std::thread reader([&] { read = ReadQueueHead(queue_.c_str(), 4, entries); });
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  std::string fresh = dir_.File("fresh");
  WriteFile(fresh, "/new1\n/new2\n");
  ASSERT_EQ(rename(fresh.c_str(), queue_.c_str()), 0);
  close(holder);  // lets the reader have the old file's lock
  reader.join();
  EXPECT_EQ(read, 2);
  EXPECT_EQ(AsVector(entries), (std::vector<std::string>{"/new1", "/new2"}));
}

// Writers append while a consumer reads, works and removes: every entry is
// done exactly once and none is left or lost. WriteIndexQueue skips an
// entry still queued, so the writers' entries are all distinct.
TEST_F(SpoolConsumerTest, ConcurrentWritersLoseNothingAndNothingRunsTwice) {
  constexpr int kWriters = 3;
  constexpr int kPerWriter = 60;
  std::atomic<int> writers_left{kWriters};
  std::vector<std::thread> writers;
  for (int w = 0; w < kWriters; ++w) {
    writers.emplace_back([&, w] {
      for (int i = 0; i < kPerWriter; ++i) {
        std::string entry =
            "/share/w" + std::to_string(w) + "/" + std::to_string(i);
        ASSERT_EQ(WriteIndexQueue(entry.c_str(), queue_.c_str()), 0);
      }
      --writers_left;
    });
  }
  std::map<std::string, int> done_count;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::seconds(20);
  for (;;) {
    bool writers_finished = writers_left.load() == 0;
    Json::Value entries;
    int n = ReadQueueHead(queue_.c_str(), 7, entries);
    ASSERT_GE(n, 0);
    if (n == 0 && writers_finished) break;
    for (const Json::Value& entry : entries) {
      ++done_count[entry.asString()];  // the work
      Json::Value done(Json::arrayValue);
      done.append(entry);
      ASSERT_EQ(RemoveDoneQueueEntries(queue_.c_str(), done,
                                       Json::Value(Json::arrayValue)),
                1);
    }
    ASSERT_LT(std::chrono::steady_clock::now(), deadline);
  }
  for (std::thread& t : writers) t.join();
  EXPECT_EQ(done_count.size(), static_cast<size_t>(kWriters * kPerWriter));
  for (const auto& [entry, count] : done_count) {
    EXPECT_EQ(count, 1) << entry;
  }
  EXPECT_EQ(ReadFile(queue_), "");
}

// A finished entry must leave the queue's text, or a writer's duplicate
// test would still find it and silently drop the same folder queued again;
// and finishing one must not rewrite the queue.
TEST_F(SpoolConsumerTest, FinishedEntryIsBlankedInPlaceAndCanBeQueuedAgain) {
  WriteFile(queue_, "/a\n/b\n");
  const struct stat before = StatOf(queue_);
  ASSERT_EQ(
      RemoveDoneQueueEntries(queue_.c_str(), Strings({"/a"}), Strings({})), 1);
  EXPECT_EQ(ReadFile(queue_), "\n\n\n/b\n");
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino) << "rewritten";
  ASSERT_EQ(WriteIndexQueue("/a", queue_.c_str()), 0);
  EXPECT_EQ(All(), (std::vector<std::string>{"/b", "/a"}));
  for (const char* entry : {"/b", "/a"}) {
    ASSERT_EQ(
        RemoveDoneQueueEntries(queue_.c_str(), Strings({entry}), Strings({})),
        1);
  }
  EXPECT_EQ(ReadFile(queue_), "") << "a drained queue is cut to nothing";
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino);
}

// The side file is a hint that anyone may damage, and a queue may be cut or
// made anew in place: whatever it says, no entry is skipped. A head found
// far into the queue is remembered for the next call.
TEST_F(SpoolConsumerTest, SideFileNeverMakesEntriesSkipped) {
  const std::string blank(70000, '\n');
  WriteFile(queue_, blank + "/a\n/b\n");
  ASSERT_EQ(All(), (std::vector<std::string>{"/a", "/b"}));
  quvaidx::QueueState remembered;
  ASSERT_TRUE(quvaidx::LoadQueueState(queue_.c_str(), &remembered));
  EXPECT_EQ(remembered.head, static_cast<int64_t>(blank.size()));

  const std::string side = quvaidx::QueueStatePath(queue_.c_str());
  const std::string real = PhotoQueue(40);  // 2,600 bytes of entries
  auto record = [&](int64_t head) {
    quvaidx::QueueState state = remembered;
    state.head = head;
    return quvaidx::FormatQueueState(state);
  };
  std::string torn = record(1500);
  torn[40] ^= 1;
  const struct {
    const char* what;
    std::string side;
  } cases[] = {
      {"garbage", "head=99999\n"},
      {"torn record", torn},
      {"head beyond the end", record(1 << 30)},
      {"head within the entries of a queue cut and refilled", record(1500)},
      {"head after blank lines below entries", record(2800)},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    // The same file (inode and birth time) as the record: cut, then filled.
    ASSERT_EQ(truncate(queue_.c_str(), 0), 0);
    std::ofstream(queue_, std::ios::app) << real << std::string(300, '\n');
    WriteFile(side, c.side);
    EXPECT_EQ(Live(ReadFile(queue_)).size(), real.size());
    const std::vector<std::string> all = All();
    ASSERT_EQ(all.size(), 40u);
    EXPECT_EQ(all.front(), "/share/Photos/album-000000/2015-summer-000000");
    Json::Value done;
    done.append(all.front());
    EXPECT_EQ(RemoveDoneQueueEntries(queue_.c_str(), done, Strings({})), 1);
  }
}

// A mostly blank queue is compacted into a new file: the entries left, in
// order, with the queue's owner and group and its read and write bits
// (never an execute bit), and no copy left beside it.
TEST_F(SpoolConsumerTest, CompactionKeepsEntriesOwnerAndModeLeavesNoCopy) {
  WriteFile(queue_, PhotoQueue(36000));  // 1.66 MB
  ASSERT_EQ(chown(queue_.c_str(), 65534, 65534), 0);
  ASSERT_EQ(chmod(queue_.c_str(), 0775), 0);
  const struct stat before = StatOf(queue_);
  ASSERT_EQ(TrimQueueHead(queue_.c_str(), 12000), 0);  // a third: kept
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino);
  EXPECT_TRUE(SameText(Live(ReadFile(queue_)), PhotoQueue(24000, 12000)));
  Json::Value head;
  ASSERT_EQ(ReadQueueHead(queue_.c_str(), 12000, head), 12000);
  ASSERT_EQ(RemoveDoneQueueEntries(queue_.c_str(), head, Strings({"/back"})),
            12000);  // now two thirds, over 1 MiB, blank: compacted
  const struct stat after = StatOf(queue_);
  EXPECT_NE(after.st_ino, before.st_ino);
  EXPECT_TRUE(SameText(ReadFile(queue_), PhotoQueue(12000, 24000) + "/back\n"));
  EXPECT_EQ(after.st_uid, 65534u);
  EXPECT_EQ(after.st_gid, 65534u);
  EXPECT_EQ(after.st_mode & 07777, 0664u);
  EXPECT_EQ(CopiesOf(dir_.path(), "thumb.queue"), 0);
  EXPECT_EQ(All().front(), "/share/Photos/album-024000/2015-summer-024000");
}

// A consumer killed at any moment of blanking and compacting loses no entry
// it did not finish and corrupts none; what it leaves beside the queue is
// at most a copy in the instant before its rename, which
// RemoveStaleQueueCopies removes at the next start.
TEST_F(SpoolConsumerTest, KilledConsumerLosesNothingAndCopiesAreRemoved) {
  const std::string original = PhotoQueue(36000);  // 1.66 MB
  std::mt19937 random(12345);
  int runs_with_copy = 0;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::seconds(15);
  for (int run = 0; run < 24 && std::chrono::steady_clock::now() < deadline;
       ++run) {
    WriteFile(queue_, original);
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) _exit(TrimQueueHead(queue_.c_str(), 24000) == 0 ? 0 : 1);
    usleep(std::uniform_int_distribution<useconds_t>(0, 12000)(random));
    kill(child, SIGKILL);
    int status;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    runs_with_copy += CopiesOf(dir_.path(), "thumb.queue") > 0;
    ASSERT_GE(RemoveStaleQueueCopies(queue_.c_str()), 0);
    EXPECT_EQ(CopiesOf(dir_.path(), "thumb.queue"), 0);
    // Entries half blanked read as ""; the others are the untrimmed tail
    // at least, each whole.
    std::vector<std::string> left = All();
    left.erase(std::remove(left.begin(), left.end(), ""), left.end());
    ASSERT_GE(left.size(), 12000u) << "run " << run;
    std::string text;
    for (const std::string& entry : left) text += entry + "\n";
    EXPECT_TRUE(SameText(text, original.substr(original.size() - text.size())))
        << "run " << run;
  }
  EXPECT_LE(runs_with_copy, 3) << "copies are left for longer than a rename";
}

// Only the names a rewrite gives its copies go, and only regular files.
TEST_F(SpoolConsumerTest, StaleCopiesAreRemovedByTheirExactNameOnly) {
  LogCapture log;
  WriteFile(queue_, "/a\n");
  for (const char* copy : {"thumb.queue.abc123", "thumb.queue.Z9z9Z9"}) {
    WriteFile(dir_.File(copy), "/old\n");
  }
  const char* kept[] = {"thumb.queue.abc12",  "thumb.queue.abc1234",
                        "thumb.queue.ab-123", "thumb.queue.consumer",
                        "other.queue.abc123", "thumb.queueXabc123"};
  for (const char* name : kept) WriteFile(dir_.File(name), "keep");
  ASSERT_EQ(mkdir(dir_.File("thumb.queue.dir123").c_str(), 0755), 0);
  ASSERT_EQ(symlink(queue_.c_str(), dir_.File("thumb.queue.lnk123").c_str()),
            0);
  EXPECT_EQ(RemoveStaleQueueCopies(queue_.c_str()), 2);
  EXPECT_EQ(log.lines().size(), 2u);
  for (const auto& line : log.lines()) EXPECT_EQ(line.priority, LOG_WARNING);
  for (const char* name : kept) EXPECT_EQ(ReadFile(dir_.File(name)), "keep");
  EXPECT_EQ(CopiesOf(dir_.path(), "thumb.queue"), 2);  // dir123, lnk123
  EXPECT_EQ(ReadFile(queue_), "/a\n");
}

// An entry that kills its consumer is seen again with a higher number
// after each restart; the count starts again for another entry, and once
// the counted entry is removed.
TEST_F(SpoolConsumerTest, AttemptsSurviveTheConsumerAndResetWithTheHead) {
  WriteFile(queue_, "/poison\n/next\n");
  const char* q = queue_.c_str();
  EXPECT_EQ(CountQueueAttempt(q, "/poison"), 1);
  for (int attempt : {2, 3}) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      // Dies in the middle of the entry's work, without any clean-up.
      _exit(CountQueueAttempt(q, "/poison"));
    }
    int status;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(WEXITSTATUS(status), attempt);
  }
  EXPECT_EQ(CountQueueAttempt(q, "/poison"), 4);
  ASSERT_EQ(RemoveDoneQueueEntries(q, Strings({"/poison"}), Strings({})), 1);
  EXPECT_EQ(CountQueueAttempt(q, "/next"), 1);
  EXPECT_EQ(CountQueueAttempt(q, "/next"), 2);
  ASSERT_EQ(WriteIndexQueue("/poison", q), 0);
  ASSERT_EQ(RemoveDoneQueueEntries(q, Strings({"/next"}), Strings({})), 1);
  EXPECT_EQ(CountQueueAttempt(q, "/poison"), 1) << "removed entry counted on";
  WriteFile(quvaidx::QueueStatePath(q), "damaged");
  EXPECT_EQ(CountQueueAttempt(q, "/poison"), 1);
  EXPECT_EQ(CountQueueAttempt(q, "/poison"), 2);
}

// Queue files made by the consumer hold text: never an execute bit.
TEST_F(SpoolConsumerTest, QueueMadeByARequeueIsNotExecutable) {
  const mode_t old_umask = umask(0);
  const int made =
      RemoveDoneQueueEntries(queue_.c_str(), Strings({}), Strings({"/a"}));
  umask(old_umask);
  ASSERT_EQ(made, 0);
  EXPECT_EQ(StatOf(queue_).st_mode & 07777, 0666u);
}

}  // namespace
