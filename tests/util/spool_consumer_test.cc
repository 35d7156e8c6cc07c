// The consumer side of spool queues: what the head reads as, what removal
// may and may not take, a replaced queue, and writers racing a consumer.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

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

class SpoolConsumerTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string queue_ = dir_.File("thumb.queue");
};

// Lines no writer of the library produces must come back as "" (so the
// consumer skips them and can still remove them), never cut, glued or
// split; a last line without its line feed still counts.
TEST_F(SpoolConsumerTest, HeadReadsWholeLinesAndBlanksForeignOnes) {
  const std::string longest(kMaxQueueEntry, 'x');
  struct Case {
    std::string content;
    int max;
    std::vector<std::string> expected;
  } cases[] = {
      {"/a\n/b\n/c\n", 2, {"/a", "/b"}},
      {"/a\n/b\n", 8, {"/a", "/b"}},
      {"/a\n/unfinished", 8, {"/a", "/unfinished"}},
      {"\n/a\n", 8, {"", "/a"}},
      {longest + "\n" + longest + "y\n/after\n", 8, {longest, "", "/after"}},
      {std::string("/nul\0here\n/b\n", 12), 8, {"", "/b"}},
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
  EXPECT_TRUE(fds.NoLeak());
}

// Removal takes only the head lines the caller names, in order: an entry
// trimmed by someone else, an entry re-queued meanwhile or a line the
// consumer never read must survive.
TEST_F(SpoolConsumerTest, RemovesOnlyTheNamedHeadLines) {
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
      {"foreign lines are removed as read", "\n" + overlong + "\n/a\n",
       Strings({"", ""}), Strings({}), 2, "/a\n"},
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
    EXPECT_EQ(ReadFile(queue_), c.after) << c.fault;
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

}  // namespace
