// The typed index requests against scripted daemons on temporary socket
// paths: request keys, reply keys read with guards, outputs left untouched
// on failure, the daemon down, the index daemon's alive check.
#include <string.h>

#include <mutex>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "ipc/index_requests_internal.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "support/fake_host.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/scripted_peer.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::FakeSleep;
using quvaidx::test::FdLeakCheck;
using quvaidx::test::LogCapture;
using quvaidx::test::ScriptedPeer;
using quvaidx::test::TempDir;

Json::Value Parse(const char* text) {
  Json::Value value;
  EXPECT_TRUE(Json::Reader().parse(text, value)) << text;
  return value;
}

// A daemon that answers every request with the same reply and keeps the
// requests it received.
class Daemon {
 public:
  Daemon(const std::string& path, Json::Value reply)
      : reply_(std::move(reply)),
        peer_(path, [this](int& fd, int) { Serve(fd); }) {}

  std::vector<Json::Value> requests() {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
  }
  int served() const { return peer_.served(); }

 private:
  void Serve(int fd) {
    Json::Value request;
    if (RecvPacket(fd, request) != 0) return;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      requests_.push_back(request);
    }
    Json::Value reply = reply_;
    SendPacket(fd, reply);
  }

  Json::Value reply_;
  std::mutex mutex_;
  std::vector<Json::Value> requests_;
  ScriptedPeer peer_;  // last: starts serving once the rest is built
};

class IndexRequestsTest : public ::testing::Test {
 protected:
  IndexRequestsTest()
      : previous_(quvaidx::SetIndexSockets(
            {media_path_.c_str(), plugin_path_.c_str()})) {}
  ~IndexRequestsTest() override {
    quvaidx::SetIndexSockets(previous_);
    EXPECT_TRUE(leaks_.NoLeak());
  }

  FdLeakCheck leaks_;
  TempDir dir_;
  std::string media_path_ = dir_.File("media.sock");
  std::string plugin_path_ = dir_.File("plugin.sock");
  quvaidx::IndexSockets previous_;
  FakeSleep sleep_;
};

// Each request's keys, and reply keys read with guards: mistyped or missing
// ones read as zero.
TEST_F(IndexRequestsTest, MediaDaemonRequestsSendKeysAndReadGuarded) {
  Daemon daemon(media_path_, Parse(R"({"success": true, "media": {"ID": 9,
      "szTitle": "T", "fileSize": 4294967301, "track": "bad"}, "width": "1920",
      "height": 99999999999, "metadata": {"rotation": 270,
      "par": {"width": 4, "height": 3}}})"));
  __tag_QUVA_MEDIA_INFO record;
  memset(&record, 0x5A, sizeof(record));
  ASSERT_EQ(QUVAIDX_GetMediaInfo("/a/b.mp3", &record), 0);
  EXPECT_EQ(record.ID, 9u);
  EXPECT_STREQ(record.szTitle, "T");
  EXPECT_EQ(record.fileSize, 4294967301u);
  EXPECT_EQ(record.track, 0);
  Resolution resolution = {5, 5};
  ASSERT_EQ(QUVAIDX_GetMediaResolution("/v.mp4", &resolution), 0);
  EXPECT_EQ(resolution.width, 0);
  EXPECT_EQ(resolution.height, 0);
  _VIDEO_METADATA_ metadata = {1, 1, 1};
  ASSERT_EQ(QUVAIDX_GetVideoMetadata("/v.mp4", &metadata), 0);
  EXPECT_EQ(metadata.rotation, 270);
  EXPECT_EQ(metadata.parWidth, 4);
  EXPECT_EQ(metadata.parHeight, 3);
  std::vector<Json::Value> requests = daemon.requests();
  ASSERT_EQ(requests.size(), 3u);
  EXPECT_EQ(requests[0],
            Parse(R"({"command": "GET_MEDIA_INFO", "path": "/a/b.mp3"})"));
  EXPECT_EQ(requests[1],
            Parse(R"({"command": "GET_MEDIA_RESOLUTION", "path": "/v.mp4"})"));
  EXPECT_EQ(requests[2],
            Parse(R"({"command": "GET_VIDEO_METADATA", "path": "/v.mp4"})"));
}

TEST_F(IndexRequestsTest, PluginDaemonRequestsSendKeysAndReadResults) {
  Daemon plugin(plugin_path_,
                Parse(R"({"success": true, "size_map": 12, "result": -2})"));
  int size_map = 0;
  ASSERT_EQ(QUVAIDX_GetThumbSizeMap("/p.jpg", THUMB_TYPE_PHOTO, &size_map), 0);
  EXPECT_EQ(size_map, 12);
  size_map = 0;
  ASSERT_EQ(QUVAIDX_GetDirThumbSizeMap("/dir", THUMB_TYPE_VIDEO, &size_map), 0);
  EXPECT_EQ(size_map, 12);
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert("/v.avi"), -2);
  std::vector<Json::Value> requests = plugin.requests();
  ASSERT_EQ(requests.size(), 3u);
  EXPECT_EQ(requests[0], Parse(R"({"command": "GET_THUMB_SIZE_MAP",
                                   "path": "/p.jpg", "type": 1})"));
  EXPECT_EQ(requests[1], Parse(R"({"command": "GET_DIR_THUMB_SIZE_MAP",
                                   "path": "/dir", "type": 2})"));
  EXPECT_EQ(requests[2],
            Parse(R"({"command":"IS_VIDEO_NEED_CONVERT","path":"/v.avi"})"));
}

