// The preview daemons as real processes in a private directory:
// quvamkthumbd on its own queue and pid file (woken by SIGUSR1, bad photos
// skipped, stopped or killed in the middle of an entry and started again),
// and quvaindexplugind on its own socket, asked with the library's typed
// requests (pointed at it through the library's socket seam) with a
// scripted media parser beside it.
#include <fcntl.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "daemon_process.h"
#include "photo_fixtures.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "quvaidx/system.h"
#include "requests/index_requests_internal.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/scripted_peer.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::daemon_test::DaemonProcess;
using quvaidx::daemon_test::kBlue;
using quvaidx::daemon_test::kRed;
using quvaidx::daemon_test::NamesUnder;
using quvaidx::daemon_test::ThumbItem;
using quvaidx::daemon_test::WaitUntil;
using quvaidx::test::ReadFile;
using quvaidx::test::ScriptedPeer;
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

// The plug-in daemon answers what the library's typed requests send, and
// the library reads its answers; SIGTERM ends it with its socket and pid
// file gone.
TEST(PluginDaemonTest, TypedRequestsGetTheDaemonsAnswers) {
  TempDir dir;
  const std::string socket = dir.File("plugind.sock");
  const std::string media = dir.File("mediaparser.sock");
  const std::string pid_file = dir.File("plugind.pid");
  const std::string photo = dir.File("share/a.jpg");
  const std::string video = dir.File("share/clip.mkv");
  const std::string copy =
      dir.File("share/.quvameta/clip.mkv/QUVAPHOTO_FILM_M.mp4");
  std::filesystem::create_directories(dir.File("share/.quvameta/a.jpg"));
  std::filesystem::create_directories(dir.File("share/.quvameta/clip.mkv"));
  for (const std::string& file : {photo, video}) WriteFile(file, "media");
  const quvaidx::IndexSockets previous =
      quvaidx::SetIndexSockets({media.c_str(), socket.c_str()});
  // Plug-ins are named only while their pid file names a live process:
  // not when it is missing (web_video) or names a dead one.
  WriteFile(dir.File("quvamkthumbd.pid"), std::to_string(getpid()));
  WriteFile(dir.File("dead.pid"), "999999999");
  DaemonProcess daemon;
  ASSERT_TRUE(
      daemon.Start(PLUGIND_PATH,
                   {"--foreground", "--socket", socket, "--pidfile", pid_file,
                    "--media-parser", media, "--plugin",
                    "photo_thumbnail=" + dir.File("quvamkthumbd.pid"),
                    "--plugin", "web_video=" + dir.File("quvamkflvd.pid"),
                    "--plugin", "other=" + dir.File("dead.pid")},
                   dir.path(), "plugind", "listening"))
      << daemon.Errors();

  const std::string jpeg(64, 'j');
  WriteFile(dir.File("share/.quvameta/a.jpg/QUVAPHOTO_THUMB_XL.jpg"), jpeg);
  WriteFile(dir.File("share/.quvameta/a.jpg/QUVAPHOTO:THUMB_S.jpg"), jpeg);
  int map = -1;
  EXPECT_EQ(QUVAIDX_GetThumbSizeMap(photo.c_str(), THUMB_TYPE_PHOTO, &map), 0);
  EXPECT_EQ(map, 0x9);
  map = -1;
  EXPECT_EQ(QUVAIDX_GetDirThumbSizeMap(dir.File("share").c_str(),
                                       THUMB_TYPE_PHOTO, &map),
            0);
  EXPECT_EQ(map, 0x9);

  ScriptedPeer parser(media, [](int& fd, int) {
    Json::Value request;
    if (RecvPacket(fd, request) != 0) return;
    Json::Value reply(Json::objectValue);
    reply["success"] = true;
    reply["media"]["szVideoCodec"] = "hevc";
    SendPacket(fd, reply);
  });
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert(video.c_str()), 1);
  WriteFile(copy, "converted video");
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert(video.c_str()), 0);
  static __tag_QUVA_MEDIA_INFO source;
  static __tag_QUVA_MEDIA_INFO converted;
  snprintf(source.szPath, sizeof(source.szPath), "%s", video.c_str());
  snprintf(converted.szPath, sizeof(converted.szPath), "%s", copy.c_str());
  EXPECT_EQ(QUVAIDX_IndexConvertAdd(&source, &converted, Json::Value("job 7")),
            0);
  Json::Value record;
  ASSERT_TRUE(Json::Reader().parse(ReadFile(copy + ".json"), record));
  EXPECT_EQ(record["conversion_type"], "CONVERTA_MEDIUM");
  EXPECT_EQ(record["package"], "job 7");

  FakeHost host;  // the index daemon counts as alive for this process
  host.Answer(HostOp::kProcAliveByPidFile, {1});
  Json::Value names;
  EXPECT_EQ(QUVAIDX_GetAllPluginName(names), 0);
  Json::Value expected(Json::arrayValue);
  expected.append("photo_thumbnail");
  EXPECT_EQ(names, expected);

  ASSERT_TRUE(daemon.Signal(SIGTERM));
  EXPECT_TRUE(daemon.WaitExit(10));
  EXPECT_FALSE(Exists(socket));
  EXPECT_FALSE(Exists(pid_file));
  quvaidx::SetIndexSockets(previous);
}

}  // namespace
