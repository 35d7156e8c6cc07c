// What may be planted at a queue's path: a link, which the writer and the
// trimmer refuse, leaving the file it points to as it was; a FIFO or a
// folder, which the trimmer refuses at once.
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::LogCapture;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

TEST(QueueSymlinkTest, LinkAtTheQueuePathIsNotFollowed) {
  TempDir dir;
  const std::string target = dir.File("target");
  const std::string queue = dir.File("q.queue");
  WriteFile(target, "first\nsecond\n");
  ASSERT_EQ(symlink(target.c_str(), queue.c_str()), 0);
  LogCapture log;
  EXPECT_EQ(WriteIndexQueue("/share/a", queue.c_str()), -1);
  EXPECT_EQ(FileRemoveHeadingLine(queue.c_str(), 1), -1);
  EXPECT_EQ(ReadFile(target), "first\nsecond\n");
  struct stat st;
  ASSERT_EQ(lstat(queue.c_str(), &st), 0);
  EXPECT_TRUE(S_ISLNK(st.st_mode));
  std::vector<std::string> lines = log.Normalized();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_NE(lines[0].find("open(" + queue), std::string::npos) << lines[0];
  EXPECT_NE(lines[0].find("reason=Too many levels of symbolic links"),
            std::string::npos)
      << lines[0];
  EXPECT_EQ(lines[1], "quvaidx_system:N [Error] " + queue +
                          " is a symbolic link; not trimmed");
}

// A FIFO or a folder at the queue path is no queue: trimming it fails at
// once instead of waiting for a writer that never comes.
TEST(QueueSymlinkTest, TrimRefusesWhatIsNoRegularFile) {
  TempDir dir;
  const std::string fifo = dir.File("fifo.queue");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  ASSERT_EQ(mkdir(dir.File("dir.queue").c_str(), 0700), 0);
  alarm(5);  // a trim that waits on the FIFO ends the test
  EXPECT_EQ(FileRemoveHeadingLine(fifo.c_str(), 1), -1);
  EXPECT_EQ(FileRemoveHeadingLine(dir.File("dir.queue").c_str(), 1), -1);
  alarm(0);
}

}  // namespace
