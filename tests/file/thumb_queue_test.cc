// The preview queues; this process plays the daemon that is woken.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <utility>

#include <gtest/gtest.h>

#include "file/spool_paths.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvaidx::test::ReadFile;
using quvaidx::test::WriteFile;

volatile sig_atomic_t g_wakeups = 0;

// Both pid files name this process, whose SIGUSR1 is counted: a signal a
// process sends itself arrives before kill returns.
class ThumbQueueTest : public ::testing::Test {
 protected:
  void SetUp() override {
    previous_ =
        quvaidx::SetSpoolPaths({thumb_queue_.c_str(), flv_queue_.c_str(),
                                thumb_pid_.c_str(), flv_pid_.c_str()});
    ASSERT_EQ(mkdir(media_.c_str(), 0755), 0);
    for (const char* name : {"x.jpg", "x.txt", "x.mp4", "x.mkv"}) {
      WriteFile(media_ + "/" + name, "data");
    }
    WriteFile(thumb_pid_, std::to_string(getpid()));
    WriteFile(flv_pid_, std::to_string(getpid()));
    signal(SIGUSR1, [](int) { ++g_wakeups; });
  }
  void TearDown() override {
    signal(SIGUSR1, SIG_DFL);
    quvaidx::SetSpoolPaths(previous_);
  }
  // Wake-ups since the last call.
  int Signals() {
    int count = g_wakeups;
    g_wakeups = 0;
    return count;
  }

  quvaidx::test::TempDir dir_;
  std::string media_ = dir_.File("album.2015");
  std::string thumb_queue_ = dir_.File("thumb_create.queue");
  std::string flv_queue_ = dir_.File("flv_create.queue");
  std::string thumb_pid_ = dir_.File("quvamkthumbd.pid");
  std::string flv_pid_ = dir_.File("quvamkflvd.pid");
  quvaidx::SpoolPaths previous_;
};

// A photo queues its folder (once), a web video itself; a file of no interest
// still wakes the daemon. Other types do nothing; non-files fail.
TEST_F(ThumbQueueTest, QueuesAndWakesTheDaemon) {
  const std::pair<std::string, int> calls[] = {
      {media_ + "/x.jpg", THUMB_TYPE_PHOTO},
      {media_, THUMB_TYPE_PHOTO},
      {media_ + "/x.txt", THUMB_TYPE_PHOTO},
      {media_ + "/x.mkv", THUMB_TYPE_VIDEO},
      {media_ + "/x.mp4", THUMB_TYPE_VIDEO},
      {media_, THUMB_TYPE_VIDEO}};
  for (const auto& [path, type] : calls) {
    EXPECT_EQ(
        WriteThumbQueue(path.c_str(), static_cast<_tag_THUMB_TYPE_>(type)), 0)
        << path;
    EXPECT_EQ(Signals(), 1) << path;
  }
  EXPECT_EQ(ReadFile(thumb_queue_), media_ + "\n");
  EXPECT_EQ(ReadFile(flv_queue_), media_ + "/x.mp4\n" + media_ + "\n");
  for (int type : {0, 3}) {
    auto t = static_cast<_tag_THUMB_TYPE_>(type);
    EXPECT_EQ(WriteThumbQueue((media_ + "/x.jpg").c_str(), t), 0);
    EXPECT_EQ(WriteThumbQueue(dir_.File("missing.jpg").c_str(), t), -1);
  }
  EXPECT_EQ(WriteThumbQueue(nullptr, THUMB_TYPE_PHOTO), -1);
  EXPECT_EQ(WriteThumbQueue("/dev/null", THUMB_TYPE_PHOTO), -1);
  EXPECT_EQ(Signals(), 0);
  EXPECT_EQ(ReadFile(thumb_queue_), media_ + "\n");
}

// A missing or dead daemon is never signalled and nothing is queued; a
// queue that cannot be written fails without waking the daemon.
TEST_F(ThumbQueueTest, MissingOrDeadDaemonOrUnwritableQueue) {
  quvaidx::test::LogCapture log;
  unlink(thumb_pid_.c_str());
  EXPECT_EQ(WriteThumbQueue(media_.c_str(), THUMB_TYPE_PHOTO), -1);
  pid_t dead = fork();
  if (dead == 0) _exit(0);
  waitpid(dead, nullptr, 0);
  WriteFile(flv_pid_, std::to_string(dead));
  EXPECT_EQ(WriteThumbQueue(media_.c_str(), THUMB_TYPE_VIDEO), -1);
  WriteFile(thumb_pid_, std::to_string(getpid()));
  ASSERT_EQ(mkdir(thumb_queue_.c_str(), 0755), 0);
  EXPECT_EQ(WriteThumbQueue(media_.c_str(), THUMB_TYPE_PHOTO), -1);
  EXPECT_EQ(Signals(), 0);
  EXPECT_EQ(log.Count("quvaidx_system:N [Error] quvamkthumbd is dead"), 1);
  EXPECT_EQ(log.Count("quvaidx_system:N [Error] quvamkflvd is dead"), 1);
  EXPECT_EQ(log.Count("quvaidx_system:N [Error] fail to write thumb queue"), 1);
  EXPECT_EQ(ReadFile(flv_queue_), "");
}

}  // namespace
