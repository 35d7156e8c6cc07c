// The plug-in daemon's answers, without its socket: size maps against the
// files actually present, the representative photo, running plug-ins,
// videos that need converting (with a scripted media parser), records of
// converted copies, and requests that must be refused.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "plugin_requests.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/scripted_peer.h"

namespace {

using plugind::HandlePluginRequest;
using plugind::PluginConfig;
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
    EXPECT_EQ(HandlePluginRequest(config_, request, &reply), 0);
    return reply;
  }

  // Makes `file` in `folder` and the EA items `items` beside it (name ->
  // content).
  std::string File(const std::string& folder, const std::string& file,
                   const std::map<std::string, std::string>& items = {}) {
    mkdir(dir_.File(folder).c_str(), 0755);
    std::string path = dir_.File(folder + "/" + file);
    WriteFile(path, "photo or video");
    if (!items.empty()) {
      mkdir(dir_.File(folder + "/.quvameta").c_str(), 0755);
      mkdir(dir_.File(folder + "/.quvameta/" + file).c_str(), 0755);
    }
    for (const auto& [name, content] : items) {
      std::string item = dir_.File(folder + "/.quvameta/" + file + "/" + name);
      if (content == "<dir>") {
        mkdir(item.c_str(), 0755);
      } else {
        WriteFile(item, content);
      }
    }
    return path;
  }

  TempDir dir_;
  PluginConfig config_;
};

