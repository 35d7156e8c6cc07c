// The plug-in daemon as a real process: asked with the library's typed
// requests, by other users, and while a media parser never answers.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "daemon_process.h"
#include "fs_identity.h"
#include "quvaidx/daemon.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "requests/index_requests_internal.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/scripted_peer.h"
#include "support/unprivileged.h"

namespace quvaidx::daemon_test {
namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::ListenUnix;
using quvaidx::test::ReadFile;
using quvaidx::test::RunAsUser;
using quvaidx::test::ScriptedPeer;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;
using Clock = std::chrono::steady_clock;

// Users no file here belongs to and the user database does not know.
constexpr const char* kJpeg = "a thumbnail of two bytes or more";
constexpr unsigned kAlice = 48221;
constexpr unsigned kMallory = 48222;

Json::Value Request(const std::string& command, const std::string& path = "") {
  Json::Value request(Json::objectValue);
  request["command"] = command;
  if (!path.empty()) {
    request["path"] = path;
    request["type"] = 1;
  }
  return request;
}

Json::Value ConvertAdd(const std::string& video, const std::string& copy) {
  Json::Value request = Request("INDEX_CONVERT_ADD");
  request["src"]["szPath"] = video;
  request["src"]["szTitle"] = "the user's text";
  request["convert"]["szPath"] = copy;
  return request;
}

// A connection on which requests are sent and replies read one by one.
class Client {
 public:
  explicit Client(const std::string& socket)
      : fd_(ConnectPeer(socket.c_str(), false, 1)) {}
  ~Client() { DisconnectPeer(fd_); }
  bool Send(Json::Value request) { return SendPacket(fd_, request) == 0; }
  // The next reply, or null when none came within `ms`.
  Json::Value Reply(int ms) {
    struct pollfd ready = {fd_, POLLIN, 0};
    Json::Value reply;
    if (poll(&ready, 1, ms) == 1) RecvPacket(fd_, reply);
    return reply;
  }

