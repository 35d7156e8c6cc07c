// The plug-in daemon's answers without its socket, asked for root, with a
// scripted media parser.
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "photo_fixtures.h"
#include "plugin_requests.h"
#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/scripted_peer.h"

namespace quvaidx::daemon_test {
namespace {

using quvaidx::test::ReadFile;
using quvaidx::test::ScriptedPeer;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

Json::Value Request(const std::string& command, const std::string& path = "",
                    int type = 1) {
  Json::Value request(Json::objectValue);
  request["command"] = command;
  if (!path.empty()) {
    request["path"] = path;
    request["type"] = type;
  }
  return request;
}

class PluginRequestsTest : public ::testing::Test {
 protected:
  Json::Value Ask(const Json::Value& request) {
    Json::Value reply;
    EXPECT_EQ(plugind::HandlePluginRequest(config_, quvaidx_daemons::FsUser(),
                                           request, &reply),
              0);
    return reply;
  }

  // Makes `file` in `folder` and the EA items `items` beside it (name ->
  // content; "<dir>" makes a folder).
  std::string File(const std::string& folder, const std::string& file,
                   const std::map<std::string, std::string>& items = {}) {
    const std::string ea = dir_.File(folder + "/.quvameta/" + file + "/");
    std::filesystem::create_directories(items.empty() ? dir_.File(folder) : ea);
    WriteFile(dir_.File(folder + "/" + file), "photo or video");
    for (const auto& [name, content] : items) {
      if (content != "<dir>") WriteFile(ea + name, content);
      if (content == "<dir>") mkdir((ea + name).c_str(), 0755);
    }
    return dir_.File(folder + "/" + file);
  }

  // A media parser answering from `codecs` (path -> video, audio, container)
  // or failing; it counts the questions.
  std::unique_ptr<ScriptedPeer> Parser(
      std::map<std::string, std::vector<std::string>> codecs) {
    config_.media_parser_socket = dir_.File("mediaparser.sock");
    config_.media_parser_timeout_s = 1;
    return std::make_unique<ScriptedPeer>(
        config_.media_parser_socket, [this, codecs](int& fd, int) {
          Json::Value request;
          if (RecvPacket(fd, request) != 0) return;
          ++asked_;
          auto found = codecs.find(request["path"].asString());
          Json::Value reply =
              MakeResponse(found != codecs.end(),
                           found == codecs.end() ? "cannot parse" : nullptr);
          if (found != codecs.end()) {
            reply["media"]["szVideoCodec"] = found->second[0];
            reply["media"]["szAudioCodec"] = found->second[1];
            reply["media"]["szContainerType"] = found->second[2];
          }
          SendPacket(fd, reply);
        });
  }

  // INDEX_CONVERT_ADD for the copy `copy` of `source`.
  Json::Value Add(const std::string& source, const std::string& copy,
                  const Json::Value& package = Json::Value()) {
    Json::Value request = Request("INDEX_CONVERT_ADD");
    request["src"]["szPath"] = source;
    request["src"]["duration"] = 12.5;
    request["src"]["szTitle"] = 42;  // mistyped: read as an empty text
    request["convert"]["szPath"] = copy;
    request["convert"]["resolutionX"] = 1280;
    if (!package.isNull()) request["package"] = package;
    return Ask(request);
  }

