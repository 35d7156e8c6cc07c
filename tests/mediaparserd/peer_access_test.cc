// A peer learns about a file only when it could read it itself: by the mode
// bits, by the peer's identity taken for the open, and through the daemon.
#include "peer_access.h"

#include <sys/fsuid.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#ifdef MEDIAPARSERD_PATH
#include "daemon_process.h"
#endif
#include "media_test_util.h"
#include "peer_file.h"
#include "quvaidx/ipc.h"
#include "support/fd_check.h"
#include "support/unprivileged.h"

namespace mediaparserd {
namespace {

using quvaidx::test::ReadFile;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

// Users and groups that no file here belongs to, and that have no entry in
// the user database: the groups a peer holds are only those it says.
const PeerIdentity kStranger = {48211, 48211, {48300}};
const PeerIdentity kOutsider = {48212, 48212, {}};
constexpr gid_t kSharedGroup = 48300;

struct stat Status(uid_t uid, gid_t gid, mode_t mode) {
  struct stat status = {};
  status.st_uid = uid;
  status.st_gid = gid;
  status.st_mode = S_IFREG | mode;
  return status;
}

// As the kernel decides: the first class the peer is in (owner, group,
// others) decides alone.
TEST(PeerAccessTest, OwnerThenGroupThenOthersDecide) {
  const std::vector<gid_t> groups = {100, 200};
  // File owner, group and mode, the bit asked, the answer.
  const std::tuple<uid_t, gid_t, mode_t, mode_t, bool> cases[] = {
      {7, 1, 0400, S_IROTH, true},     // owner may read
      {7, 1, 0044, S_IROTH, false},    // owner class wins, though others may
      {1, 200, 0040, S_IROTH, true},   // a supplementary group
      {1, 100, 0404, S_IROTH, false},  // group class wins over others
      {1, 1, 0004, S_IROTH, true},     // others
      {1, 1, 0006, S_IXOTH, false},    // read is no search
      {1, 1, 0001, S_IXOTH, true},
  };
  for (const auto& [uid, gid, mode, want, granted] : cases) {
    EXPECT_EQ(ModeGrants(Status(uid, gid, mode), 7, groups, want), granted)
        << uid << " " << gid << " " << std::oct << mode;
  }
}

class PeerFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to own files as others";
    ASSERT_EQ(chmod(dir_.path().c_str(), 0755), 0);
    ASSERT_EQ(mkdir(dir_.File("open").c_str(), 0755), 0);
    ASSERT_EQ(mkdir(dir_.File("closed").c_str(), 0700), 0);
    Make("open/public", 0644);
    Make("open/private", 0600);
    Make("open/shared", 0640, 0, kSharedGroup);
    Make("closed/public", 0644);
    Make("open/theirs", 0400, kStranger.uid);
  }

  void Make(const std::string& name, mode_t mode, uid_t owner = 0,
            gid_t group = 0) {
    WriteFile(dir_.File(name), "bytes");
    ASSERT_EQ(chmod(dir_.File(name).c_str(), mode), 0);
    ASSERT_EQ(chown(dir_.File(name).c_str(), owner, group), 0);
  }

  TempDir dir_;
};

// The bit check and the open with the peer's rights agree, by the peer's
// groups, and a root daemon has its own identity back after the open.
TEST_F(PeerFileTest, PeerIsRefusedWhatItCannotReadAndRootGetsItsOwnBack) {
  const std::tuple<const char*, const PeerIdentity*, bool> cases[] = {
      {"open/public", &kStranger, true},    {"open/private", &kStranger, false},
      {"closed/public", &kStranger, false},  // the folder cannot be searched
      {"open/theirs", &kStranger, true},  // its owner's, though others may not
      {"open/shared", &kStranger, true},  // by a group the peer holds
      {"open/shared", &kOutsider, false},
  };
  int groups_before = getgroups(0, nullptr);
  for (const auto& [name, peer, readable] : cases) {
    SCOPED_TRACE(std::string(name) + " as " + std::to_string(peer->uid));
    std::string checked, opened;
    PeerFile file;
    EXPECT_EQ(PeerMayRead(dir_.File(name), *peer, &checked), readable);
    EXPECT_EQ(OpenPeerFile(dir_.File(name), &file, &opened, peer), readable)
        << opened;
    if (!readable) {
      EXPECT_EQ(checked, "Permission denied");
      EXPECT_EQ(opened, "Permission denied");
    }
    EXPECT_EQ(setfsuid(static_cast<uid_t>(-1)), 0);
    EXPECT_EQ(setfsgid(static_cast<gid_t>(-1)), 0);
    EXPECT_EQ(getgroups(0, nullptr), groups_before);
  }
  // A root peer, and one without credentials, are answered as root may.
  const PeerIdentity root = {0, 0, {}};
  PeerFile file;
  std::string reason;
  EXPECT_TRUE(OpenPeerFile(dir_.File("closed/public"), &file, &reason, &root));
  EXPECT_TRUE(OpenPeerFile(dir_.File("open/private"), &file, &reason));
}

#ifdef MEDIAPARSERD_PATH
// The daemon answers processes of users unknown to the group database by the
// groups each holds.
TEST_F(PeerFileTest, DaemonAnswersEachPeerByTheGroupsItHolds) {
  const std::string photo = dir_.File("open/shared.jpg");
  WriteFile(photo, ReadFile(mediaparserd::test::Fixture("photo_exif.jpg")));
  ASSERT_EQ(chown(photo.c_str(), 0, kSharedGroup), 0);
  ASSERT_EQ(chmod(photo.c_str(), 0640), 0);
  const std::string socket = dir_.File("mp.sock");
  quvaidx::daemon_test::DaemonProcess daemon;
  ASSERT_TRUE(daemon.Start(MEDIAPARSERD_PATH,
                           {"--foreground", "--socket", socket, "--pidfile",
                            dir_.File("mp.pid"), "--socket-mode", "0666"},
                           dir_.path(), "mediaparserd", "listening"))
      << daemon.Errors();
  for (const PeerIdentity* peer : {&kStranger, &kOutsider}) {
    // Exit status: 0 answered, 1 refused, 2 no exchange.
    int status =
        quvaidx::test::RunAsUser(peer->uid, peer->gid, peer->groups, [&] {
          Json::Value request(Json::objectValue);
          request["command"] = "GET_MEDIA_RESOLUTION";
          request["path"] = photo;
          if (AutoSendRecvPacketBySocketPath(socket.c_str(), request, 1) != 0) {
            return 2;
          }
          return request["success"] == true && request["width"] == 640 ? 0
                 : request["reason"] == "Permission denied"            ? 1
                                                                       : 3;
        });
    EXPECT_EQ(status, peer == &kStranger ? 0 : 1) << daemon.Errors();
  }
}

#endif  // MEDIAPARSERD_PATH

}  // namespace
}  // namespace mediaparserd
