// quvamkthumbd as a real process on a private queue and pid file, also as
// root over other users' folders (planted links, unreadable photos, swaps).
#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "daemon_process.h"
#include "photo_fixtures.h"
#include "quvaidx/system.h"
#include "support/fd_check.h"

namespace quvaidx::daemon_test {
namespace {

using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

class ThumbDaemonTest : public ::testing::Test {
 protected:
  // The share is the only one of the host stand-in's database.
  ThumbDaemonTest() {
    umask(022);  // the daemon's, which thumbnails' modes are read with
    mkdir(share_.c_str(), 0755);
    WriteShares(dir_.path(), {{"share", share_}});
  }

  // Starts the daemon, pausing `throttle_ms` after each photo; waits until
  // its loop runs.
  bool Start(DaemonProcess& daemon, const std::string& throttle_ms = "0") {
    return daemon.Start(
        MKTHUMBD_PATH,
        {"--foreground", "--stderr", "--loglevel", "6", "--queue", queue_,
         "--pidfile", pid_file_, "--throttle", throttle_ms},
        dir_.path(), "mkthumbd", "running");
  }
  std::string Photo(const std::string& name) {
    std::string path = share_ + "/" + name;
    EXPECT_TRUE(WritePhoto(path, 900, 600, kRed, kBlue));
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
  // A folder of the share owned by `uid`, and a photo in it owned by `uid`.
  std::string UserFolder(const std::string& name, unsigned uid) {
    EXPECT_TRUE(MakeOwnedDir(share_ + "/" + name, uid, uid));
    return share_ + "/" + name;
  }
  std::string UserPhoto(const std::string& path, unsigned uid,
                        unsigned mode = 0644, Rgb colour = kRed) {
    EXPECT_TRUE(WritePlainPhoto(path, 900, 600, colour));
    EXPECT_TRUE(Own(path, uid, uid, mode));
    return path;
  }
  // Queues `entries`, wakes the daemon and waits until the queue is empty.
  bool Serve(DaemonProcess& daemon, const std::vector<std::string>& entries) {
    for (const std::string& entry : entries) {
      if (WriteIndexQueue(entry.c_str(), queue_.c_str()) != 0) return false;
    }
    return daemon.Signal(SIGUSR1) && Served();
  }

  TempDir dir_;
  std::string share_ = dir_.File("share");
  std::string queue_ = dir_.File("thumb_create.queue");
  std::string pid_file_ = dir_.File("quvamkthumbd.pid");
};

// Asleep until SIGUSR1; bad photos (also ones changed after the listing) and
// entries are logged and skipped; SIGTERM ends it, its pid file gone.
TEST_F(ThumbDaemonTest, WakesOnSigusr1AndSkipsBadPhotosWithoutStopping) {
  std::string whole = ReadFile(Photo("a.jpg"));
  WriteFile(share_ + "/cut.jpg", whole.substr(0, whole.size() / 3));
  WriteFile(share_ + "/empty.jpg", "");
  ASSERT_TRUE(WritePngBomb(share_ + "/bomb.png", 30000, 30000));
  const std::string fifo = Photo("y.jpg");
  const std::string doomed = Photo("z.jpg");
  ASSERT_EQ(mkdir(dir_.File("outside").c_str(), 0755), 0);
  DaemonProcess daemon;
  ASSERT_TRUE(Start(daemon, "500")) << daemon.Errors();
  ASSERT_TRUE(WaitUntil(10, [&] {  // done with what was queued before
    return daemon.Errors().find("asleep until SIGUSR1") != std::string::npos;
  }));
  for (const std::string& entry :
       {share_, share_ + "/deleted-while-queued", dir_.File("outside"),
        std::string("relative/folder")}) {
    ASSERT_EQ(WriteIndexQueue(entry.c_str(), queue_.c_str()), 0);
  }
  usleep(200 * 1000);
  EXPECT_FALSE(Exists(share_ + "/.quvameta"));  // not polling: asleep
  ASSERT_TRUE(daemon.Signal(SIGUSR1));
  ASSERT_TRUE(WaitUntil(20, [&] { return AllThumbs("a.jpg"); }));
  ASSERT_EQ(unlink(doomed.c_str()), 0);
  ASSERT_EQ(unlink(fifo.c_str()), 0);
  ASSERT_EQ(mkfifo(fifo.c_str(), 0666), 0);
  ASSERT_TRUE(Served()) << daemon.Errors();
  const std::string log = daemon.Errors();
  for (const std::string& skipped : std::vector<std::string>{
           "empty.jpg: cannot read it", "cut.jpg: cannot read it",
           "bomb.png: 30000 x 30000 pixels",
           "deleted-while-queued': No such file",
           "outside': outside every share",
           "'relative/folder': not an absolute path",
           "skipped " + doomed + ": it is gone",
           "skipped " + fifo + ": not a regular file"}) {
    EXPECT_NE(log.find(skipped), std::string::npos) << skipped << "\n" << log;
  }
  ASSERT_TRUE(daemon.Signal(SIGTERM));
  EXPECT_TRUE(daemon.WaitExit(5));
  EXPECT_FALSE(Exists(pid_file_));
}

// SIGTERM or SIGKILL mid-entry leave it queued; restarted, the daemon
// completes it and removes killed writers' temporary files and queue copies.
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
  WriteFile(queue_ + ".k1lled", share_ + "\n");  // a rewrite's copy
  DaemonProcess again;
  ASSERT_TRUE(Start(again)) << again.Errors();
  ASSERT_TRUE(Served()) << again.Errors();
  EXPECT_FALSE(Exists(queue_ + ".k1lled"));
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"})
    EXPECT_TRUE(AllThumbs(name)) << name;
  EXPECT_FALSE(TemporaryFilesLeft());
}

// A SIGUSR1 between writing the pid file and the loop must not end the
// daemon (the default action): WriteThumbQueue signals that early.
TEST_F(ThumbDaemonTest, EarlyWakeUpDoesNotEndTheStartingDaemon) {
  DaemonProcess daemon;
  ASSERT_TRUE(
      daemon.Start(MKTHUMBD_PATH,
                   {"--foreground", "--queue", queue_, "--pidfile", pid_file_},
                   dir_.path(), "mkthumbd", ""));
  ASSERT_TRUE(WaitUntil(
      10, [&] { return !ReadFile(pid_file_).empty() || !daemon.Running(); }));
  WaitUntil(10, [&] {
    daemon.Signal(SIGUSR1);
    return daemon.Output().find("running") != std::string::npos ||
           !daemon.Running();
  });
  EXPECT_TRUE(daemon.Running()) << daemon.Errors();
}

// An entry during which the daemon died three times (killed, as by the
// memory limit) is logged and dropped; the entry behind it is served.
TEST_F(ThumbDaemonTest, EntryThatEndedTheDaemonThreeTimesIsDropped) {
  const std::string bad = share_ + "/bad";
  ASSERT_EQ(mkdir(bad.c_str(), 0755), 0);
  ASSERT_EQ(mkdir((share_ + "/good").c_str(), 0755), 0);
  Photo("bad/1.jpg");
  Photo("bad/2.jpg");
  Photo("good/g.jpg");
  ASSERT_EQ(WriteIndexQueue(bad.c_str(), queue_.c_str()), 0);
  ASSERT_EQ(WriteIndexQueue((share_ + "/good").c_str(), queue_.c_str()), 0);
  for (int attempt = 1; attempt <= 3; ++attempt) {
    SCOPED_TRACE("attempt " + std::to_string(attempt));
    std::filesystem::remove_all(bad + "/.quvameta");  // 1.jpg is made anew
    DaemonProcess daemon;
    ASSERT_TRUE(Start(daemon, "60000")) << daemon.Errors();
    ASSERT_TRUE(WaitUntil(20, [&] {
      return daemon.Errors().find("of " + bad + "/1.jpg") != std::string::npos;
    }));
    ASSERT_TRUE(daemon.Signal(SIGKILL));
    EXPECT_TRUE(daemon.WaitExit(5, false));
  }
  DaemonProcess last;
  ASSERT_TRUE(Start(last)) << last.Errors();
  ASSERT_TRUE(Served()) << last.Errors();
  EXPECT_NE(last.Errors().find("gave up queue entry '" + bad + "'"),
            std::string::npos)
      << last.Errors();
  EXPECT_FALSE(Exists(ThumbItem(bad + "/2.jpg", "S")));
  EXPECT_TRUE(AllThumbs("good/g.jpg"));
}

// Folders are worked as their owners: planted links are neither followed nor
// removed, root-only photos refused; thumbnails get their photo's modes.
TEST_F(ThumbDaemonTest, OtherUsersFoldersAreWorkedAsTheirOwners) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act for other users";
  const std::string vault = dir_.File("vault");
  ASSERT_TRUE(MakeOwnedDir(vault, 0, 0, 0700));
  WriteFile(vault + "/root.txt", "root's");
  const std::string bob = UserFolder("bob", kUserB);
  WriteFile(bob + "/IMG.jpg", "bob's");
  const std::string spare = UserFolder("spare", kUserA);
  const struct {
    const char* folder;
    std::string link, target, logged;  // link: in the folder
  } cases[] = {
      {"m1", ".quvameta", vault, "IMG.jpg: a symbolic link is in the way"},
      {"m2", ".quvameta", spare, "IMG.jpg: a symbolic link is in the way"},
      {"e1", ".quvameta/IMG.jpg", bob, "IMG.jpg: a symbolic link is in the"},
      {"e2", ".quvameta/IMG.jpg", spare, "IMG.jpg: a symbolic link is in th"},
      {"i1", ".quvameta/IMG.jpg/QUVAPHOTO_THUMB_XL.jpg", vault + "/root.txt",
       "cannot write QUVAPHOTO_THUMB_XL.jpg: a symbolic link is in its place"},
      {"i2", ".quvameta/IMG.jpg/QUVAPHOTO_THUMB_B.jpg", spare + "/b.jpg",
       "cannot write QUVAPHOTO_THUMB_B.jpg: a symbolic link is in its place"},
      {"p1", ".quvameta/IMG.jpg/QUVAPHOTO_THUMB_S.jpg.part-AbCdEf",
       vault + "/root.txt", "made thumbnails 0xf of " + share_ + "/p1/"},
  };
  std::vector<std::string> entries;
  for (const auto& c : cases) {
    const std::string folder = UserFolder(c.folder, kUserA);
    UserPhoto(folder + "/IMG.jpg", kUserA);
    // The directories above the link, as the owner would make them.
    for (size_t slash = c.link.find('/'); slash != std::string::npos;
         slash = c.link.find('/', slash + 1)) {
      ASSERT_TRUE(
          MakeOwnedDir(folder + "/" + c.link.substr(0, slash), kUserA, kUserA));
    }
    ASSERT_EQ(symlink(c.target.c_str(), (folder + "/" + c.link).c_str()), 0);
    ASSERT_TRUE(Own(folder + "/" + c.link, kUserA, kUserA, 0));
    entries.push_back(folder);
  }
  ASSERT_EQ(symlink((share_ + "/m1").c_str(), (share_ + "/linked").c_str()), 0);
  entries.push_back(share_ + "/linked");
  const std::string folder = UserFolder("u", kUserA);
  const struct {
    const char* name;
    unsigned uid, mode, thumb_mode;  // 0: no thumbnail
  } photos[] = {
      {"own.jpg", kUserA, 0640, 0640},
      {"private.jpg", kUserA, 0400, 0600},
      {"others.jpg", kUserB, 0644, 0644},
      {"root.jpg", 0, 0600, 0},
  };
  for (const auto& p : photos) UserPhoto(folder + "/" + p.name, p.uid, p.mode);
  entries.push_back(folder);
  DaemonProcess daemon;
  ASSERT_TRUE(Start(daemon)) << daemon.Errors();
  ASSERT_TRUE(Serve(daemon, entries)) << daemon.Errors();
  const std::string log = daemon.Errors();
  for (const auto& c : cases) {
    SCOPED_TRACE(c.folder);
    char target[4096] = {};
    const std::string link = share_ + "/" + c.folder + "/" + c.link;
    EXPECT_GT(readlink(link.c_str(), target, sizeof(target) - 1), 0);
    EXPECT_EQ(c.target, target);
    EXPECT_NE(log.find(c.logged), std::string::npos) << log;
  }
  EXPECT_NE(log.find("'" + share_ + "/linked': a symbolic link"),
            std::string::npos)
      << log;
  EXPECT_EQ(NamesUnder(vault), std::vector<std::string>{"root.txt"});
  EXPECT_EQ(ReadFile(vault + "/root.txt"), "root's");
  EXPECT_EQ(NamesUnder(bob), std::vector<std::string>{"IMG.jpg"});
  EXPECT_EQ(ReadFile(bob + "/IMG.jpg"), "bob's");
  EXPECT_TRUE(NamesUnder(spare).empty());
  EXPECT_TRUE(Exists(ThumbItem(share_ + "/i1/IMG.jpg", "S")));
  for (const auto& p : photos) {
    SCOPED_TRACE(p.name);
    struct stat st;
    const bool made =
        lstat(ThumbItem(folder + "/" + p.name, "XL").c_str(), &st) == 0;
    ASSERT_EQ(made, p.thumb_mode != 0);
    if (!made) continue;
    EXPECT_EQ(st.st_uid, p.uid);
    EXPECT_EQ(st.st_gid, p.uid);
    EXPECT_EQ(st.st_mode & 07777, p.thumb_mode);
  }
  EXPECT_NE(log.find("skipped " + folder +
                     "/root.jpg: cannot open it: Permission denied"),
            std::string::npos)
      << log;
}

// Photos swapped with a link to a root-only photo and with a bomb while the
// daemon works: no thumbnail ever shows either.
TEST_F(ThumbDaemonTest, SwappedPhotosLeakNothingAndBombsStayOut) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root to act for other users";
  constexpr Rgb kGreen = {20, 230, 20};
  const std::string vault = dir_.File("vault");
  ASSERT_TRUE(MakeOwnedDir(vault, 0, 0, 0700));
  UserPhoto(vault + "/secret.jpg", 0, 0600, kBlue);
  const std::string folder = UserFolder("race", kUserA);
  UserPhoto(folder + "/p.jpg", kUserA);
  UserPhoto(folder + "/r.jpg", kUserA);
  ASSERT_EQ(
      symlink((vault + "/secret.jpg").c_str(), (folder + "/q.jpg").c_str()), 0);
  ASSERT_TRUE(Own(folder + "/q.jpg", kUserA, kUserA, 0));
  ASSERT_TRUE(WritePlainPhoto(folder + "/big.jpg", 14000, 14000, kGreen));
  ASSERT_TRUE(Own(folder + "/big.jpg", kUserA, kUserA, 0644));
  DaemonProcess daemon;
  ASSERT_TRUE(Start(daemon)) << daemon.Errors();
  // The swapper works from a descriptor: the directory above is root's.
  const int at = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(at, 0);
  const pid_t swapper = fork();
  ASSERT_GE(swapper, 0);
  if (swapper == 0) {
    if (setgroups(0, nullptr) != 0 || setresgid(kUserA, kUserA, kUserA) != 0 ||
        setresuid(kUserA, kUserA, kUserA) != 0) {
      _exit(1);
    }
    const auto end =
        std::chrono::steady_clock::now() + std::chrono::seconds(15);
    long swaps = 0;
    for (long i = 0; i < 20000000 && std::chrono::steady_clock::now() < end;
         ++i) {
      swaps += renameat2(at, "p.jpg", at, "q.jpg", RENAME_EXCHANGE) == 0;
      swaps += renameat2(at, "r.jpg", at, "big.jpg", RENAME_EXCHANGE) == 0;
    }
    _exit(swaps > 0 ? 0 : 1);
  }
  close(at);
  int made = 0;
  int leaked = 0;
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(14);
  for (int round = 0; round < 30 && std::chrono::steady_clock::now() < end;
       ++round) {
    std::filesystem::remove_all(folder + "/.quvameta");
    ASSERT_TRUE(Serve(daemon, {folder})) << daemon.Errors();
    for (const char* name : {"p.jpg", "q.jpg", "r.jpg", "big.jpg"}) {
      const std::string thumb = ThumbItem(folder + "/" + name, "M");
      if (!Exists(thumb)) continue;
      ++made;
      leaked += !Near(ColourAt(thumb, 0.5, 0.5), kRed);
    }
  }
  int status = 0;
  EXPECT_EQ(waitpid(swapper, &status, 0), swapper);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);  // it swapped
  EXPECT_GT(made, 0) << daemon.Errors();
  EXPECT_EQ(leaked, 0) << daemon.Errors();
}

}  // namespace
}  // namespace quvaidx::daemon_test