  TempDir dir_;
  plugind::PluginConfig config_;
  int asked_ = 0;
};

// A size's bit is set exactly when its item (either name) holds 2 bytes or
// more; a folder has its first photo's map.
TEST_F(PluginRequestsTest, SizeMapsMatchTheFilesPresent) {
  const std::string jpeg(100, 'j');
  const struct {
    const char* file;
    std::map<std::string, std::string> items;
    int map;
  } cases[] = {
      {"none.jpg", {}, 0},
      {"all.jpg",
       {{"QUVAPHOTO_THUMB_XL.jpg", jpeg},
        {"QUVAPHOTO_THUMB_B.jpg", jpeg},
        {"QUVAPHOTO_THUMB_M.jpg", jpeg},
        {"QUVAPHOTO_THUMB_S.jpg", jpeg}},
       0xF},
      {"small.png",
       {{"QUVAPHOTO_THUMB_S.jpg", jpeg}, {"QUVAPHOTO_THUMB_M.jpg", jpeg}},
       0x3},
      {"second.jpg", {{"QUVAPHOTO:THUMB_XL.jpg", jpeg}}, 0x8},
      {"tiny.jpg",
       {{"QUVAPHOTO_THUMB_B.jpg", "x"}, {"QUVAPHOTO_THUMB_S.jpg", ""}},
       0},
      {"odd.jpg",
       {{"QUVAPHOTO_THUMB_XL.jpg", "<dir>"},
        {"QUVAPHOTO_THUMB_XL.jpg.part-abc", jpeg},
        {"QUVAPHOTO_FILM_H.mp4", jpeg}},
       0},
      {"song.mp3", {{"QUVAPHOTO_THUMB_S.jpg", jpeg}}, 0},
  };
  for (const auto& c : cases) {
    Json::Value reply =
        Ask(Request("GET_THUMB_SIZE_MAP", File("p", c.file, c.items)));
    EXPECT_TRUE(reply["success"].asBool()) << c.file << " " << reply;
    EXPECT_EQ(reply["size_map"], c.map) << c.file;
  }
  // A folder's map is its first web photo's by bytewise name (no AppleDouble
  // file, link, folder or other kind); an empty folder has 0 and no photo.
  File("f", "b.jpg", {{"QUVAPHOTO_THUMB_XL.jpg", jpeg}});
  std::string first = File("f", "B.png", {{"QUVAPHOTO_THUMB_S.jpg", jpeg}});
  File("f", "._A.jpg");
  File("f", "0.txt");
  mkdir(dir_.File("f/0dir.jpg").c_str(), 0755);
  symlink("b.jpg", dir_.File("f/00link.jpg").c_str());
  Json::Value reply = Ask(Request("GET_DIR_THUMB_SIZE_MAP", dir_.File("f")));
  EXPECT_TRUE(reply["success"].asBool()) << reply;
  EXPECT_EQ(reply["size_map"], 0x1);
  EXPECT_EQ(reply["photo"], first);
  mkdir(dir_.File("empty").c_str(), 0755);
  reply = Ask(Request("GET_DIR_THUMB_SIZE_MAP", dir_.File("empty")));
  EXPECT_TRUE(reply["success"].asBool());
  EXPECT_EQ(reply["size_map"], 0);
  EXPECT_FALSE(reply.isMember("photo"));
}

// Requests it cannot answer get "success" false and a reason, no map.
TEST_F(PluginRequestsTest, RequestsItCannotAnswerAreRefused) {
  std::string photo = File("p", "a.jpg");
  Json::Value wrong_type = Request("GET_THUMB_SIZE_MAP", photo);
  wrong_type["type"] = "1";
  Json::Value array(Json::arrayValue);
  array.append("GET_THUMB_SIZE_MAP");
  const Json::Value cases[] = {
      Request("GET_THUMB_SIZE_MAP", photo, 2),
      wrong_type,
      Request("GET_THUMB_SIZE_MAP", "relative/a.jpg"),
      Request("GET_THUMB_SIZE_MAP", dir_.File("missing.jpg")),
      Request("GET_THUMB_SIZE_MAP", dir_.File("p")),
      Request("GET_DIR_THUMB_SIZE_MAP", photo),
      Request("GET_THUMB_SIZE_MAP"),
      Request("REINDEX"),
      array,
      Json::Value("GET_ALL_PLUGIN_NAME"),
  };
  for (const Json::Value& request : cases) {
    Json::Value reply = Ask(request);
    EXPECT_FALSE(reply["success"].asBool()) << request;
    EXPECT_TRUE(reply["reason"].isString()) << request;
    EXPECT_FALSE(reply.isMember("size_map")) << request;
  }
}

// "result" follows the parser's codecs; a converted copy under any of the
// twenty names, or a file that is no video, settles it without asking.
TEST_F(PluginRequestsTest, VideoNeedConvertFollowsCodecsAndConvertedCopies) {
  const struct {
    const char* file;
    std::vector<std::string> codecs;  // video, audio, container
    int result;
  } cases[] = {
      {"web.mp4", {"h264", "aac", "mov,mp4,m4a,3gp,3g2,mj2"}, 0},
      {"silent.m4v", {"H264", "", ""}, 0},
      {"mp3.mov", {"avc1", "mp3", "mov"}, 0},
      {"hevc.mp4", {"hevc", "aac", "mp4"}, 1},
      {"ac3.mp4", {"h264", "ac3", "mp4"}, 1},
      {"matroska.mkv", {"h264", "aac", "matroska,webm"}, 1},
      {"unnamed.mkv", {"h264", "aac", ""}, 1},
      {"old.mpg", {"mpeg2video", "mp2", "mpeg"}, 1},
      {"unknown.avi", {"", "", ""}, 1},
  };
  std::map<std::string, std::vector<std::string>> codecs;
  for (const auto& c : cases) codecs[File("v", c.file)] = c.codecs;
  auto parser = Parser(codecs);
  ASSERT_TRUE(parser->listening());
  for (const auto& c : cases) {
    Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT",
                                    dir_.File(std::string("v/") + c.file)));
    EXPECT_TRUE(reply["success"].asBool()) << c.file << " " << reply;
    EXPECT_EQ(reply["result"], c.result) << c.file;
  }
  EXPECT_EQ(asked_, 9);

