// A peer learns about a file only when it could read the file itself: the
// permission-bit check of a daemon that is not root, and the identity a
// root daemon takes while it opens the file.
#include "peer_access.h"

#include <sys/fsuid.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "peer_file.h"
#include "support/fd_check.h"

namespace mediaparserd {
namespace {

using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

// A user and group that no file here belongs to, and that has no entry in
// the user database (so its groups are its primary group alone).
constexpr PeerIdentity kStranger = {48211, 48211};

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
  struct Case {
    uid_t uid;
    gid_t gid;
    mode_t mode;
    mode_t want;
    bool granted;
  } cases[] = {
      {7, 1, 0400, S_IROTH, true},     // owner may read
      {7, 1, 0044, S_IROTH, false},    // owner class wins, though others may
      {1, 200, 0040, S_IROTH, true},   // a supplementary group
      {1, 100, 0404, S_IROTH, false},  // group class wins over others
      {1, 1, 0004, S_IROTH, true},     // others
      {1, 1, 0006, S_IXOTH, false},    // read is no search
      {1, 1, 0001, S_IXOTH, true},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(ModeGrants(Status(c.uid, c.gid, c.mode), 7, groups, c.want),
              c.granted)
        << c.uid << " " << c.gid << " " << std::oct << c.mode;
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
    Make("closed/public", 0644);
    Make("open/theirs", 0400, kStranger.uid);
  }

  void Make(const std::string& name, mode_t mode, uid_t owner = 0) {
    WriteFile(dir_.File(name), "bytes");
    ASSERT_EQ(chmod(dir_.File(name).c_str(), mode), 0);
    ASSERT_EQ(chown(dir_.File(name).c_str(), owner, 0), 0);
  }

  TempDir dir_;
};

// Both ways a daemon checks a peer agree with what the peer may read: the
// bit check, and an open with the peer's rights after which a root daemon
// has its own identity back.
TEST_F(PeerFileTest, PeerIsRefusedWhatItCannotReadAndRootGetsItsOwnBack) {
  const std::pair<const char*, bool> cases[] = {
      // readable by the stranger
      {"open/public", true},
      {"open/private", false},
      {"closed/public", false},  // the folder cannot be searched
      {"open/theirs", true},     // its owner's, though others may not read
  };
  int groups_before = getgroups(0, nullptr);
  for (const auto& [name, readable] : cases) {
    std::string checked, opened;
    PeerFile file;
    EXPECT_EQ(PeerMayRead(dir_.File(name), kStranger, &checked), readable)
        << name;
    EXPECT_EQ(OpenPeerFile(dir_.File(name), &file, &opened, &kStranger),
              readable)
        << name << ": " << opened;
    if (!readable) {
      EXPECT_EQ(checked, "Permission denied") << name;
      EXPECT_EQ(opened, "Permission denied") << name;
    }
    EXPECT_EQ(setfsuid(static_cast<uid_t>(-1)), 0);
    EXPECT_EQ(setfsgid(static_cast<gid_t>(-1)), 0);
    EXPECT_EQ(getgroups(0, nullptr), groups_before);
  }
  // A root peer, and one without credentials, are answered as root may.
  const PeerIdentity root = {0, 0};
  PeerFile file;
  std::string reason;
  EXPECT_TRUE(OpenPeerFile(dir_.File("closed/public"), &file, &reason, &root));
  EXPECT_TRUE(OpenPeerFile(dir_.File("open/private"), &file, &reason));
}

}  // namespace
}  // namespace mediaparserd
