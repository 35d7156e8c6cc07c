// The thumbnail daemon as a real process in a private directory:
// quvamkthumbd on its own queue and pid file (woken by SIGUSR1, bad photos
// skipped, stopped or killed in the middle of an entry and started again).
// The plug-in daemon's process tests are in plugind_daemon_test.cc.
#include <fcntl.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "daemon_process.h"
#include "photo_fixtures.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"

namespace {

using quvaidx::daemon_test::DaemonProcess;
using quvaidx::daemon_test::kBlue;
using quvaidx::daemon_test::kRed;
using quvaidx::daemon_test::NamesUnder;
using quvaidx::daemon_test::ThumbItem;
using quvaidx::daemon_test::WaitUntil;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

bool Exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

class ThumbDaemonTest : public ::testing::Test {
 protected:
  ThumbDaemonTest() { mkdir(share_.c_str(), 0755); }

  // Starts the daemon in the foreground on the private queue and pid file,
  // pausing `throttle_ms` after each photo, and waits until its loop runs.
  bool Start(DaemonProcess& daemon, const std::string& throttle_ms = "0") {
    return daemon.Start(
        MKTHUMBD_PATH,
        {"--foreground", "--stderr", "--loglevel", "6", "--queue", queue_,
         "--pidfile", pid_file_, "--throttle", throttle_ms},
        dir_.path(), "mkthumbd", "running");
  }
  std::string Photo(const std::string& name) {
    std::string path = share_ + "/" + name;
    EXPECT_TRUE(quvaidx::daemon_test::WritePhoto(path, 900, 600, kRed, kBlue));
    return path;
  }
  bool AllThumbs(const std::string& name) {
    for (const char* label : {"XL", "B", "M", "S"}) {
      if (!Exists(ThumbItem(share_ + "/" + name, label))) return false;
    }
    return true;
  }
  bool Served() {
    return WaitUntil(20, [&] { return ReadFile(queue_).empty(); });
  }
  bool TemporaryFilesLeft() {
    for (const std::string& name : NamesUnder(share_)) {
      if (name.find(".part-") != std::string::npos) return true;
    }
    return false;
  }

  TempDir dir_;
  std::string share_ = dir_.File("share");
  std::string queue_ = dir_.File("thumb_create.queue");
  std::string pid_file_ = dir_.File("quvamkthumbd.pid");
};

// Asleep until SIGUSR1; then the whole queue: a truncated JPEG, a zero-byte
// .jpg, a bomb, a photo deleted after its folder was listed (the pause after
// each photo holds the daemon while it goes) and a folder deleted while
// queued are logged and skipped, the good photo made, and the daemon runs
// on; SIGTERM ends it with its pid file gone.
TEST_F(ThumbDaemonTest, WakesOnSigusr1AndSkipsBadPhotosWithoutStopping) {
  std::string whole = ReadFile(Photo("a.jpg"));
  WriteFile(share_ + "/cut.jpg", whole.substr(0, whole.size() / 3));
  WriteFile(share_ + "/empty.jpg", "");
  ASSERT_TRUE(
      quvaidx::daemon_test::WritePngBomb(share_ + "/bomb.png", 30000, 30000));
  const std::string doomed = Photo("z.jpg");
  DaemonProcess daemon;
  ASSERT_TRUE(Start(daemon, "500")) << daemon.Errors();
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  ASSERT_EQ(WriteIndexQueue(dir_.File("deleted-while-queued").c_str(),
                            queue_.c_str()),
            0);
  usleep(200 * 1000);
  EXPECT_FALSE(Exists(share_ + "/.quvameta"));  // not polling: asleep
  ASSERT_TRUE(daemon.Signal(SIGUSR1));
  ASSERT_TRUE(WaitUntil(20, [&] { return AllThumbs("a.jpg"); }));
  ASSERT_EQ(unlink(doomed.c_str()), 0);
  ASSERT_TRUE(Served()) << daemon.Errors();
  const std::string log = daemon.Errors();
  for (const std::string& skipped : std::vector<std::string>{
           "empty.jpg: cannot read it", "cut.jpg: cannot read it",
           "bomb.png: 30000 x 30000 pixels", "deleted-while-queued",
           "skipped " + doomed + ": it is gone"}) {
    EXPECT_NE(log.find(skipped), std::string::npos) << skipped << "\n" << log;
  }
  ASSERT_TRUE(daemon.Signal(SIGTERM));
  EXPECT_TRUE(daemon.WaitExit(10));
  EXPECT_FALSE(Exists(pid_file_));
}

// Stopped with SIGTERM, then killed with SIGKILL, each while an entry's
// first photo has just been made (the pause after each photo holds the
// daemon there): the SIGTERM ends it at once and cleanly; after either the
// entry is still queued. Started again, the daemon completes it without
// being woken, over the killed one's pid file, and leaves no temporary
// file, not even one that a kill while writing left beside thumbnails that
// are up to date.
TEST_F(ThumbDaemonTest, StoppedOrKilledMidEntryCompletesItWhenRestarted) {
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) Photo(name);
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  for (int signal : {SIGTERM, SIGKILL}) {
    SCOPED_TRACE(strsignal(signal));
    if (signal == SIGKILL) {  // 1.jpg's XL made again, held after it
      struct timespec old[2] = {{1000, 0}, {1000, 0}};
      utimensat(AT_FDCWD, ThumbItem(share_ + "/1.jpg", "XL").c_str(), old, 0);
    }
    DaemonProcess daemon;
    ASSERT_TRUE(Start(daemon, "60000")) << daemon.Errors();
    ASSERT_TRUE(WaitUntil(20, [&] {
      return daemon.Errors().find("made thumbnails") != std::string::npos;
    }));
    ASSERT_TRUE(daemon.Signal(signal));
    EXPECT_TRUE(daemon.WaitExit(5, signal == SIGTERM));
    EXPECT_EQ(ReadFile(queue_), share_ + "\n");
    EXPECT_TRUE(AllThumbs("1.jpg"));
    EXPECT_FALSE(AllThumbs("2.jpg"));
    EXPECT_FALSE(TemporaryFilesLeft());
  }
  WriteFile(ThumbItem(share_ + "/1.jpg", "B") + ".part-k1lled", "half a JPEG");
  DaemonProcess again;
  ASSERT_TRUE(Start(again)) << again.Errors();
  ASSERT_TRUE(Served()) << again.Errors();
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) {
    EXPECT_TRUE(AllThumbs(name)) << name;
  }
  EXPECT_FALSE(TemporaryFilesLeft());
}

// WriteThumbQueue signals the daemon as soon as its pid file names a live
// process, which is before the daemon watches SIGUSR1: a wake-up then must
// not end it (SIGUSR1's default action).
TEST_F(ThumbDaemonTest, EarlyWakeUpDoesNotEndTheStartingDaemon) {
  DaemonProcess daemon;
  ASSERT_TRUE(
      daemon.Start(MKTHUMBD_PATH,
                   {"--foreground", "--queue", queue_, "--pidfile", pid_file_},
                   dir_.path(), "mkthumbd", ""));
  ASSERT_TRUE(WaitUntil(
      10, [&] { return !ReadFile(pid_file_).empty() || !daemon.Running(); }));
  // Wake-ups from the moment the pid file is written until the loop runs.
  WaitUntil(10, [&] {
    daemon.Signal(SIGUSR1);
    return daemon.Output().find("running") != std::string::npos ||
           !daemon.Running();
  });
  EXPECT_TRUE(daemon.Running()) << daemon.Errors();
}

}  // namespace
