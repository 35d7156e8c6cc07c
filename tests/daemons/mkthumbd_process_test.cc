// quvamkthumbd as a real process on a private queue and pid file: it wakes
// on SIGUSR1, survives bad photos, ends cleanly on SIGTERM, and after a
// SIGKILL in the middle of an entry completes it when started again.
#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
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
using quvaidx::daemon_test::WaitUntil;
using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

constexpr quvaidx::daemon_test::Rgb kRed = {230, 20, 20};
constexpr quvaidx::daemon_test::Rgb kBlue = {20, 20, 230};
constexpr const char* kLabels[] = {"XL", "B", "M", "S"};

bool Exists(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0;
}

// The names under `dir` (recursively) that contain `text`.
std::vector<std::string> FindNames(const std::string& dir,
                                   const std::string& text) {
  std::vector<std::string> found;
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return found;
  while (struct dirent* entry = readdir(d)) {
    std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    std::string path = dir + "/" + name;
    if (name.find(text) != std::string::npos) found.push_back(path);
    if (entry->d_type == DT_DIR) {
      for (const std::string& inner : FindNames(path, text)) {
        found.push_back(inner);
      }
    }
  }
  closedir(d);
  return found;
}

class ThumbDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(quvaidx::daemon_test::StartVips());
    share_ = dir_.File("share");
    mkdir(share_.c_str(), 0755);
  }

  // Starts the daemon in the foreground on the private queue and pid file
  // and waits until its loop runs.
  void StartDaemon(DaemonProcess& daemon, std::vector<std::string> extra = {}) {
    std::vector<std::string> args = {
        "--foreground", "--stderr", "--loglevel", "6",
        "--queue",      queue_,     "--pidfile",  pid_file_};
    args.insert(args.end(), extra.begin(), extra.end());
    ASSERT_TRUE(daemon.Start(MKTHUMBD_PATH, args, dir_.path(), "mkthumbd"));
    ASSERT_TRUE(WaitUntil(10, [&] {
      return daemon.Output().find("running") != std::string::npos ||
             !daemon.Running();
    }));
    ASSERT_TRUE(daemon.Running()) << daemon.Errors();
  }

  std::string Photo(const std::string& name) {
    std::string path = share_ + "/" + name;
    EXPECT_TRUE(
        quvaidx::daemon_test::WriteSplitJpeg(path, 900, 600, kRed, kBlue));
    return path;
  }

  bool AllThumbs(const std::string& name) {
    for (const char* label : kLabels) {
      if (!Exists(share_ + "/.quvameta/" + name + "/QUVAPHOTO_THUMB_" + label +
                  ".jpg")) {
        return false;
      }
    }
    return true;
  }

  TempDir dir_;
  std::string share_;
  std::string queue_ = dir_.File("thumb_create.queue");
  std::string pid_file_ = dir_.File("quvamkthumbd.pid");
};

// Asleep until SIGUSR1; then the whole queue, bad photos logged and
// skipped, the good ones made, the daemon still running; SIGTERM ends it
// with its pid file gone.
TEST_F(ThumbDaemonTest, WakesOnSigusr1AndSkipsBadPhotosWithoutStopping) {
  Photo("a.jpg");
  Photo("z.jpg");
  WriteFile(share_ + "/empty.jpg", "");
  std::string whole = ReadFile(share_ + "/a.jpg");
  WriteFile(share_ + "/cut.jpg", whole.substr(0, whole.size() / 3));
  ASSERT_TRUE(
      quvaidx::daemon_test::WritePngBomb(share_ + "/bomb.png", 30000, 30000));
  DaemonProcess daemon;
  StartDaemon(daemon);
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  ASSERT_EQ(WriteIndexQueue(dir_.File("deleted-while-queued").c_str(),
                            queue_.c_str()),
            0);
  usleep(200 * 1000);
  EXPECT_FALSE(Exists(share_ + "/.quvameta"));  // not polling: asleep
  ASSERT_TRUE(daemon.Signal(SIGUSR1));
  ASSERT_TRUE(WaitUntil(20, [&] { return ReadFile(queue_).empty(); }))
      << daemon.Errors();
  EXPECT_TRUE(AllThumbs("a.jpg"));
  EXPECT_TRUE(AllThumbs("z.jpg"));
  const std::string log = daemon.Errors();
  for (const char* skipped :
       {"empty.jpg: cannot read it", "cut.jpg: cannot read it",
        "bomb.png: 30000 x 30000 pixels", "deleted-while-queued"}) {
    EXPECT_NE(log.find(skipped), std::string::npos) << skipped << "\n" << log;
  }
  EXPECT_TRUE(daemon.Running());
  ASSERT_TRUE(daemon.Signal(SIGTERM));
  int status = -1;
  ASSERT_TRUE(daemon.WaitExit(10, &status));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_FALSE(Exists(pid_file_));
}

