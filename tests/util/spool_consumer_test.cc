// The consumer side of spool queues: reading the head, removal, a replaced
// queue, racing writers, the bookkeeping and what a killed consumer leaves.
#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <random>
#include <regex>
#include <sstream>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"
#include "util/queue_state.h"

namespace {

using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;
using Strings = std::vector<std::string>;

Json::Value ToJson(const Strings& items) {
  Json::Value array(Json::arrayValue);
  for (const std::string& item : items) array.append(item);
  return array;
}

Strings AsVector(const Json::Value& array) {
  Strings out;
  for (const Json::Value& item : array) out.push_back(item.asString());
  return out;
}

// The entry lines of a queue's text, each with its line feed: what a
// consumer sees, whatever blank lines the bookkeeping left.
std::string Live(const std::string& text) {
  std::string live;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) {
    if (!line.empty()) live += line + "\n";
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

// Names in `dir` that have the form of a temporary copy of thumb.queue.
int Copies(const std::string& dir) {
  const std::regex copy("thumb\\.queue\\.[A-Za-z0-9]{6}");
  int count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) {
    count += std::regex_match(entry.path().filename().string(), copy);
  }
  return count;
}

// `lines` entries "/share/Photos/album-NNNNNN/...", 46 bytes each.
std::string PhotoQueue(int lines, int first = 0) {
  std::string text;
  char line[96];
  for (int i = first; i < first + lines; ++i) {
    snprintf(line, sizeof(line), "/share/Photos/album-%06d/2015-summer-%06d\n",
             i, i);
    text += line;
  }
  return text;
}

class SpoolConsumerTest : public ::testing::Test {
 protected:
  Strings All() {
    Json::Value entries;
    EXPECT_GE(ReadQueueHead(q_, 1 << 20, entries), 0);
    return AsVector(entries);
  }

  int Remove(const Strings& done, const Strings& requeue = {}) {
    return RemoveDoneQueueEntries(q_, ToJson(done), ToJson(requeue));
  }

