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

TEST_F(IndexRequestsTest, DefaultSocketsAreTheFixedPaths) {
  quvaidx::IndexSockets ours = quvaidx::SetIndexSockets({nullptr, nullptr});
  quvaidx::IndexSockets defaults = quvaidx::SetIndexSockets(ours);
  EXPECT_STREQ(defaults.media_parser, "/tmp/quvamediaparserd_sock");
  EXPECT_STREQ(defaults.plugin, "/tmp/quvaindexplugind_sock");
}

TEST_F(IndexRequestsTest, GetMediaInfoSendsPathAndFillsTheRecord) {
  Json::Value reply = Parse(
      R"({"success": true, "media": {"ID": 9, "szTitle": "T",
          "fileSize": 4294967301, "track": "bad"}})");
  Daemon daemon(media_path_, reply);
  __tag_QUVA_MEDIA_INFO record;
  memset(&record, 0x5A, sizeof(record));
  ASSERT_EQ(QUVAIDX_GetMediaInfo("/a/b.mp3", &record), 0);
  EXPECT_EQ(record.ID, 9u);
  EXPECT_STREQ(record.szTitle, "T");
  EXPECT_EQ(record.fileSize, 4294967301u);
  EXPECT_EQ(record.track, 0);
  ASSERT_EQ(daemon.requests().size(), 1u);
  EXPECT_EQ(daemon.requests()[0],
            Parse(R"({"command": "GET_MEDIA_INFO", "path": "/a/b.mp3"})"));
}

TEST_F(IndexRequestsTest, ResolutionOfABareSuccessIsZero) {
  Daemon daemon(media_path_, Parse(R"({"success": true})"));
  Resolution resolution = {5, 5};
  ASSERT_EQ(QUVAIDX_GetMediaResolution("/v.mp4", &resolution), 0);
  EXPECT_EQ(resolution.width, 0);
  EXPECT_EQ(resolution.height, 0);
  EXPECT_EQ(daemon.requests()[0]["command"], "GET_MEDIA_RESOLUTION");
}

TEST_F(IndexRequestsTest, MistypedReplyKeysReadAsZero) {
  Daemon daemon(media_path_, Parse(R"({"success": true, "width": "1920",
                          "height": 99999999999})"));
  Resolution resolution = {5, 5};
  ASSERT_EQ(QUVAIDX_GetMediaResolution("/v.mp4", &resolution), 0);
  EXPECT_EQ(resolution.width, 0);
  EXPECT_EQ(resolution.height, 0);
}

TEST_F(IndexRequestsTest, VideoMetadataIsReadFromMetadata) {
  Daemon daemon(media_path_,
                Parse(R"({"success": true, "metadata": {"rotation": 270,
                          "par": {"width": 4, "height": 3}}})"));
  _VIDEO_METADATA_ metadata = {1, 1, 1};
  ASSERT_EQ(QUVAIDX_GetVideoMetadata("/v.mp4", &metadata), 0);
  EXPECT_EQ(metadata.rotation, 270);
  EXPECT_EQ(metadata.parWidth, 4);
  EXPECT_EQ(metadata.parHeight, 3);
  EXPECT_EQ(daemon.requests()[0]["command"], "GET_VIDEO_METADATA");
}

// A reply that does not say "success": true leaves every output untouched.
struct RefusalCase {
  const char* fault;
  const char* reply;
};

TEST_F(IndexRequestsTest, RefusedRepliesLeaveOutputsUntouched) {
  const RefusalCase cases[] = {
      {"SuccessMissing", R"({"width": 1, "media": {"ID": 1}, "result": 1})"},
      {"SuccessFalse", R"({"success": false, "width": 1, "result": 1})"},
      {"SuccessString", R"({"success": "true", "result": 1})"},
      {"ReplyNotAnObject", R"([1, 2, 3])"},
      {"ReplyAString", R"("success")"},
  };
  for (const RefusalCase& c : cases) {
    SCOPED_TRACE(c.fault);
    Daemon media(media_path_, Parse(c.reply));
    Daemon plugin(plugin_path_, Parse(c.reply));
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
  }
}

TEST_F(IndexRequestsTest, IsVideoNeedConvertReturnsTheResult) {
  const std::pair<const char*, int> cases[] = {
      {R"({"success": true, "result": 3})", 3},
      {R"({"success": true, "result": 0})", 0},
      {R"({"success": true})", 0},
      {R"({"success": true, "result": {"x": 1}})", 0},
      {R"({"success": 1, "result": -2})", -2},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.first);
    Daemon plugin(plugin_path_, Parse(c.first));
    EXPECT_EQ(QUVAIDX_IsVideoNeedConvert("/v.avi"), c.second);
    EXPECT_EQ(plugin.requests()[0],
              Parse(R"({"command":"IS_VIDEO_NEED_CONVERT","path":"/v.avi"})"));
  }
}

TEST_F(IndexRequestsTest, ThumbSizeMapsSendTypeAndReadSizeMap) {
  Daemon plugin(plugin_path_, Parse(R"({"success": true, "size_map": 12})"));
  int size_map = 0;
  ASSERT_EQ(QUVAIDX_GetThumbSizeMap("/p.jpg", THUMB_TYPE_PHOTO, &size_map), 0);
  EXPECT_EQ(size_map, 12);
  size_map = 0;
  ASSERT_EQ(QUVAIDX_GetDirThumbSizeMap("/dir", THUMB_TYPE_VIDEO, &size_map), 0);
  EXPECT_EQ(size_map, 12);
  std::vector<Json::Value> requests = plugin.requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0], Parse(R"({"command": "GET_THUMB_SIZE_MAP",
                                   "path": "/p.jpg", "type": 1})"));
  EXPECT_EQ(requests[1], Parse(R"({"command": "GET_DIR_THUMB_SIZE_MAP",
                                   "path": "/dir", "type": 2})"));
}

