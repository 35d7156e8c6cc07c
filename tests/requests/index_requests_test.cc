// The typed index requests against scripted daemons on temporary sockets.
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <mutex>
#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "requests/index_requests_internal.h"
#include "support/fake_host.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/scripted_peer.h"

namespace quvaidx::test {
namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;

Json::Value Parse(const char* text) {
  Json::Value value;
  EXPECT_TRUE(Json::Reader().parse(text, value)) << text;
  return value;
}

struct Outputs {
  __tag_QUVA_MEDIA_INFO record;
  Resolution resolution;
  _VIDEO_METADATA_ metadata;
  int size_map, dir_size_map;
};

// The typed requests that fill Outputs, with their results, and what each
// sends to which daemon.
std::vector<int> CallAll(Outputs& o) {
  return {QUVAIDX_GetMediaInfo("/a/b.mp3", &o.record),
          QUVAIDX_GetMediaResolution("/v.mp4", &o.resolution),
          QUVAIDX_GetVideoMetadata("/v.mp4", &o.metadata),
          QUVAIDX_GetThumbSizeMap("/p.jpg", THUMB_TYPE_PHOTO, &o.size_map),
          QUVAIDX_GetDirThumbSizeMap("/dir", THUMB_TYPE_VIDEO, &o.dir_size_map),
          QUVAIDX_IsVideoNeedConvert("/v.avi")};
}
const char kSent[] = R"([
    {"to": "media", "command": "GET_MEDIA_INFO", "path": "/a/b.mp3"},
    {"to": "media", "command": "GET_MEDIA_RESOLUTION", "path": "/v.mp4"},
    {"to": "media", "command": "GET_VIDEO_METADATA", "path": "/v.mp4"},
    {"to": "plugin", "command": "GET_THUMB_SIZE_MAP", "path": "/p.jpg",
     "type": 1},
    {"to": "plugin", "command": "GET_DIR_THUMB_SIZE_MAP", "path": "/dir",
     "type": 2},
    {"to": "plugin", "command": "IS_VIDEO_NEED_CONVERT", "path": "/v.avi"}])";

// Daemons on both sockets answer every request with reply_ and record it,
// with "to": the daemon's name.
class IndexRequestsTest : public ::testing::Test {
 protected:
  IndexRequestsTest()
      : previous_(quvaidx::SetIndexSockets(
            {media_path_.c_str(), plugin_path_.c_str()})) {}
  ~IndexRequestsTest() override {
    peers_.clear();
    quvaidx::SetIndexSockets(previous_);
    EXPECT_TRUE(leaks_.NoLeak());
  }

  void Serve(const char* reply) {
    std::lock_guard<std::mutex> lock(mutex_);
    reply_ = Parse(reply);
    for (const char* name : {"media", "plugin"}) {
      if (peers_.size() == 2) break;
      auto script = [this, name](int& fd, int) {
        Json::Value request;
        if (RecvPacket(fd, request) != 0) return;
        std::lock_guard<std::mutex> lock(mutex_);
        request["to"] = name;
        received_.append(request);
        Json::Value reply = reply_;
        SendPacket(fd, reply);
      };
      peers_.emplace_back(new ScriptedPeer(
          name[0] == 'm' ? media_path_ : plugin_path_, script));
    }
  }
  Json::Value Received() {
    std::lock_guard<std::mutex> lock(mutex_);
    return received_;
  }

  FdLeakCheck leaks_;
  TempDir dir_;
  std::string media_path_ = dir_.File("media.sock");
  std::string plugin_path_ = dir_.File("plugin.sock");
  quvaidx::IndexSockets previous_;
  FakeSleep sleep_;
  std::mutex mutex_;
  Json::Value reply_;
  Json::Value received_{Json::arrayValue};
  std::vector<std::unique_ptr<ScriptedPeer>> peers_;
};

// Mistyped or missing reply keys read as zero.
TEST_F(IndexRequestsTest, RequestsSendTheirKeysAndReadRepliesGuarded) {
  Serve(R"({"success": true, "media": {"ID": 9, "szTitle": "T",
      "fileSize": 4294967301, "track": "bad"}, "width": "1920",
      "height": 99999999999, "metadata": {"rotation": 270,
      "par": {"width": 4, "height": 3}}, "size_map": 12, "result": -2})");
  Outputs o;
  memset(&o, 0x5A, sizeof(o));
  EXPECT_EQ(CallAll(o), (std::vector<int>{0, 0, 0, 0, 0, -2}));
  EXPECT_EQ(o.record.ID, 9u);
  EXPECT_STREQ(o.record.szTitle, "T");
  EXPECT_EQ(o.record.fileSize, 4294967301u);
  EXPECT_EQ(
      std::make_tuple(o.record.track, o.resolution.width, o.resolution.height,
                      o.metadata.rotation, o.metadata.parWidth,
                      o.metadata.parHeight, o.size_map, o.dir_size_map),
      std::make_tuple(0, 0, 0, 270, 4, 3, 12, 12));
  EXPECT_EQ(Received(), Parse(kSent));
}

