// Requests to replies, without a socket.
#include "request_handler.h"

#include <string>

#include <gtest/gtest.h>
#include <quvaidx/daemon.h>

#include "media_test_util.h"

namespace mediaparserd {
namespace {

using test::Fixture;
using test::HostCodePage;
using test::IsValidUTF8;

class RequestHandlerTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { InitMediaLibraries(kDefaultMaxAlloc); }

  Json::Value Ask(const Json::Value& request) {
    Json::Value reply(Json::arrayValue);  // must be replaced
    HandleRequest(&parser_, request, &reply);
    return reply;
  }

  Json::Value Ask(const char* command, const std::string& path) {
    Json::Value request(Json::objectValue);
    request["command"] = command;
    request["path"] = path;
    return Ask(request);
  }

  MediaParser parser_{ParserOptions()};
};

Json::Value Parse(const char* text) {
  Json::Value value;
  Json::Reader().parse(text, value, false);
  return value;
}

// A request without a known command and an absolute path is refused with
// the reason, and the request itself is left as it came.
TEST_F(RequestHandlerTest, MalformedRequestsAreRefusedAndLeftUntouched) {
  struct Case {
    const char* request;
    const char* reason;
  } cases[] = {
      {"[1, 2]", "unknown command"},
      {"\"GET_MEDIA_INFO\"", "unknown command"},
      {"{}", "unknown command"},
      {"{\"command\": 7, \"path\": \"/a.mp3\"}", "unknown command"},
      {"{\"command\": \"get_media_info\", \"path\": \"/a.mp3\"}",
       "unknown command"},
      {"{\"command\": \"GET_MEDIA_INFO\"}", "missing \"path\""},
      {"{\"command\": \"GET_VIDEO_METADATA\", \"path\": [\"/a.mp4\"]}",
       "missing \"path\""},
      {"{\"command\": \"GET_MEDIA_RESOLUTION\", \"path\": \"a.png\"}",
       "path is not absolute"},
  };
  for (const Case& c : cases) {
    Json::Value request = Parse(c.request);
    Json::Value copy = request;
    Json::Value reply = Ask(request);
    EXPECT_EQ(reply, MakeResponse(false, c.reason)) << c.request;
    EXPECT_EQ(request, copy) << c.request;
  }
  EXPECT_EQ(Ask(Parse("{\"command\": \"HANDSHAKE\"}")),
            MakeResponse(true, nullptr));
}

// The whole record, all 47 fields, and its kind; with the code page at
// UTF-8 the legacy tag bytes cannot be decoded, and still the packet a
// client receives holds only valid UTF-8.
TEST_F(RequestHandlerTest, MediaInfoCarriesTheWholeRecordAndItsKind) {
  HostCodePage host("UTF-8");
  std::string path = Fixture("song_id3v1_cp1251.mp3");
  Json::Value reply = Ask("GET_MEDIA_INFO", path);
  ASSERT_TRUE(reply["success"].asBool()) << reply;
  EXPECT_EQ(reply["media_type"].asString(), "music");
  EXPECT_EQ(reply["media"].size(), 47u);
  EXPECT_EQ(reply["media"]["szPath"].asString(), path);
  EXPECT_TRUE(IsValidUTF8(Json::FastWriter().write(reply)));
}

// The rotation and pixel aspect under their reply keys, for videos only.
TEST_F(RequestHandlerTest, VideoMetadataIsAnsweredForVideosOnly) {
  Json::Value reply = Ask("GET_VIDEO_METADATA", Fixture("video_rot90.mp4"));
  EXPECT_EQ(
      reply["metadata"],
      Parse("{\"rotation\": 90, \"par\": {\"width\": 1, \"height\": 1}}"));
  reply = Ask("GET_VIDEO_METADATA", Fixture("video.mkv"));
  EXPECT_EQ(reply["metadata"],
            Parse("{\"rotation\": 0, \"par\": {\"width\": 4, \"height\": 3}}"));
  for (const char* file : {"song.ogg", "photo_exif.jpg"}) {
    EXPECT_EQ(Ask("GET_VIDEO_METADATA", Fixture(file)),
              MakeResponse(false, "not a video"))
        << file;
  }
  EXPECT_EQ(Ask("GET_VIDEO_METADATA", "/nonexistent/clip.mp4"),
            MakeResponse(false, "No such file or directory"));
}

}  // namespace
}  // namespace mediaparserd