// Killed with SIGKILL between two photos of an entry (the pause after each
// photo holds it there): the entry is still queued; started again, the
// daemon completes it without being woken and leaves no temporary file,
// including one a kill during a write would have left.
TEST_F(ThumbDaemonTest, KilledMidEntryCompletesItWhenRestarted) {
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) Photo(name);
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  {
    DaemonProcess daemon;
    StartDaemon(daemon, {"--throttle", "60000"});
    ASSERT_TRUE(WaitUntil(20, [&] { return AllThumbs("1.jpg"); }))
        << daemon.Errors();
    ASSERT_TRUE(daemon.Signal(SIGKILL));
    int status = 0;
    ASSERT_TRUE(daemon.WaitExit(10, &status));
  }
  EXPECT_EQ(ReadFile(queue_), share_ + "\n");
  EXPECT_FALSE(AllThumbs("2.jpg"));
  WriteFile(share_ + "/.quvameta/1.jpg/QUVAPHOTO_THUMB_B.jpg.part-k1lled",
            "half a JPEG");
  DaemonProcess again;
  StartDaemon(again);  // a stale pid file (the killed daemon's) is no bar
  ASSERT_TRUE(WaitUntil(20, [&] { return ReadFile(queue_).empty(); }))
      << again.Errors();
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) {
    EXPECT_TRUE(AllThumbs(name)) << name;
  }
  EXPECT_EQ(FindNames(share_, ".part-"), std::vector<std::string>{});
}

// SIGTERM while an entry is being worked on: the daemon ends promptly after
// the photo at hand, with the entry still queued and no temporary file.
TEST_F(ThumbDaemonTest, SigtermMidEntryEndsCleanlyAndKeepsTheEntry) {
  for (const char* name : {"1.jpg", "2.jpg"}) Photo(name);
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  DaemonProcess daemon;
  StartDaemon(daemon, {"--throttle", "60000"});
  ASSERT_TRUE(WaitUntil(20, [&] { return AllThumbs("1.jpg"); }));
  ASSERT_TRUE(daemon.Signal(SIGTERM));
  int status = -1;
  ASSERT_TRUE(daemon.WaitExit(5, &status));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(ReadFile(queue_), share_ + "\n");
  EXPECT_EQ(FindNames(share_, ".part-"), std::vector<std::string>{});
}

// A photo deleted after its folder was queued and listed: logged and
// skipped, and the entry still completes (the pause after each photo holds
// the daemon between the two photos while the second one goes).
TEST_F(ThumbDaemonTest, PhotoDeletedWhileQueuedIsSkippedAndTheEntryCompletes) {
  Photo("1.jpg");
  const std::string doomed = Photo("2.jpg");
  Photo("3.jpg");
  ASSERT_EQ(WriteIndexQueue(share_.c_str(), queue_.c_str()), 0);
  DaemonProcess daemon;
  StartDaemon(daemon, {"--throttle", "300"});
  ASSERT_TRUE(WaitUntil(20, [&] { return AllThumbs("1.jpg"); }));
  ASSERT_EQ(unlink(doomed.c_str()), 0);
  ASSERT_TRUE(WaitUntil(20, [&] { return ReadFile(queue_).empty(); }))
      << daemon.Errors();
  EXPECT_TRUE(AllThumbs("3.jpg"));
  EXPECT_NE(daemon.Errors().find("skipped " + doomed + ": it is gone"),
            std::string::npos)
      << daemon.Errors();
  EXPECT_TRUE(daemon.Running());
}

// WriteThumbQueue signals the daemon as soon as its pid file names a live
// process, which is before the daemon watches SIGUSR1: a wake-up then must
// not end it (SIGUSR1's default action).
TEST_F(ThumbDaemonTest, EarlyWakeUpDoesNotEndTheStartingDaemon) {
  DaemonProcess daemon;
  ASSERT_TRUE(
      daemon.Start(MKTHUMBD_PATH,
                   {"--foreground", "--queue", queue_, "--pidfile", pid_file_},
                   dir_.path(), "mkthumbd"));
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
