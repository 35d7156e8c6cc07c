// Requests to replies, without a socket.
#include "request_handler.h"

#include <string>
#include <tuple>

#include <gtest/gtest.h>
#include <quvaidx/daemon.h>

#include "media_test_util.h"

namespace mediaparserd {
namespace {

using test::Fixture;

Json::Value Parse(const std::string& text) {
  Json::Value value;
  Json::Reader().parse(text, value, false);
  return value;
}

class RequestHandlerTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { InitMediaLibraries(kDefaultMaxAlloc); }

  Json::Value Ask(const Json::Value& request) {
    Json::Value reply(Json::arrayValue);  // must be replaced
    HandleRequest(&parser_, request, &reply);
    return reply;
  }
  Json::Value Ask(const char* command, const std::string& path) {
    return Ask(Parse("{\"command\": \"" + std::string(command) +
                     "\", \"path\": \"" + path + "\"}"));
  }

  MediaParser parser_{ParserOptions()};
};

// A request without a known command and an absolute path is refused with
// the reason, and the request itself is left as it came.
TEST_F(RequestHandlerTest, MalformedRequestsAreRefusedAndLeftUntouched) {
  const std::pair<const char*, const char*> cases[] = {
      {"[1, 2]", "unknown command"},
      {R"("GET_MEDIA_INFO")", "unknown command"},
      {"{}", "unknown command"},
      {R"({"command": 7, "path": "/a.mp3"})", "unknown command"},
      {R"({"command": "get_media_info", "path": "/a.mp3"})", "unknown command"},
      {R"({"command": "GET_MEDIA_INFO"})", R"(missing "path")"},
      {R"({"command": "GET_VIDEO_METADATA", "path": ["/a.mp4"]})",
       R"(missing "path")"},
      {R"({"command": "GET_MEDIA_RESOLUTION", "path": "a.png"})",
       "path is not absolute"},
      {R"({"command": "GET_MEDIA_INFO", "path": "/nonexistent/a.mp4"})",
       "No such file or directory"}};
  for (const auto& [text, reason] : cases) {
    Json::Value request = Parse(text), copy = request;
    EXPECT_EQ(Ask(request), MakeResponse(false, reason)) << text;
    EXPECT_EQ(request, copy) << text;
  }
  EXPECT_EQ(Ask(Parse("{\"command\": \"HANDSHAKE\"}")),
            MakeResponse(true, nullptr));
}

// Each command answers its part: the whole record (47 fields, valid UTF-8)
// and kind, the picture size, or a video's rotation and pixel aspect.
TEST_F(RequestHandlerTest, EachCommandAnswersItsPartOfTheRecord) {
  test::HostCodePage host("UTF-8");
  // File, kind, width, height, metadata (null: "not a video").
  const std::tuple<const char*, const char*, int, int, const char*> cases[] = {
      {"song_id3v1_cp1251.mp3", "music", 0, 0, nullptr},
      {"photo_exif.jpg", "photo", 640, 480, nullptr},
      {"video_rot90.mp4", "video", 320, 240,
       "{\"rotation\": 90, \"par\": {\"width\": 1, \"height\": 1}}"},
      {"video.mkv", "video", 320, 240,
       "{\"rotation\": 0, \"par\": {\"width\": 4, \"height\": 3}}"}};
  for (const auto& [file, kind, width, height, metadata] : cases) {
    SCOPED_TRACE(file);
    const std::string path = Fixture(file);
    Json::Value reply = Ask("GET_MEDIA_INFO", path);
    ASSERT_TRUE(reply["success"].asBool()) << reply;
    EXPECT_EQ(reply["media_type"].asString(), kind);
    EXPECT_EQ(reply["media"].size(), 47u);
    EXPECT_EQ(reply["media"]["szPath"].asString(), path);
    EXPECT_TRUE(test::IsValidUTF8(Json::FastWriter().write(reply)));
    reply = Ask("GET_MEDIA_RESOLUTION", path);
    EXPECT_EQ(reply,
              Parse("{\"success\": true, \"width\": " + std::to_string(width) +
                    ", \"height\": " + std::to_string(height) + "}"));
    reply = Ask("GET_VIDEO_METADATA", path);
    if (metadata == nullptr) {
      EXPECT_EQ(reply, MakeResponse(false, "not a video"));
    } else {
      EXPECT_TRUE(reply["success"].asBool());
      EXPECT_EQ(reply["metadata"], Parse(metadata));
    }
  }
}

}  // namespace
}  // namespace mediaparserd