  int n = 0;
  for (std::string name :
       {"H264.mp4", "MPEG4.mp4", "CONVERT_MPEG4.mp4", "MOBILE.mp4",
        "MOBILE_IPHONE", "MOBILE_ANDROID", ".flv", "H.mp4", "M.mp4", "L.mp4"}) {
    for (const char* prefix : {"QUVAPHOTO_FILM", "QUVAPHOTO:FILM"}) {
      std::string item = prefix + (name[0] == '.' ? name : "_" + name);
      std::string video =
          File("c", std::to_string(n++) + ".mkv", {{item, "converted video"}});
      Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
      EXPECT_EQ(reply["result"], 0) << item;
      EXPECT_EQ(reply["converted"], item);
    }
  }
  EXPECT_EQ(Ask(Request("IS_VIDEO_NEED_CONVERT", File("c", "a.jpg")))["result"],
            0);
  EXPECT_EQ(asked_, 9);
}

// Without the parser's answer the reply fails; a parser silent or stopped
// mid-reply costs at most the configured wait.
TEST_F(PluginRequestsTest, NoAnswerFromTheMediaParserFailsTheReply) {
  std::string video = File("v", "a.mkv");
  config_.media_parser_socket = dir_.File("mediaparser.sock");
  EXPECT_FALSE(
      Ask(Request("IS_VIDEO_NEED_CONVERT", video))["success"].asBool());

  auto refusing = Parser({});
  Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
  EXPECT_FALSE(reply["success"].asBool());
  EXPECT_NE(reply["reason"].asString().find("cannot parse"), std::string::npos);
  refusing.reset();

  for (const std::string& sent :
       {std::string(), std::string("\x15\xbe\x00\x40{")}) {
    ScriptedPeer stalled(config_.media_parser_socket, [&](int& fd, int) {
      Json::Value request;
      RecvPacket(fd, request);
      if (!sent.empty()) Writen(fd, sent.data(), sent.size());
      char byte;
      while (read(fd, &byte, 1) > 0) {  // until the daemon hangs up
      }
    });
    const auto started = std::chrono::steady_clock::now();
    Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
    EXPECT_FALSE(reply["success"].asBool());
    EXPECT_EQ(reply["reason"], "the media parser does not answer (timed out)");
    EXPECT_LT(std::chrono::steady_clock::now() - started,
              std::chrono::milliseconds(1500));
  }
}