// The map has the bit of a size exactly when an item of that size (either
// name) holds 2 bytes or more.
TEST_F(PluginRequestsTest, SizeMapsMatchTheFilesPresent) {
  const std::string jpeg(100, 'j');
  struct Case {
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
  for (const Case& c : cases) {
    Json::Value reply =
        Ask(Request("GET_THUMB_SIZE_MAP", File("p", c.file, c.items)));
    EXPECT_TRUE(reply["success"].asBool()) << c.file << " " << reply;
    EXPECT_EQ(reply["size_map"], c.map) << c.file;
  }
}

// The folder's map is that of its first web photo by bytewise name:
// not an AppleDouble file, a link, a folder, or a file of another kind.
TEST_F(PluginRequestsTest, FolderMapIsThatOfItsFirstPhotoByName) {
  const std::string jpeg(100, 'j');
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

// Requests the daemon cannot answer get "success" false and a reason,
// never a crash or a made-up map.
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

// A plug-in is named when its daemon's pid file names a live process.
TEST_F(PluginRequestsTest, OnlyRunningPluginsAreNamed) {
  WriteFile(dir_.File("alive.pid"), std::to_string(getpid()));
  WriteFile(dir_.File("dead.pid"), "999999999");
  config_.plugins = {{"photo_thumbnail", dir_.File("alive.pid")},
                     {"web_video", dir_.File("dead.pid")},
                     {"other", dir_.File("missing.pid")}};
  Json::Value reply = Ask(Request("GET_ALL_PLUGIN_NAME"));
  EXPECT_TRUE(reply["success"].asBool());
  Json::Value expected(Json::arrayValue);
  expected.append("photo_thumbnail");
  EXPECT_EQ(reply["plugin_names"], expected);
}

class VideoNeedConvertTest : public PluginRequestsTest {
 protected:
  void SetUp() override {
    config_.media_parser_socket = dir_.File("mediaparser.sock");
    config_.media_parser_timeout_s = 1;
  }

  // A media parser that answers GET_MEDIA_INFO from `codecs` (path ->
  // video, audio, container), or with "success" false for other paths, and
  // counts the questions.
  std::unique_ptr<ScriptedPeer> Parser(
      std::map<std::string, std::vector<std::string>> codecs) {
    return std::make_unique<ScriptedPeer>(
        config_.media_parser_socket, [this, codecs](int& fd, int) {
          Json::Value request;
          if (RecvPacket(fd, request) != 0) return;
          ++asked_;
          Json::Value reply(Json::objectValue);
          auto found = codecs.find(request["path"].asString());
          reply["success"] = found != codecs.end();
          if (found == codecs.end()) {
            reply["reason"] = "cannot parse";
          } else {
            reply["media"]["szVideoCodec"] = found->second[0];
            reply["media"]["szAudioCodec"] = found->second[1];
            reply["media"]["szContainerType"] = found->second[2];
          }
          SendPacket(fd, reply);
        });
  }

  int asked_ = 0;
};

// "result" follows the codecs the media parser reports; a converted copy
// under any of the twenty converted-video names settles it without asking.
TEST_F(VideoNeedConvertTest, ResultFollowsCodecsAndConvertedCopies) {
  struct Case {
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
  for (const Case& c : cases) codecs[File("v", c.file)] = c.codecs;
  auto parser = Parser(codecs);
  ASSERT_TRUE(parser->listening());
  for (const Case& c : cases) {
    Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT",
                                    dir_.File(std::string("v/") + c.file)));
    EXPECT_TRUE(reply["success"].asBool()) << c.file << " " << reply;
    EXPECT_EQ(reply["result"], c.result) << c.file;
  }
  EXPECT_EQ(asked_, 9);

  // Not a video, or converted already: 0 without asking.
  const char* names[] = {"QUVAPHOTO_FILM_H264.mp4",
                         "QUVAPHOTO_FILM_MPEG4.mp4",
                         "QUVAPHOTO_FILM_CONVERT_MPEG4.mp4",
                         "QUVAPHOTO_FILM_MOBILE.mp4",
                         "QUVAPHOTO_FILM_MOBILE_IPHONE",
                         "QUVAPHOTO_FILM_MOBILE_ANDROID",
                         "QUVAPHOTO_FILM.flv",
                         "QUVAPHOTO_FILM_H.mp4",
                         "QUVAPHOTO_FILM_M.mp4",
                         "QUVAPHOTO_FILM_L.mp4"};
  int n = 0;
  for (const char* name : names) {
    for (bool second : {false, true}) {
      std::string item = name;
      if (second) item[9] = ':';
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

// Without an answer from the media parser the daemon cannot tell: the reply
// fails (the caller reads 0), and a parser that never answers costs at most
// the configured wait.
TEST_F(VideoNeedConvertTest, NoAnswerFromTheMediaParserFailsTheReply) {
  std::string video = File("v", "a.mkv");
  Json::Value reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
  EXPECT_FALSE(reply["success"].asBool());  // no parser at all

  auto refusing = Parser({});
  reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
  EXPECT_FALSE(reply["success"].asBool());
  EXPECT_NE(reply["reason"].asString().find("cannot parse"), std::string::npos);
  refusing.reset();

  ScriptedPeer silent(config_.media_parser_socket, [](int& fd, int) {
    Json::Value request;
    RecvPacket(fd, request);
    char byte;
    while (read(fd, &byte, 1) > 0) {  // until the daemon hangs up
    }
  });
  const auto started = std::chrono::steady_clock::now();
  reply = Ask(Request("IS_VIDEO_NEED_CONVERT", video));
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - started)
          .count();
  EXPECT_FALSE(reply["success"].asBool());
  EXPECT_LT(seconds, 3.0);
}

class ConvertAddTest : public PluginRequestsTest {
 protected:
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
};

// The record lands beside the converted copy, complete and clean.
TEST_F(ConvertAddTest, RecordIsWrittenBesideTheConvertedCopy) {
  std::string video =
      File("v", "a.mkv", {{"QUVAPHOTO:FILM_H.mp4", "converted video"}});
  std::string copy = dir_.File("v/.quvameta/a.mkv/QUVAPHOTO:FILM_H.mp4");
  Json::Value package(Json::objectValue);
  package["job"] = 7;
  Json::Value reply = Add(video, copy, package);
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
  // Nothing but the copy and its record in the EA directory.
  std::vector<std::string> names;
  for (const auto& entry :
       std::filesystem::directory_iterator(dir_.File("v/.quvameta/a.mkv"))) {
    names.push_back(entry.path().filename());
  }
  std::sort(names.begin(), names.end());
  EXPECT_EQ(names, (std::vector<std::string>{"QUVAPHOTO:FILM_H.mp4",
                                             "QUVAPHOTO:FILM_H.mp4.json"}));
}

// A record may only go beside a real converted copy of a real video: no
// file is ever written where a request points elsewhere.
TEST_F(ConvertAddTest, RecordsOutsideAVideosEADirectoryAreRefused) {
  std::string video =
      File("v", "a.mkv", {{"QUVAPHOTO_FILM_L.mp4", "converted video"}});
  std::string photo = File("v", "p.jpg", {{"QUVAPHOTO_FILM_L.mp4", "x y"}});
  std::string ea = dir_.File("v/.quvameta/a.mkv/");
  struct Case {
    const char* fault;
    std::string source;
    std::string copy;
  } cases[] = {
      {"copy elsewhere", video, dir_.File("v/QUVAPHOTO_FILM_L.mp4")},
      {"copy not named as one", video, ea + "other.mp4"},
      {"copy missing", video, ea + "QUVAPHOTO_FILM_H.mp4"},
      {"copy under a path trick", video, ea + "../a.mkv/QUVAPHOTO_FILM_L.mp4"},
      {"source not a video", photo,
       dir_.File("v/.quvameta/p.jpg/QUVAPHOTO_FILM_L.mp4")},
      {"source missing", dir_.File("v/gone.mkv"), ea + "QUVAPHOTO_FILM_L.mp4"},
      {"source relative", "v/a.mkv", ea + "QUVAPHOTO_FILM_L.mp4"},
  };
  for (const Case& c : cases) {
    Json::Value reply = Add(c.source, c.copy);
    EXPECT_FALSE(reply["success"].asBool()) << c.fault;
    struct stat st;
    EXPECT_NE(stat((c.copy + ".json").c_str(), &st), 0) << c.fault;
  }
  Json::Value bare = Request("INDEX_CONVERT_ADD");
  bare["src"] = "not a record";
  EXPECT_FALSE(Ask(bare)["success"].asBool());
}

}  // namespace