 private:
  int fd_;
};

// The daemon on a socket open to everyone, in a tree everyone may search,
// with a scripted media parser when a test asks for one.
class PluginDaemonTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to ask as other users";
    ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
    std::filesystem::create_directories(dir_.File("share"));
  }

  bool Start(std::vector<std::string> more = {}) {
    std::vector<std::string> args = {
        "--foreground",  "--stderr", "--socket",       socket_,
        "--pidfile",     pid_file_,  "--media-parser", media_,
        "--socket-mode", "0666"};
    args.insert(args.end(), more.begin(), more.end());
    return daemon_.Start(PLUGIND_PATH, args, dir_.path(), "plugind",
                         "listening");
  }

  // The reply to `request` asked by a process of `uid` (its group the same
  // number) holding `groups`; null when the exchange failed.
  Json::Value AskAs(unsigned uid, const Json::Value& request,
                    const std::vector<unsigned>& groups = {}) {
    int pipe_fds[2];
    if (pipe(pipe_fds) != 0) return Json::Value();
    int status = RunAsUser(uid, uid, groups, [&] {
      close(pipe_fds[0]);
      Json::Value value = request;
      if (AutoSendRecvPacketBySocketPath(socket_.c_str(), value, 1) != 0) {
        return 1;
      }
      const std::string text = Json::FastWriter().write(value);
      return write(pipe_fds[1], text.data(), text.size()) ==
                     static_cast<ssize_t>(text.size())
                 ? 0
                 : 1;  // a pipe takes it whole: the reply is a packet
    });
    close(pipe_fds[1]);
    std::string text = ReadFile("/proc/self/fd/" + std::to_string(pipe_fds[0]));
    close(pipe_fds[0]);
    Json::Value reply;
    if (status != 0 || !Json::Reader().parse(text, reply)) return Json::Value();
    return reply;
  }

  // A media parser that reads a file as the asking peer, after `meanwhile`,
  // and reports its first line as the video codec; it counts the questions.
  void ScriptParser(std::function<void()> meanwhile = nullptr) {
    parser_ = std::make_unique<ScriptedPeer>(media_, [this, meanwhile](int& fd,
                                                                       int) {
      Json::Value request;
      if (RecvPacket(fd, request) != 0) return;
      ++asked_;
      if (meanwhile) meanwhile();
      struct ucred peer;
      socklen_t length = sizeof(peer);
      quvaidx_daemons::FsUser user;
      user.groups.resize(64);
      socklen_t groups = 64 * sizeof(gid_t);
      getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length);
      getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, user.groups.data(), &groups);
      user.groups.resize(groups / sizeof(gid_t));
      user.uid = peer.uid;
      user.gid = peer.gid;
      std::string content;
      {
        quvaidx_daemons::FsIdentity as_peer(user);
        if (as_peer.taken()) content = ReadFile(request["path"].asString());
      }
      Json::Value reply = MakeResponse(!content.empty(), nullptr);
      if (content.empty()) reply["reason"] = "Permission denied";
      reply["media"]["szVideoCodec"] = content.substr(0, content.find('\n'));
      SendPacket(fd, reply);
    });
    chmod(media_.c_str(), 0666);  // as its socket unit leaves it
  }

  std::string Share(const std::string& name) {
    return dir_.File("share/" + name);
  }
  // Makes `name` in the share (and its folders) with `content`, or a folder
  // when that is null, owned by `uid` with `mode`; returns its path.
  std::string Make(const std::string& name, const char* content, unsigned uid,
                   mode_t mode) {
    const std::filesystem::path path(Share(name));
    std::filesystem::create_directories(content ? path.parent_path() : path);
    if (content) WriteFile(path, content);
    EXPECT_EQ(chown(path.c_str(), uid, uid), 0);
    EXPECT_EQ(chmod(path.c_str(), mode), 0);
    return path;
  }

  TempDir dir_;
  std::string socket_ = dir_.File("plugind.sock");
  std::string pid_file_ = dir_.File("plugind.pid");
  std::string media_ = dir_.File("mediaparser.sock");
  DaemonProcess daemon_;
  std::unique_ptr<ScriptedPeer> parser_;
  std::atomic<int> asked_{0};
};

// The library's typed requests get the daemon's answers; SIGTERM ends it
// with its socket and pid file gone.
TEST_F(PluginDaemonTest, TypedRequestsGetTheDaemonsAnswers) {
  const std::string photo = Make("a.jpg", "photo", 0, 0644);
  const std::string video = Make("clip.mkv", "hevc\n", 0, 0644);
  const std::string copy = Share(".quvameta/clip.mkv/QUVAPHOTO_FILM_M.mp4");
  const quvaidx::IndexSockets previous =
      quvaidx::SetIndexSockets({media_.c_str(), socket_.c_str()});
  // Plug-ins are named only while their pid file names a live process.
  WriteFile(dir_.File("quvamkthumbd.pid"), std::to_string(getpid()));
  WriteFile(dir_.File("dead.pid"), "999999999");
  ASSERT_TRUE(
      Start({"--plugin", "photo_thumbnail=" + dir_.File("quvamkthumbd.pid"),
             "--plugin", "web_video=" + dir_.File("quvamkflvd.pid"), "--plugin",
             "other=" + dir_.File("dead.pid")}))
      << daemon_.Errors();
  Make(".quvameta/a.jpg/QUVAPHOTO_THUMB_XL.jpg", kJpeg, 0, 0644);
  Make(".quvameta/a.jpg/QUVAPHOTO:THUMB_S.jpg", kJpeg, 0, 0644);
  int map = -1;
  EXPECT_EQ(QUVAIDX_GetThumbSizeMap(photo.c_str(), THUMB_TYPE_PHOTO, &map), 0);
  EXPECT_EQ(map, 0x9);
  map = -1;
  EXPECT_EQ(QUVAIDX_GetDirThumbSizeMap(dir_.File("share").c_str(),
                                       THUMB_TYPE_PHOTO, &map),
            0);
  EXPECT_EQ(map, 0x9);

  ScriptParser();
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert(video.c_str()), 1);
  Make(".quvameta/clip.mkv/QUVAPHOTO_FILM_M.mp4", "converted video", 0, 0644);
  EXPECT_EQ(QUVAIDX_IsVideoNeedConvert(video.c_str()), 0);
  static __tag_QUVA_MEDIA_INFO source, converted;
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
  EXPECT_EQ(Json::FastWriter().write(names), "[\"photo_thumbnail\"]\n");

  ASSERT_TRUE(daemon_.Signal(SIGTERM));
  EXPECT_TRUE(daemon_.WaitExit(10));
  EXPECT_FALSE(Exists(socket_));
  EXPECT_FALSE(Exists(pid_file_));
  quvaidx::SetIndexSockets(previous);
}