  TempDir dir_;
  std::string queue_ = dir_.File("thumb.queue");
  const char* q_ = queue_.c_str();
};

// Lines no writer of the library produces come back as "" (skipped, still
// removable), never cut, glued or split; empty lines are no entries; a last
// line without its line feed counts; reading changes nothing.
TEST_F(SpoolConsumerTest, HeadReadsWholeLinesSkipsEmptyOnesBlanksForeignOnes) {
  const std::string longest(kMaxQueueEntry, 'x');
  const std::tuple<std::string, int, Strings> cases[] = {
      // text, max, read
      {"/a\n/b\n/c\n", 2, {"/a", "/b"}},
      {"/a\n/b\n", 8, {"/a", "/b"}},
      {"/a\n/unfinished", 8, {"/a", "/unfinished"}},
      {"\n\n\n", 8, {}},
      {"\n/a\n\n\n/b", 8, {"/a", "/b"}},
      {"", 8, {}},
      {longest + "\n" + longest + "y\n/after\n", 8, {longest, "", "/after"}},
      {std::string("/nul\0here\n/b\n", 12), 8, {"", "/b"}},
      {std::string("\0\0\0\n\0\n\n/b\n", 10), 8, {"", "", "/b"}}};
  for (const auto& [content, max, expected] : cases) {
    WriteFile(queue_, content);
    Json::Value entries = ToJson({"stale"});
    EXPECT_EQ(ReadQueueHead(q_, max, entries),
              static_cast<int>(expected.size()));
    EXPECT_EQ(AsVector(entries), expected) << content.substr(0, 40);
    EXPECT_EQ(ReadFile(queue_), content);
  }
}

// A missing queue is empty; a FIFO in the queue's place must not block the
// daemon, and bad arguments leave the output alone.
TEST_F(SpoolConsumerTest, MissingQueueIsEmptyAndOddFilesAreRefused) {
  LogCapture log;
  FdLeakCheck fds;
  Json::Value entries = ToJson({"kept"});
  EXPECT_EQ(ReadQueueHead(q_, 4, entries), 0);
  EXPECT_EQ(entries, Json::Value(Json::arrayValue));
  entries = ToJson({"kept"});
  std::string fifo = dir_.File("fifo.queue");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  for (const std::string& odd : {fifo, dir_.path()}) {
    const char* path = odd.c_str();
    EXPECT_EQ(ReadQueueHead(path, 4, entries), -1);
    EXPECT_EQ(RemoveDoneQueueEntries(path, ToJson({"/a"}), ToJson({})), -1);
    EXPECT_EQ(TrimQueueHead(path, 1), -1);
    EXPECT_EQ(CountQueueAttempt(path, "/a"), -1);
    EXPECT_EQ(RemoveStaleQueueCopies(path), -1);
  }
  EXPECT_EQ(ReadQueueHead(q_, 0, entries), -1);
  EXPECT_EQ(ReadQueueHead(nullptr, 4, entries), -1);
  EXPECT_EQ(entries, ToJson({"kept"}));
  EXPECT_EQ(RemoveDoneQueueEntries(q_, Json::Value("/a"), ToJson({})), -1);
  EXPECT_EQ(RemoveDoneQueueEntries(q_, ToJson({}), Json::objectValue), -1);
  EXPECT_EQ(TrimQueueHead(q_, 1), -1);  // missing
  EXPECT_EQ(CountQueueAttempt(q_, "/a"), -1);
  EXPECT_EQ(CountQueueAttempt(q_, nullptr), -1);
  EXPECT_EQ(RemoveStaleQueueCopies(q_), 0);
  EXPECT_TRUE(fds.NoLeak());
}

// Removal takes only the head entries the caller names, in order: an entry
// trimmed by someone else, re-queued meanwhile or never read survives. What
// is left has no zero byte; a queue left without entries is empty, and one
// a requeue makes is never executable.
TEST_F(SpoolConsumerTest, RemovesOnlyTheNamedHeadEntries) {
  const std::string overlong(kMaxQueueEntry + 1, 'y');
  const std::string longest(kMaxQueueEntry, 'x');
  const std::string foreign =
      "\n" + overlong + std::string("\n\n/nul\0\n/a\n", 11);
  // text, done, requeued, removed, entries after
  const std::tuple<std::string, Strings, Strings, int, std::string> cases[] = {
      {"/a\n/b\n/c\n", {"/a", "/b"}, {}, 2, "/c\n"},  // the done prefix only
      {"/b\n/c\n", {"/a", "/b"}, {}, 0, "/b\n/c\n"},  // head trimmed elsewhere
      {"/a\n/x\n/b\n", {"/a", "/b"}, {}, 1, "/x\n/b\n"},  // stops at a change
      {"/a\n/new\n", {"/a"}, {}, 1, "/new\n"},  // appended meanwhile: stays
      {foreign, {"", ""}, {}, 2, "/a\n"},       // foreign lines removed as read
      {"\n\n/a\n\n/b\n", {"/a", "/b"}, {}, 2, ""},  // blank lines: no entries
      {"/a\n/b\n", {"/a"}, {"/a"}, 1, "/b\n/a\n"},  // requeue to the tail
      {"/a\n",
       {"/a"},
       {"", "two\nlines", overlong, longest, "/ok"},
       1,
       longest + "\n/ok\n"},
      {"/a\n", {}, {}, 0, "/a\n"},
  };
  for (const auto& [content, done, requeue, removed, live] : cases) {
    SCOPED_TRACE(content.substr(0, 20));
    WriteFile(queue_, content);
    EXPECT_EQ(Remove(done, requeue), removed);
    const std::string after = ReadFile(queue_);
    EXPECT_EQ(Live(after), live);
    EXPECT_EQ(live.empty(), after.empty());
    EXPECT_EQ(std::string::npos, after.find('\0'));
  }
  unlink(q_);
  EXPECT_EQ(Remove({"/a"}), 0);
  const mode_t old_umask = umask(0);
  EXPECT_EQ(Remove({}, {"/back"}), 0);
  umask(old_umask);
  EXPECT_EQ(ReadFile(queue_), "/back\n");
  EXPECT_EQ(StatOf(queue_).st_mode & 07777, 0666u);
}

// A consumer that waited for the lock while the queue was replaced must
// read and trim the new file, not the unlinked old one.
TEST_F(SpoolConsumerTest, WaiterFollowsAQueueReplacedWhileItWaited) {
  WriteFile(queue_, "/old\n");
  int holder = open(q_, O_RDONLY | O_CLOEXEC);
  ASSERT_GE(holder, 0);
  ASSERT_EQ(flock(holder, LOCK_EX), 0);
  Json::Value entries;
  int read = -2;
  std::thread reader([&] { read = ReadQueueHead(q_, 4, entries); });
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  WriteFile(dir_.File("fresh"), "/new1\n/new2\n");
  ASSERT_EQ(rename(dir_.File("fresh").c_str(), q_), 0);
  close(holder);  // lets the reader have the old file's lock
  reader.join();
  EXPECT_EQ(read, 2);
  EXPECT_EQ(AsVector(entries), (Strings{"/new1", "/new2"}));
}

// Writers append while a consumer reads, works and removes: every entry is
// done exactly once and none is left or lost.
TEST_F(SpoolConsumerTest, ConcurrentWritersLoseNothingAndNothingRunsTwice) {
  constexpr int kWriters = 3, kPerWriter = 60;
  std::atomic<int> writers_left{kWriters};
  std::vector<std::thread> writers;
  for (int w = 0; w < kWriters; ++w) {
    writers.emplace_back([&, w] {
      for (int i = 0; i < kPerWriter; ++i) {
        std::string entry = "/w" + std::to_string(w) + "/" + std::to_string(i);
        ASSERT_EQ(WriteIndexQueue(entry.c_str(), q_), 0);
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
    int n = ReadQueueHead(q_, 7, entries);
    ASSERT_GE(n, 0);
    if (n == 0 && writers_finished) break;
    for (const std::string& entry : AsVector(entries)) {
      ++done_count[entry];  // the work
      ASSERT_EQ(Remove({entry}), 1);
    }
    ASSERT_LT(std::chrono::steady_clock::now(), deadline);
  }
  for (std::thread& t : writers) t.join();
  EXPECT_EQ(done_count.size(), static_cast<size_t>(kWriters * kPerWriter));
  for (const auto& [entry, count] : done_count) EXPECT_EQ(count, 1) << entry;
  EXPECT_EQ(ReadFile(queue_), "");
}

// A finished entry must leave the queue's text, or a writer's duplicate
// test would drop the same folder queued again; finishing one must not
// rewrite the queue.
TEST_F(SpoolConsumerTest, FinishedEntryIsBlankedInPlaceAndCanBeQueuedAgain) {
  WriteFile(queue_, "/a\n/b\n");
  const struct stat before = StatOf(queue_);
  ASSERT_EQ(Remove({"/a"}), 1);
  EXPECT_EQ(ReadFile(queue_), "\n\n\n/b\n");
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino) << "rewritten";
  ASSERT_EQ(WriteIndexQueue("/a", q_), 0);
  EXPECT_EQ(All(), (Strings{"/b", "/a"}));
  for (const char* entry : {"/b", "/a"}) ASSERT_EQ(Remove({entry}), 1);
  EXPECT_EQ(ReadFile(queue_), "") << "a drained queue is cut to nothing";
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino);
}

// The side file is a hint that anyone may damage, and a queue may be cut
// and refilled in place: whatever it says, no entry is skipped. A head far
// into the queue is remembered, and the next call starts there.
TEST_F(SpoolConsumerTest, SideFileNeverMakesEntriesSkipped) {
  const std::string blank(70000, '\n');
  WriteFile(queue_, blank + "/a\n/b\n");
  ASSERT_EQ(All(), (Strings{"/a", "/b"}));
  quvaidx::QueueState remembered;
  ASSERT_TRUE(quvaidx::LoadQueueState(q_, &remembered));
  EXPECT_EQ(remembered.head, static_cast<int64_t>(blank.size()));
  {  // and used: a line written into the blank head (no writer does) is
     // not read again
    std::fstream(queue_, std::ios::in | std::ios::out).seekp(100) << "/z";
  }
  EXPECT_EQ(All(), (Strings{"/a", "/b"}));
  const std::string real = PhotoQueue(40);  // 2,600 bytes of entries
  auto record = [&](int64_t head) {
    quvaidx::QueueState state = remembered;
    state.head = head;
    return quvaidx::FormatQueueState(state);
  };
  std::string torn = record(1500);
  torn[40] ^= 1;
  const std::string sides[] = {
      "head=99999\n", torn, record(1 << 30),
      record(1500),  // within the entries of a queue cut and refilled
      record(2800),  // after blank lines below entries
  };
  for (const auto& side : sides) {
    SCOPED_TRACE(side);
    // The same file (inode and birth time) as the record: cut, then filled.
    ASSERT_EQ(truncate(q_, 0), 0);
    std::ofstream(queue_, std::ios::app) << real << std::string(300, '\n');
    WriteFile(quvaidx::QueueStatePath(q_), side);
    EXPECT_EQ(Live(ReadFile(queue_)).size(), real.size());
    const Strings all = All();
    ASSERT_EQ(all.size(), 40u);
    EXPECT_EQ(all.front(), "/share/Photos/album-000000/2015-summer-000000");
    EXPECT_EQ(Remove({all.front()}), 1);
  }
}

// A disk that fails a read, an append, a blanking or the bookkeeping makes
// the call fail, and the queue keeps every entry it had.
TEST_F(SpoolConsumerTest, DiskFailuresFailTheCallAndLoseNoEntry) {
  const std::tuple<long, int, std::function<int()>> cases[] = {
      {SYS_pread64, EIO,
       [&] {
         Json::Value entries;
         return ReadQueueHead(q_, 4, entries);
       }},
      {SYS_write, ENOSPC, [&] { return Remove({"/a"}, {"/c"}); }},
      {SYS_pwrite64, EIO, [&] { return Remove({"/a"}); }},
      {SYS_pwrite64, EIO, [&] { return TrimQueueHead(q_, 1); }},
      {SYS_pwrite64, ENOSPC, [&] { return CountQueueAttempt(q_, "/a"); }},
  };
  for (const auto& [call, error, operation] : cases) {
    SCOPED_TRACE(call);
    WriteFile(queue_, "/a\n/b\n");
    EXPECT_EQ(quvaidx::test::RunWithSyscallsFailing(
                  {{call, error}}, [&] { return operation() == -1 ? 0 : 1; }),
              0);
    EXPECT_EQ(ReadFile(queue_), "/a\n/b\n");
  }
  // Bookkeeping that cannot be opened for writing (a folder in its place).
  const std::string side = quvaidx::QueueStatePath(q_);
  unlink(side.c_str());
  ASSERT_EQ(mkdir(side.c_str(), 0700), 0);
  EXPECT_EQ(CountQueueAttempt(q_, "/a"), -1);
}

// A mostly blank queue is compacted into a new file: the entries left, in
// order, its owner and group, its read and write bits only, no copy left.
TEST_F(SpoolConsumerTest, CompactionKeepsEntriesOwnerAndModeLeavesNoCopy) {
  WriteFile(queue_, PhotoQueue(36000));  // 1.66 MB
  ASSERT_EQ(chown(q_, 65534, 65534), 0);
  ASSERT_EQ(chmod(q_, 0775), 0);
  const struct stat before = StatOf(queue_);
  ASSERT_EQ(TrimQueueHead(q_, 12000), 0);  // a third: kept
  EXPECT_EQ(StatOf(queue_).st_ino, before.st_ino);
  EXPECT_TRUE(SameText(Live(ReadFile(queue_)), PhotoQueue(24000, 12000)));
  Json::Value head;
  ASSERT_EQ(ReadQueueHead(q_, 12000, head), 12000);
  ASSERT_EQ(RemoveDoneQueueEntries(q_, head, ToJson({"/back"})),
            12000);  // now two thirds, over 1 MiB, blank: compacted
  const struct stat after = StatOf(queue_);
  EXPECT_NE(after.st_ino, before.st_ino);
  EXPECT_TRUE(SameText(ReadFile(queue_), PhotoQueue(12000, 24000) + "/back\n"));
  EXPECT_EQ(after.st_uid, 65534u);
  EXPECT_EQ(after.st_gid, 65534u);
  EXPECT_EQ(after.st_mode & 07777, 0664u);
  EXPECT_EQ(Copies(dir_.path()), 0);
  EXPECT_EQ(All().front(), "/share/Photos/album-024000/2015-summer-024000");
  // A copy that cannot be written (a full disk) never takes the queue's
  // place: every live entry stays.
  WriteFile(queue_, PhotoQueue(36000));
  quvaidx::test::RunWithSyscallsFailing(
      {{SYS_write, ENOSPC}}, [&] { return TrimQueueHead(q_, 24000); });
  EXPECT_TRUE(SameText(Live(ReadFile(queue_)), PhotoQueue(12000, 24000)));
  EXPECT_EQ(Copies(dir_.path()), 0);
}

// A consumer killed at any moment of blanking and compacting loses and
// corrupts no unfinished entry; it leaves at most a copy in the instant
// before its rename, which RemoveStaleQueueCopies removes.
TEST_F(SpoolConsumerTest, KilledConsumerLosesNothingAndCopiesAreRemoved) {
  const std::string original = PhotoQueue(36000);  // 1.66 MB
  std::mt19937 random(12345);
  int runs_with_copy = 0;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::seconds(15);
  for (int run = 0; run < 24 && std::chrono::steady_clock::now() < deadline;
       ++run) {
    SCOPED_TRACE(run);
    WriteFile(queue_, original);
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) _exit(TrimQueueHead(q_, 24000) == 0 ? 0 : 1);
    usleep(std::uniform_int_distribution<useconds_t>(0, 12000)(random));
    kill(child, SIGKILL);
    ASSERT_EQ(waitpid(child, nullptr, 0), child);
    runs_with_copy += Copies(dir_.path()) > 0;
    ASSERT_GE(RemoveStaleQueueCopies(q_), 0);
    EXPECT_EQ(Copies(dir_.path()), 0);
    // Half-blanked entries read as ""; the rest is a whole tail of at
    // least the untrimmed entries.
    Strings left = All();
    left.erase(std::remove(left.begin(), left.end(), ""), left.end());
    ASSERT_GE(left.size(), 12000u);
    std::string text;
    for (const std::string& entry : left) text += entry + "\n";
    EXPECT_TRUE(SameText(text, original.substr(original.size() - text.size())));
  }
  EXPECT_LE(runs_with_copy, 3) << "copies are left for longer than a rename";
}

// Only the names a rewrite gives its copies go, and only regular files.
TEST_F(SpoolConsumerTest, StaleCopiesAreRemovedByTheirExactNameOnly) {
  LogCapture log;
  WriteFile(queue_, "/a\n");
  WriteFile(dir_.File("thumb.queue.abc123"), "/old\n");
  WriteFile(dir_.File("thumb.queue.Z9z9Z9"), "/old\n");
  const char* kept[] = {"thumb.queue.abc12",  "thumb.queue.abc1234",
                        "thumb.queue.ab-123", "thumb.queue.consumer",
                        "other.queue.abc123", "thumb.queueXabc123"};
  for (const char* name : kept) WriteFile(dir_.File(name), "keep");
  ASSERT_EQ(mkdir(dir_.File("thumb.queue.dir123").c_str(), 0755), 0);
  ASSERT_EQ(symlink(q_, dir_.File("thumb.queue.lnk123").c_str()), 0);
  EXPECT_EQ(RemoveStaleQueueCopies(q_), 2);
  EXPECT_EQ(log.lines().size(), 2u);
  for (const auto& line : log.lines()) EXPECT_EQ(line.priority, LOG_WARNING);
  for (const char* name : kept) EXPECT_EQ(ReadFile(dir_.File(name)), "keep");
  EXPECT_EQ(Copies(dir_.path()), 2);  // dir123, lnk123
  EXPECT_EQ(ReadFile(queue_), "/a\n");
}

// An entry that kills its consumer is seen again with a higher number
// after each restart; the count starts again for another entry, and once
// the counted entry is removed or the side file damaged.
TEST_F(SpoolConsumerTest, AttemptsSurviveTheConsumerAndResetWithTheHead) {
  WriteFile(queue_, "/poison\n/next\n");
  EXPECT_EQ(CountQueueAttempt(q_, "/poison"), 1);
  for (int attempt : {2, 3}) {  // dies in the entry's work, no clean-up
    EXPECT_EQ(quvaidx::test::RunInChildProcess(
                  [&] { return CountQueueAttempt(q_, "/poison"); }),
              attempt);
  }
  EXPECT_EQ(CountQueueAttempt(q_, "/poison"), 4);
  ASSERT_EQ(Remove({"/poison"}), 1);
  EXPECT_EQ(CountQueueAttempt(q_, "/next"), 1);
  EXPECT_EQ(CountQueueAttempt(q_, "/next"), 2);
  ASSERT_EQ(WriteIndexQueue("/poison", q_), 0);
  ASSERT_EQ(Remove({"/next"}), 1);
  EXPECT_EQ(CountQueueAttempt(q_, "/poison"), 1) << "removed entry counted on";
  WriteFile(quvaidx::QueueStatePath(q_), "damaged");
  EXPECT_EQ(CountQueueAttempt(q_, "/poison"), 1);
  EXPECT_EQ(CountQueueAttempt(q_, "/poison"), 2);
}

}  // namespace