// A record lands, complete, only beside a real converted copy of a real
// video (by any path), never elsewhere nor through a planted link.
TEST_F(PluginRequestsTest, ConvertRecordIsWrittenOnlyBesideAConvertedCopy) {
  std::string video = File("v", "a.mkv",
                           {{"QUVAPHOTO:FILM_H.mp4", "converted video"},
                            {"QUVAPHOTO_FILM_L.mp4", "converted video"}});
  std::string photo = File("v", "p.jpg", {{"QUVAPHOTO_FILM_L.mp4", "x y"}});
  File("v", "b.mkv", {{"QUVAPHOTO_FILM_L.mp4", "converted video"}});
  std::string ea = dir_.File("v/.quvameta/a.mkv/");
  // A folder whose metadata directory is a link to v's.
  mkdir(dir_.File("w").c_str(), 0755);
  WriteFile(dir_.File("w/a.mkv"), "video");
  symlink(dir_.File("v/.quvameta").c_str(), dir_.File("w/.quvameta").c_str());
  const struct {
    const char* fault;
    std::string source, copy;
  } cases[] = {
      {"copy elsewhere", video, dir_.File("v/QUVAPHOTO_FILM_L.mp4")},
      {"copy not named as one", video, ea + "other.mp4"},
      {"copy missing", video, ea + "QUVAPHOTO_FILM_M.mp4"},
      {"copy of another video", video,
       dir_.File("v/.quvameta/b.mkv/QUVAPHOTO_FILM_L.mp4")},
      {"metadata directory a link", dir_.File("w/a.mkv"),
       dir_.File("w/.quvameta/a.mkv/QUVAPHOTO_FILM_L.mp4")},
      {"source not a video", photo,
       dir_.File("v/.quvameta/p.jpg/QUVAPHOTO_FILM_L.mp4")},
      {"source missing", dir_.File("v/gone.mkv"), ea + "QUVAPHOTO_FILM_L.mp4"},
      {"source relative", "v/a.mkv", ea + "QUVAPHOTO_FILM_L.mp4"},
  };
  for (const auto& c : cases) {
    EXPECT_FALSE(Add(c.source, c.copy)["success"].asBool()) << c.fault;
    EXPECT_NE(access((c.copy + ".json").c_str(), F_OK), 0) << c.fault;
  }
  Json::Value bare = Request("INDEX_CONVERT_ADD");
  bare["src"] = "not a record";
  EXPECT_FALSE(Ask(bare)["success"].asBool());

  const std::string copy = ea + "QUVAPHOTO:FILM_H.mp4";
  Json::Value package(Json::objectValue);
  package["job"] = 7;
  // The same item by another way: the folder's path through "..".
  Json::Value reply =
      Add(video, ea + "../a.mkv/QUVAPHOTO:FILM_H.mp4", Json::Value(1));
  EXPECT_TRUE(reply["success"].asBool()) << reply;
  reply = Add(video, copy, package);
  ASSERT_TRUE(reply["success"].asBool()) << reply;
  EXPECT_EQ(reply["record"], copy + ".json");
  Json::Value record;
  ASSERT_TRUE(Json::Reader().parse(ReadFile(copy + ".json"), record));
  EXPECT_EQ(record["conversion_type"], "CONVERTA_HIGH");
  EXPECT_EQ(record["src"]["szPath"], video);
  EXPECT_EQ(record["src"]["szTitle"], "");
  EXPECT_EQ(record["src"].size(), 47u);
  EXPECT_EQ(record["convert"]["resolutionX"], 1280);
  EXPECT_EQ(record["package"], package);
  EXPECT_EQ(NamesUnder(ea),
            (std::vector<std::string>{"QUVAPHOTO:FILM_H.mp4",
                                      "QUVAPHOTO:FILM_H.mp4.json",
                                      "QUVAPHOTO_FILM_L.mp4"}));
}

}  // namespace
}  // namespace quvaidx::daemon_test