// A user learns only what it could read itself (by its groups too), also
// through planted links and swaps, and writes records only where it may.
TEST_F(PluginDaemonTest, AnotherUserReadsAndWritesOnlyWhatItMayItself) {
  Make("private", nullptr, 0, 0700);
  Make("private/secret.jpg", "photo", 0, 0644);
  Make("private/.quvameta/secret.jpg/QUVAPHOTO_THUMB_XL.jpg", kJpeg, 0, 0644);
  Make("private/clip.mkv", "hevc\n", 0, 0644);
  const std::string root = Make("root.mkv", "root's codec\n", 0, 0600);
  Make("group.mkv", "group's codec\n", 0, 0640);
  ASSERT_EQ(chown(Share("group.mkv").c_str(), 0, 48300), 0);
  Make("mallory", nullptr, kMallory, 0755);
  Make("mallory/secret.jpg", "photo", kMallory, 0644);
  const std::string mine =
      Make("mallory/clip.mkv", "mallory's", kMallory, 0644);
  ASSERT_EQ(symlink(Share("private/.quvameta").c_str(),
                    Share("mallory/.quvameta").c_str()),
            0);
  const std::string alice = Share("alice");
  const std::string mallory = Share("m");
  for (const char* dir : {"alice", "alice/.quvameta", "alice/.quvameta/a.mkv"})
    Make(dir, nullptr, kAlice, 0755);
  Make("alice/a.mkv", "video", kAlice, 0644);
  const std::string copy = Make("alice/.quvameta/a.mkv/QUVAPHOTO_FILM_M.mp4",
                                "converted video", kAlice, 0644);
  Make("m/.quvameta", nullptr, kMallory, 0755);
  Make("m/a.mkv", "video", kMallory, 0644);
  ASSERT_EQ(symlink((alice + "/.quvameta/a.mkv").c_str(),
                    (mallory + "/.quvameta/a.mkv").c_str()),
            0);
  ScriptParser([&] {  // the name now leads to root's video
    unlink(mine.c_str());
    symlink(root.c_str(), mine.c_str());
  });
  ASSERT_TRUE(Start()) << daemon_.Errors();

  for (const Json::Value& request : {
           Request("GET_DIR_THUMB_SIZE_MAP", Share("private")),
           Request("GET_THUMB_SIZE_MAP", Share("private/secret.jpg")),
           Request("GET_THUMB_SIZE_MAP", Share("private/gone.jpg")),
           Request("IS_VIDEO_NEED_CONVERT", Share("private/clip.mkv")),
           Request("IS_VIDEO_NEED_CONVERT", root),
           Request("IS_VIDEO_NEED_CONVERT", Share("group.mkv")),
       }) {
    EXPECT_EQ(AskAs(kMallory, request),
              MakeResponse(false, "Permission denied"))
        << request;
  }
  EXPECT_EQ(asked_, 0);
  Json::Value reply = AskAs(
      kMallory, Request("GET_THUMB_SIZE_MAP", Share("mallory/secret.jpg")));
  EXPECT_EQ(reply["size_map"], 0) << reply;
  reply = AskAs(kMallory, Request("IS_VIDEO_NEED_CONVERT", mine));
  EXPECT_EQ(reply, MakeResponse(false,
                                "the media parser cannot read the "
                                "file: Permission denied"));
  reply = AskAs(kMallory, Request("IS_VIDEO_NEED_CONVERT", Share("group.mkv")),
                {48300});
  EXPECT_EQ(reply["video_codec"], "group's codec") << reply;
  reply = AskAs(0, Request("GET_DIR_THUMB_SIZE_MAP", Share("private")));
  EXPECT_EQ(reply["size_map"], 0x8);
  EXPECT_EQ(reply["photo"], Share("private/secret.jpg"));

  reply = AskAs(kMallory, ConvertAdd(alice + "/a.mkv", copy));
  EXPECT_EQ(reply["reason"], "cannot create the record: Permission denied");
  reply = AskAs(kMallory,
                ConvertAdd(mallory + "/a.mkv",
                           mallory + "/.quvameta/a.mkv/QUVAPHOTO_FILM_M.mp4"));
  EXPECT_EQ(reply["reason"], "no EA directory beside " + mallory +
                                 "/a.mkv: a link is in the way");
  EXPECT_FALSE(Exists(copy + ".json"));

  reply = AskAs(kAlice, ConvertAdd(alice + "/a.mkv", copy));
  ASSERT_EQ(reply["record"], copy + ".json") << reply;
  struct stat st;
  ASSERT_EQ(stat((copy + ".json").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, kAlice);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_NE(ReadFile(copy + ".json").find("the user's text"),
            std::string::npos);
}

// With requests waiting on a silent parser, HANDSHAKE and refusals beyond
// the bound come at once, in order, waits time out, SIGTERM ends at once.
TEST_F(PluginDaemonTest, HandshakeIsAnsweredWhileRequestsWaitOnTheParser) {
  Make("clip.mkv", "video", 0, 0644);
  int stuck = ListenUnix(media_, 64);
  ASSERT_GE(stuck, 0);
  ASSERT_TRUE(Start(
      {"--workers", "5", "--max-requests", "5", "--media-parser-timeout", "3"}))
      << daemon_.Errors();
  const Json::Value convert =
      Request("IS_VIDEO_NEED_CONVERT", Share("clip.mkv"));
  std::vector<std::unique_ptr<Client>> waiting;
  for (int i = 0; i < 4; ++i) {
    waiting.push_back(std::make_unique<Client>(socket_));
    ASSERT_TRUE(waiting.back()->Send(convert));
  }
  const std::string timed_out = "the media parser does not answer (timed out)";
  {
    Client ordered(socket_);  // the fifth; its HANDSHAKE waits behind it
    ASSERT_TRUE(ordered.Send(convert) && ordered.Send(Request("HANDSHAKE")));
    usleep(200 * 1000);  // all five taken
    Client refused(socket_);
    ASSERT_TRUE(refused.Send(convert));
    const auto start = Clock::now();
    Client asking(socket_);
    ASSERT_TRUE(asking.Send(Request("HANDSHAKE")));
    EXPECT_EQ(asking.Reply(1000), MakeResponse(true, nullptr));
    EXPECT_LT(Clock::now() - start, std::chrono::milliseconds(500));
    EXPECT_EQ(refused.Reply(500)["reason"],
              "busy: 5 requests are being answered; try again later");
    EXPECT_TRUE(ordered.Reply(100).isNull());
    EXPECT_EQ(ordered.Reply(5000)["reason"], timed_out);
    EXPECT_GE(Clock::now() - start, std::chrono::milliseconds(2500));
    EXPECT_EQ(ordered.Reply(500), MakeResponse(true, nullptr));
  }
  for (auto& client : waiting) {
    EXPECT_EQ(client->Reply(500)["reason"], timed_out);
    ASSERT_TRUE(client->Send(convert));
  }
  usleep(100 * 1000);  // the other clients gone, these four waiting
  const auto stopping = Clock::now();
  ASSERT_TRUE(daemon_.Signal(SIGTERM));
  EXPECT_TRUE(daemon_.WaitExit(5)) << daemon_.Errors();
  EXPECT_LT(Clock::now() - stopping, std::chrono::milliseconds(1500));
  close(stuck);
}

}  // namespace
}  // namespace quvaidx::daemon_test
