// The spool-queue writer: duplicates, refused entries, open retries, a full
// disk, a queue trimmed while the writer waits for its lock, a planted link.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <regex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

namespace quvaidx::test {
namespace {

class IndexQueueTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string queue_ = dir_.File("test.queue");
};

// Duplicates leave one line, corrupting entries are refused with a line each;
// a new queue is 0666 less the umask, never executable.
TEST_F(IndexQueueTest, DuplicatesAndCorruptingEntries) {
  LogCapture log;
  const std::string longest(kMaxQueueEntry, 'x');
  const mode_t old_umask = umask(0);
  for (const char* entry : {"/share/a", "/share/ab", "/share/a", "/share"}) {
    EXPECT_EQ(WriteIndexQueue(entry, queue_.c_str()), 0);
  }
  umask(old_umask);
  struct stat st;
  ASSERT_EQ(stat(queue_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0666u);
  EXPECT_EQ(WriteIndexQueue("two\nlines", queue_.c_str()), -1);
  EXPECT_EQ(WriteIndexQueue("trailing\n", queue_.c_str()), -1);
  EXPECT_EQ(WriteIndexQueue((longest + "y").c_str(), queue_.c_str()), -1);
  EXPECT_EQ(WriteIndexQueue(nullptr, queue_.c_str()), -1);
  EXPECT_EQ(log.lines().size(), 3u);
  EXPECT_EQ(WriteIndexQueue(longest.c_str(), queue_.c_str()), 0);
  EXPECT_EQ(ReadFile(queue_), "/share/a\n/share/ab\n/share\n" + longest + "\n");
}

// A missing folder fails after one try; permission denied is tried 17 times.
TEST_F(IndexQueueTest, OpenFailuresAndRetries) {
  LogCapture log;
  FakeSleep sleep;
  std::string queue = dir_.File("missing/q.queue");
  EXPECT_EQ(WriteIndexQueue("/a", queue.c_str()), -1);
  EXPECT_EQ(sleep.calls(), 0);
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_EQ(std::regex_replace(log.lines()[0].text,
                               std::regex("^\\(quvaidx_system, [0-9]+\\)"), ""),
            " open(" + queue + ", " +
                std::to_string(O_RDWR | O_CREAT | O_APPEND | O_SYNC) +
                ") failed, reason=No such file or directory\n");
  WriteFile(queue_, "");
  chmod(queue_.c_str(), 0600);
  chmod(dir_.path().c_str(), 0755);
  int code = RunUnprivileged([&] {
    LogCapture log;
    FakeSleep sleep;
    int result = WriteIndexQueue("/a", queue_.c_str());
    int opens = 0;
    for (const auto& line : log.lines()) {
      opens += line.text.find("reason=Permission denied") != std::string::npos;
    }
    return (result == -1 ? 0 : 1) | (opens == 17 ? 0 : 2) |
           (sleep.calls() == 16 ? 0 : 4);
  });
  EXPECT_EQ(code, 0);
  EXPECT_EQ(ReadFile(queue_), "");
}

// A full disk leaves no torn line to glue itself to the next entry: a short
// write is taken back, a failed one adds nothing.
TEST_F(IndexQueueTest, FullDiskLeavesNoTornLine) {
  const std::string kept = "/share/a\n";
  // The size the queue may grow to, the reason logged.
  const std::pair<long, const char*> kCases[] = {
      {static_cast<long>(kept.size()) + 3, "No space left on device"},
      {static_cast<long>(kept.size()), "File too large"}};
  for (const auto& [limit, reason] : kCases) {
    WriteFile(queue_, kept);
    const std::string logged_reason = std::string("reason=") + reason;
    auto append_fails = [&] {
      LogCapture log;
      bool failed = WriteIndexQueue("/share/bb", queue_.c_str()) == -1;
      bool logged =
          log.lines().size() == 1 &&
          log.lines()[0].text.find(logged_reason) != std::string::npos;
      return (failed ? 0 : 1) | (logged ? 0 : 2);
    };
    EXPECT_EQ(RunWithFileSizeLimit(limit, append_fails), 0) << reason;
    EXPECT_EQ(ReadFile(queue_), kept) << reason;
  }
  EXPECT_EQ(WriteIndexQueue("/share/bb", queue_.c_str()), 0);
  EXPECT_EQ(ReadFile(queue_), kept + "/share/bb\n");
}

TEST_F(IndexQueueTest, WriterWaitingForTheLockFollowsATrimmedQueue) {
  WriteFile(queue_, "done\nkept\n");
  int consumer = open(queue_.c_str(), O_RDWR);
  ASSERT_EQ(flock(consumer, LOCK_EX), 0);
  std::thread writer([&] { WriteIndexQueue("new", queue_.c_str()); });
  usleep(50 * 1000);  // the writer now waits for the lock on the old file
  ASSERT_EQ(FileRemoveHeadingLine(queue_.c_str(), 1), 0);
  flock(consumer, LOCK_UN);
  close(consumer);
  writer.join();
  EXPECT_EQ(ReadFile(queue_), "kept\nnew\n");
}

// A link planted at the queue path is refused by the writer and the
// trimmer, and the file it points to stays as it was.
TEST_F(IndexQueueTest, LinkAtTheQueuePathIsNotFollowed) {
  const std::string target = dir_.File("target");
  WriteFile(target, "first\nsecond\n");
  ASSERT_EQ(symlink(target.c_str(), queue_.c_str()), 0);
  LogCapture log;
  EXPECT_EQ(WriteIndexQueue("/share/a", queue_.c_str()), -1);
  EXPECT_EQ(FileRemoveHeadingLine(queue_.c_str(), 1), -1);
  EXPECT_EQ(ReadFile(target), "first\nsecond\n");
  struct stat st;
  ASSERT_EQ(lstat(queue_.c_str(), &st), 0);
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  std::vector<std::string> lines = log.Normalized();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_NE(lines[0].find("open(" + queue_), std::string::npos) << lines[0];
  EXPECT_NE(lines[0].find("reason=Too many levels of symbolic links"),
            std::string::npos)
      << lines[0];
  EXPECT_EQ(lines[1], "quvaidx_system:N [Error] " + queue_ +
                          " is a symbolic link; not trimmed");
}

}  // namespace
}  // namespace quvaidx::test