TEST_F(IndexRequestsTest, IndexConvertAddSendsPackageOnlyWhenNotEmpty) {
  const std::pair<Json::Value, bool> cases[] = {
      {Json::Value(), false},
      {Json::Value(Json::objectValue), false},
      {Json::Value(Json::arrayValue), false},
      {Json::Value(""), true},
      {Json::Value(0), true},
      {Parse(R"({"name": "pkg"})"), true},
  };
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
  ASSERT_EQ(requests.size(), 6u);
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

TEST_F(IndexRequestsTest, IndexConvertAddLogsFailWhenRefused) {
  Daemon plugin(plugin_path_, Parse(R"({"success": false})"));
  LogCapture log;
  __tag_QUVA_MEDIA_INFO record;
  memset(&record, 0, sizeof(record));
  EXPECT_EQ(QUVAIDX_IndexConvertAdd(&record, &record, Json::Value()), -1);
  EXPECT_EQ(log.Normalized(), std::vector<std::string>{"quvaidx_ipc:N fail"});
}

TEST_F(IndexRequestsTest, DaemonDownFailsAfterEveryAttemptWithItsLine) {
  struct DownCase {
    const char* line;
    int (*call)();
  };
  const DownCase cases[] = {
      {"quvaidx_ipc:N [Error] GetMediaInfo()",
       [] {
         __tag_QUVA_MEDIA_INFO r;
         return QUVAIDX_GetMediaInfo("/x", &r);
       }},
      {"quvaidx_ipc:N [Error] GetVideoMetadata(): /x",
       [] {
         _VIDEO_METADATA_ m;
         return QUVAIDX_GetVideoMetadata("/x", &m);
       }},
      {"quvaidx_ipc:N [Error] GetMediaResolution()",
       [] {
         Resolution r;
         return QUVAIDX_GetMediaResolution("/x", &r);
       }},
      {"quvaidx_ipc:N [Error] IsVideoNeedConvert()",
       [] { return QUVAIDX_IsVideoNeedConvert("/x"); }},
      {"quvaidx_ipc:N [Error] IndexConvertAdd()",
       [] {
         __tag_QUVA_MEDIA_INFO r;
         memset(&r, 0, sizeof(r));
         return QUVAIDX_IndexConvertAdd(&r, &r, Json::Value());
       }},
      {"quvaidx_ipc:N [Error] GetThumbSizeMap()",
       [] {
         int m;
         return QUVAIDX_GetThumbSizeMap("/x", THUMB_TYPE_PHOTO, &m);
       }},
      {"quvaidx_ipc:N [Error] GetDirThumbSizeMap()",
       [] {
         int m;
         return QUVAIDX_GetDirThumbSizeMap("/x", THUMB_TYPE_PHOTO, &m);
       }},
  };
  for (const DownCase& c : cases) {
    SCOPED_TRACE(c.line);
    FakeSleep sleep;
    LogCapture log(0);  // the typed requests' lines ignore the level
    EXPECT_EQ(c.call(), -1);
    EXPECT_EQ(sleep.calls(), kIndexRequestAttempts);
    EXPECT_EQ(log.Normalized(), std::vector<std::string>{c.line});
  }
}

TEST_F(IndexRequestsTest, AllPluginNamesOnlyWhileTheIndexDaemonLives) {
  Daemon plugin(plugin_path_,
                Parse(R"({"success": true, "plugin_names": ["a", "b"]})"));
  FakeHost host;
  LogCapture log(7);
  host.Answer(HostOp::kProcAliveByPidFile, {0});
  Json::Value names = "untouched";
  EXPECT_EQ(QUVAIDX_GetAllPluginName(names), -1);
  EXPECT_EQ(names, "untouched");
  EXPECT_EQ(plugin.served(), 0);
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(sleep_.calls(), 0);

  host.Answer(HostOp::kProcAliveByPidFile, {7});
  ASSERT_EQ(QUVAIDX_GetAllPluginName(names), 0);
  EXPECT_EQ(names, Parse(R"(["a", "b"])"));
  EXPECT_EQ(plugin.requests()[0],
            Parse(R"({"command":"GET_ALL_PLUGIN_NAME"})"));
}

TEST_F(IndexRequestsTest, AllPluginNamesMissingGivesNull) {
  Daemon plugin(plugin_path_, Parse(R"({"success": true})"));
  FakeHost host;
  host.Answer(HostOp::kProcAliveByPidFile, {1});
  Json::Value names = "old";
  ASSERT_EQ(QUVAIDX_GetAllPluginName(names), 0);
  EXPECT_TRUE(names.isNull());
}

TEST_F(IndexRequestsTest, AliveIsAnyNonZeroHostAnswer) {
  FakeHost host;
  host.Answer(HostOp::kProcAliveByPidFile, {0, 1, -1});
  EXPECT_EQ(IsQuvaindexAlive(), 0);
  EXPECT_EQ(IsQuvaindexAlive(), 1);
  EXPECT_EQ(IsQuvaindexAlive(), 1);
}

}  // namespace
