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

TEST_F(RequestHandlerTest, MediaInfoCarriesTheWholeRecordAndItsKind) {
  HostCodePage host("UTF-8");  // legacy bytes cannot be decoded
  struct Case {
    const char* file;
    const char* kind;
  } cases[] = {{"song_id3v1_cp1251.mp3", "music"},
               {"video.mkv", "video"},
               {"photo_exif.jpg", "photo"}};
  for (const Case& c : cases) {
    Json::Value reply = Ask("GET_MEDIA_INFO", Fixture(c.file));
    ASSERT_TRUE(reply["success"].asBool()) << c.file << ": " << reply;
    EXPECT_EQ(reply["media_type"].asString(), c.kind);
    EXPECT_EQ(reply["media"].size(), 47u);
    EXPECT_EQ(reply["media"]["szPath"].asString(), Fixture(c.file));
    // The packet a client receives holds only valid UTF-8.
    EXPECT_TRUE(IsValidUTF8(Json::FastWriter().write(reply))) << c.file;
  }
}

TEST_F(RequestHandlerTest, ResolutionIsThePixelSizeOfPhotosAndVideos) {
  struct Case {
    const char* file;
    int width, height;
  } cases[] = {{"photo_exif.jpg", 640, 480},
               {"photo.png", 200, 100},
               {"video_rot90.mp4", 320, 240},
               {"song.flac", 0, 0}};
  for (const Case& c : cases) {
    Json::Value reply = Ask("GET_MEDIA_RESOLUTION", Fixture(c.file));
    EXPECT_TRUE(reply["success"].asBool()) << c.file << ": " << reply;
    EXPECT_EQ(reply["width"].asInt(), c.width) << c.file;
    EXPECT_EQ(reply["height"].asInt(), c.height) << c.file;
  }
}

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