// A reply that does not say "success": true leaves every output untouched.
TEST_F(IndexRequestsTest, RefusedRepliesLeaveOutputsUntouched) {
  for (const char* reply :
       {R"({"width": 1, "media": {"ID": 1}, "result": 1, "size_map": 1})",
        R"({"success": false, "width": 1, "result": 1})", R"([1, 2, 3])"}) {
    SCOPED_TRACE(reply);
    Daemon media(media_path_, Parse(reply));
    Daemon plugin(plugin_path_, Parse(reply));
    LogCapture log;
    Resolution resolution = {5, 6};
    EXPECT_EQ(QUVAIDX_GetMediaResolution("/v", &resolution), -1);
    EXPECT_EQ(resolution.width, 5);
    EXPECT_EQ(resolution.height, 6);
    __tag_QUVA_MEDIA_INFO record;
    memset(&record, 0x5A, sizeof(record));
    EXPECT_EQ(QUVAIDX_GetMediaInfo("/v", &record), -1);
    EXPECT_EQ(record.ID, 0x5A5A5A5Au);
    _VIDEO_METADATA_ metadata = {7, 7, 7};
    EXPECT_EQ(QUVAIDX_GetVideoMetadata("/v", &metadata), -1);
    EXPECT_EQ(metadata.rotation, 7);
    int size_map = 42;
    EXPECT_EQ(QUVAIDX_GetThumbSizeMap("/v", THUMB_TYPE_PHOTO, &size_map), -1);
    EXPECT_EQ(QUVAIDX_GetDirThumbSizeMap("/v", THUMB_TYPE_VIDEO, &size_map),
              -1);
    EXPECT_EQ(size_map, 42);
    EXPECT_EQ(QUVAIDX_IsVideoNeedConvert("/v"), 0);
    EXPECT_TRUE(log.lines().empty());
    memset(&record, 0, sizeof(record));
    EXPECT_EQ(QUVAIDX_IndexConvertAdd(&record, &record, Json::Value()), -1);
    EXPECT_EQ(log.Normalized(), std::vector<std::string>{"quvaidx_ipc:N fail"});
  }
}

TEST_F(IndexRequestsTest, IndexConvertAddSendsPackageOnlyWhenNotEmpty) {
  const std::pair<Json::Value, bool> cases[] = {
      {Json::Value(), false},
      {Json::Value(Json::objectValue), false},
      {Json::Value(""), true},
      {Parse(R"({"name": "pkg"})"), true}};
  Daemon plugin(plugin_path_, Parse(R"({"success": true})"));
  __tag_QUVA_MEDIA_INFO source, converted;
  memset(&source, 0, sizeof(source));
  memset(&converted, 0, sizeof(converted));
  strcpy(source.szPath, "/v.avi");
  strcpy(converted.szPath, "/v.mp4");
  for (const auto& c : cases) {
    EXPECT_EQ(QUVAIDX_IndexConvertAdd(&source, &converted, c.first), 0);
  }
  std::vector<Json::Value> requests = plugin.requests();
  ASSERT_EQ(requests.size(), 4u);
  for (size_t i = 0; i < requests.size(); ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(requests[i]["command"], "INDEX_CONVERT_ADD");
    EXPECT_EQ(requests[i]["src"]["szPath"], "/v.avi");
    EXPECT_EQ(requests[i]["convert"]["szPath"], "/v.mp4");
    EXPECT_EQ(requests[i]["src"].size(), 47u);
    EXPECT_EQ(requests[i].isMember("package"), cases[i].second);
    if (cases[i].second) {
      EXPECT_EQ(requests[i]["package"], cases[i].first);
    }
  }
}

__tag_QUVA_MEDIA_INFO g_record;

TEST_F(IndexRequestsTest, DaemonDownFailsAfterEveryAttemptWithItsLine) {
  const std::pair<const char*, int (*)()> cases[] = {
      {"GetMediaInfo()", [] { return QUVAIDX_GetMediaInfo("/x", &g_record); }},
      {"IndexConvertAdd()",
       [] { return QUVAIDX_IndexConvertAdd(&g_record, &g_record, {}); }}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.first);
    FakeSleep sleep;
    LogCapture log(0);  // the typed requests' lines ignore the level
    EXPECT_EQ(c.second(), -1);
    EXPECT_EQ(sleep.calls(), kIndexRequestAttempts);
    EXPECT_EQ(log.Normalized(),
              std::vector<std::string>{std::string("quvaidx_ipc:N [Error] ") +
                                       c.first});
  }
}

TEST_F(IndexRequestsTest, AllPluginNamesOnlyWhileTheIndexDaemonLives) {
  Daemon plugin(plugin_path_,
                Parse(R"({"success": true, "plugin_names": ["a", "b"]})"));
  FakeHost host;
  LogCapture log(7);
  host.Answer(HostOp::kProcAliveByPidFile, {0});
  Json::Value names = "untouched";
  EXPECT_EQ(IsQuvaindexAlive(), 0);
  EXPECT_EQ(QUVAIDX_GetAllPluginName(names), -1);
  EXPECT_EQ(names, "untouched");
  EXPECT_EQ(plugin.served(), 0);
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(sleep_.calls(), 0);

  host.Answer(HostOp::kProcAliveByPidFile, {-1});  // any non-zero is alive
  EXPECT_EQ(IsQuvaindexAlive(), 1);
  ASSERT_EQ(QUVAIDX_GetAllPluginName(names), 0);
  EXPECT_EQ(names, Parse(R"(["a", "b"])"));
  EXPECT_EQ(plugin.requests()[0],
            Parse(R"({"command":"GET_ALL_PLUGIN_NAME"})"));
}

}  // namespace