// A reply that does not say "success": true leaves every output untouched.
TEST_F(IndexRequestsTest, RefusedRepliesLeaveOutputsUntouched) {
  for (const char* reply :
       {R"({"width": 1, "media": {"ID": 1}, "result": 1, "size_map": 1})",
        R"({"success": false, "width": 1, "result": 1})", R"([1, 2, 3])"}) {
    SCOPED_TRACE(reply);
    Serve(reply);
    LogCapture log;
    Outputs o, before;
    memset(&o, 0x5A, sizeof(o));
    memset(&before, 0x5A, sizeof(before));
    EXPECT_EQ(CallAll(o), (std::vector<int>{-1, -1, -1, -1, -1, 0}));
    EXPECT_EQ(memcmp(&o, &before, sizeof(o)), 0);
    EXPECT_TRUE(log.lines().empty());
    memset(&o.record, 0, sizeof(o.record));
    EXPECT_EQ(QUVAIDX_IndexConvertAdd(&o.record, &o.record, Json::Value()), -1);
    EXPECT_EQ(log.Normalized(), std::vector<std::string>{"quvaidx_ipc:N fail"});
  }
}

TEST_F(IndexRequestsTest, IndexConvertAddSendsPackageOnlyWhenNotEmpty) {
  const std::pair<Json::Value, bool> cases[] = {
      {Json::Value(), false},
      {Json::Value(Json::objectValue), false},
      {Json::Value(""), true},
      {Parse(R"({"name": "pkg"})"), true}};
  Serve(R"({"success": true})");
  __tag_QUVA_MEDIA_INFO source = {}, converted = {};
  strcpy(source.szPath, "/v.avi");
  strcpy(converted.szPath, "/v.mp4");
  for (const auto& c : cases) {
    EXPECT_EQ(QUVAIDX_IndexConvertAdd(&source, &converted, c.first), 0);
  }
  Json::Value received = Received();
  ASSERT_EQ(received.size(), 4u);
  for (Json::ArrayIndex i = 0; i < received.size(); ++i) {
    SCOPED_TRACE(i);
    const Json::Value& request = received[i];
    EXPECT_EQ(request["command"], "INDEX_CONVERT_ADD");
    EXPECT_EQ(request["src"]["szPath"], "/v.avi");
    EXPECT_EQ(request["convert"]["szPath"], "/v.mp4");
    EXPECT_EQ(request["src"].size(), 47u);
    EXPECT_EQ(request.isMember("package"), cases[i].second);
    if (cases[i].second) {
      EXPECT_EQ(request["package"], cases[i].first);
    }
  }
}

TEST_F(IndexRequestsTest, DaemonDownFailsAfterEveryAttemptWithItsLine) {
  for (std::string name : {"GetMediaInfo()", "IndexConvertAdd()"}) {
    FakeSleep sleep;
    LogCapture log(0);  // the typed requests' lines ignore the level
    __tag_QUVA_MEDIA_INFO r = {};
    EXPECT_EQ(name[0] == 'G' ? QUVAIDX_GetMediaInfo("/x", &r)
                             : QUVAIDX_IndexConvertAdd(&r, &r, {}),
              -1);
    EXPECT_EQ(sleep.calls(), kIndexRequestAttempts) << name;
    EXPECT_EQ(log.Normalized(),
              std::vector<std::string>{"quvaidx_ipc:N [Error] " + name});
  }
}

// A user who bound a daemon's fixed path while it was down receives
// nothing, and the call fails at once instead of trying for half an hour.
TEST_F(IndexRequestsTest, StrangerOnTheSocketGetsNothing) {
  int squatter = ListenUnixAs(plugin_path_, 4, 65534);
  ASSERT_GE(squatter, 0);
  LogCapture log;
  int map = 7;
  EXPECT_EQ(QUVAIDX_GetThumbSizeMap("/p.jpg", THUMB_TYPE_PHOTO, &map), -1);
  EXPECT_EQ(map, 7);
  EXPECT_EQ(sleep_.calls(), 0);
  ASSERT_EQ(log.lines().size(), 2u);
  EXPECT_NE(log.lines()[0].text.find("refused " + plugin_path_ +
                                     ": served by uid 65534"),
            std::string::npos)
      << log.lines()[0].text;
  EXPECT_EQ(log.Normalized()[1], "quvaidx_ipc:N [Error] GetThumbSizeMap()");
  // The queued connection was closed before anything was sent.
  int fd = accept(squatter, nullptr, nullptr);
  ASSERT_GE(fd, 0);
  char byte;
  EXPECT_EQ(read(fd, &byte, 1), 0);
  close(fd);
  close(squatter);
}

TEST_F(IndexRequestsTest, AllPluginNamesOnlyWhileTheIndexDaemonLives) {
  Serve(R"({"success": true, "plugin_names": ["a", "b"]})");
  FakeHost host;
  LogCapture log(7);
  host.Answer(HostOp::kProcAliveByPidFile, {0});
  Json::Value names = "untouched";
  EXPECT_EQ(IsQuvaindexAlive(), 0);
  EXPECT_EQ(QUVAIDX_GetAllPluginName(names), -1);
  EXPECT_EQ(names, "untouched");
  EXPECT_TRUE(Received().empty());
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(sleep_.calls(), 0);

  host.Answer(HostOp::kProcAliveByPidFile, {-1});  // any non-zero is alive
  EXPECT_EQ(IsQuvaindexAlive(), 1);
  ASSERT_EQ(QUVAIDX_GetAllPluginName(names), 0);
  EXPECT_EQ(names, Parse(R"(["a", "b"])"));
  EXPECT_EQ(Received()[0],
            Parse(R"({"to": "plugin", "command": "GET_ALL_PLUGIN_NAME"})"));
}

}  // namespace
}  // namespace quvaidx::test
