// quvaindexplugind as a real process on a private socket, asked with the
// library's own typed requests (pointed at it through the library's socket
// seam), with a scripted media parser beside it.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include <gtest/gtest.h>

#include "daemon_process.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "requests/index_requests_internal.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/scripted_peer.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::daemon_test::DaemonProcess;
using quvaidx::daemon_test::WaitUntil;
using quvaidx::test::ReadFile;
using quvaidx::test::ScriptedPeer;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

class PluginDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    previous_ = quvaidx::SetIndexSockets(
        {media_socket_.c_str(), plugin_socket_.c_str()});
    WriteFile(dir_.File("quvamkthumbd.pid"), std::to_string(getpid()));
    ASSERT_TRUE(
        daemon_.Start(PLUGIND_PATH,
                      {"--foreground", "--socket", plugin_socket_, "--pidfile",
                       pid_file_, "--media-parser", media_socket_, "--plugin",
                       "photo_thumbnail=" + dir_.File("quvamkthumbd.pid"),
                       "--plugin", "web_video=" + dir_.File("quvamkflvd.pid")},
                      dir_.path(), "plugind"));
    ASSERT_TRUE(WaitUntil(10, [&] {
      return daemon_.Output().find("listening") != std::string::npos ||
             !daemon_.Running();
    }));
    ASSERT_TRUE(daemon_.Running()) << daemon_.Errors();
  }
  void TearDown() override { quvaidx::SetIndexSockets(previous_); }

  std::string Make(const std::string& relative, const std::string& content) {
    std::string path = dir_.File(relative);
    std::filesystem::create_directories(
        std::filesystem::path(path).parent_path());
    WriteFile(path, content);
    return path;
  }

  TempDir dir_;
  std::string plugin_socket_ = dir_.File("plugind.sock");
  std::string media_socket_ = dir_.File("mediaparser.sock");
  std::string pid_file_ = dir_.File("plugind.pid");
  quvaidx::IndexSockets previous_{};
  DaemonProcess daemon_;
};

TEST_F(PluginDaemonTest, TypedRequestsGetTheDaemonsAnswers) {
  const std::string jpeg(64, 'j');
  std::string photo = Make("share/a.jpg", "photo");
  Make("share/.quvameta/a.jpg/QUVAPHOTO_THUMB_XL.jpg", jpeg);
  Make("share/.quvameta/a.jpg/QUVAPHOTO:THUMB_S.jpg", jpeg);
  int map = -1;
  EXPECT_EQ(QUVAIDX_GetThumbSizeMap(photo.c_str(), THUMB_TYPE_PHOTO, &map), 0);
  EXPECT_EQ(map, 0x9);
  map = -1;
  EXPECT_EQ(QUVAIDX_GetDirThumbSizeMap(dir_.File("share").c_str(),
                                       THUMB_TYPE_PHOTO, &map),
            0);
  EXPECT_EQ(map, 0x9);
  map = -1;
  EXPECT_EQ(QUVAIDX_GetThumbSizeMap(photo.c_str(), THUMB_TYPE_VIDEO, &map), -1);
  EXPECT_EQ(map, -1);

  std::string video = Make("share/clip.mkv", "video");
  ScriptedPeer parser(media_socket_, [](int& fd, int) {
    Json::Value request;
    if (RecvPacket(fd, request) != 0) return;
    Json::Value reply(Json::objectValue);
    reply["success"] = true;
    reply["media"]["szVideoCodec"] = "hevc";
    SendPacket(fd, reply);
  });
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert(video.c_str()), 1);

  std::string copy =
      Make("share/.quvameta/clip.mkv/QUVAPHOTO_FILM_M.mp4", "converted video");
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

  ASSERT_TRUE(daemon_.Signal(SIGTERM));
  int status = -1;
  ASSERT_TRUE(daemon_.WaitExit(10, &status));
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  struct stat st;
  EXPECT_NE(stat(plugin_socket_.c_str(), &st), 0);
  EXPECT_NE(stat(pid_file_.c_str(), &st), 0);
}

}  // namespace
