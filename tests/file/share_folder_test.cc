// Shared folders through the fake host's in-memory share database.
#include "quvaidx/share_folder.h"

#include <errno.h>
#include <string.h>
#include <syslog.h>

#include <fstream>
#include <string>

#include <gtest/gtest.h>

#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;

TEST(IndexStatus, SetsOrClearsOnlyWhatDiffersAndFreesEveryRecord) {
  const struct {
    unsigned before;
    bool set;
    size_t updates;
    unsigned after;
  } cases[] = {
      {0x00, true, 1, 0x20},  {0x20, true, 0, 0x20}, {0x21, false, 1, 0x01},
      {0x01, false, 0, 0x01}, {0x25, true, 0, 0x25},
  };
  for (const auto& c : cases) {
    FakeHost host;
    host.AddShare("video", "/vol1/video", c.before);
    EXPECT_EQ(0, c.set ? ShareIndexStatusSet("video")
                       : ShareIndexStatusClear("video"));
    EXPECT_EQ(c.updates, host.ShareUpdates().size()) << c.before;
    EXPECT_EQ(c.after, host.ShareStatus("video"));
    EXPECT_EQ(0, host.OutstandingShareRecords());
  }
}

TEST(IndexStatus, MissingShareIsMinusOneAndFailedUpdateStillZero) {
  LogCapture log;
  FakeHost host;
  host.AddShare("video", "/vol1/video", 0);
  EXPECT_EQ(-1, ShareIndexStatusSet("nope"));
  EXPECT_EQ(-1, ShareIndexStatusClear("nope"));
  EXPECT_EQ(2, log.Count("quvaidx_folder:N QUVAShareGet failed: nope"));
  host.Fail(HostOp::kShareUpdate, EACCES);
  EXPECT_EQ(0, ShareIndexStatusSet("video"));
  EXPECT_EQ(1, log.Count("quvaidx_folder:N QUVAShareUpdate failed[D]"));
  host.Fail(HostOp::kShareGet, EIO);
  EXPECT_EQ(-1, ShareIndexStatusSet("video"));
  EXPECT_EQ(0, host.OutstandingShareRecords());
  for (const auto& line : log.lines()) EXPECT_EQ(LOG_ERR, line.priority);
}

TEST(IsDefaultShare, ThreeNamesInAnyCase) {
  const struct {
    const char* name;
    int is;
  } cases[] = {
      {"photo", 1}, {"Photo", 1}, {"MUSIC", 1},  {"vIdEo", 1},  {"photos", 0},
      {"phot", 0},  {"", 0},      {"movies", 0}, {"photo ", 0},
  };
  for (const auto& c : cases) EXPECT_EQ(c.is, IsDefaultShare(c.name)) << c.name;
  EXPECT_EQ(0, IsDefaultShare(nullptr));
}

TEST(SharePath, ShareRelativePathsBecomeDiskPaths) {
  FakeHost host;
  host.AddShare("video", "/vol1/video", 0);
  const struct {
    const char* path;
    int out_size;
    int rc;
    const char* out;
  } cases[] = {
      {"/video/movies/a.mkv", 64, 0, "/vol1/video/movies/a.mkv"},
      {"/video", 64, 0, "/vol1/video"},
      {"/video/", 64, 0, "/vol1/video"},
      {"/video/a//", 64, 0, "/vol1/video/a/"},
      {"/video/a", 8, 0, "/vol1/v"},  // cut to the out size
      {"/Video/a", 64, -1, "untouched"},
      {"/nope/a", 64, -1, "untouched"},
      {"/", 64, -1, "untouched"},
      {"video/a", 64, -1, "untouched"},  // not share-relative
      {"", 64, -1, "untouched"},
      {"/video/a", 0, -1, "untouched"},
  };
  for (const auto& c : cases) {
    char out[64] = "untouched";
    EXPECT_EQ(c.rc, QUVAIndexSharePathGet(c.path, out, c.out_size)) << c.path;
    EXPECT_STREQ(c.out, out) << c.path;
  }
  EXPECT_EQ(-1, QUVAIndexSharePathGet(nullptr, nullptr, 64));
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

class DirInfoTest : public ::testing::Test {
 protected:
  void SetUp() override {
    memset(&info_, 0, sizeof(info_));
    strcpy(info_.szGuid, "caller's");
  }
  TempDir dir_;
  DirInfo info_;
};

TEST_F(DirInfoTest, InsideAShareWithAGuid) {
  FakeHost host;
  host.AddShare("video", dir_.path(), 0);
  host.AnswerSectionValue("6f1c-guid");
  ASSERT_EQ(0, GetDirInfo(dir_.path().c_str(), &info_));
  EXPECT_EQ(dir_.path(), info_.szPath);
  EXPECT_EQ(dir_.path().substr(dir_.path().rfind('/') + 1), info_.szName);
  EXPECT_STREQ("6f1c-guid", info_.szGuid);
  EXPECT_EQ(25u, strlen(info_.szCTime));  // "Sat Mar  7 09:05:03 2015\n"
  EXPECT_EQ('\n', info_.szMTime[24]);
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

TEST_F(DirInfoTest, GuidUntouchedOutsideSharesOrWithoutAMapEntry) {
  FakeHost host;
  host.AddShare("music", "/vol1/music", 0);
  EXPECT_EQ(0, GetDirInfo(dir_.path().c_str(), &info_));
  EXPECT_EQ(0, host.Calls(HostOp::kFileGetSectionValue));
  host.AddShare("video", dir_.path(), 0);
  host.Fail(HostOp::kFileGetSectionValue, ENOENT);
  EXPECT_EQ(0, GetDirInfo(dir_.path().c_str(), &info_));
  EXPECT_EQ(1, host.Calls(HostOp::kFileGetSectionValue));
  EXPECT_STREQ("caller's", info_.szGuid);
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

TEST_F(DirInfoTest, FilesMissingPathsAndBadArgumentsFail) {
  LogCapture log;
  FakeHost host;
  std::ofstream(dir_.File("f")) << "x";
  EXPECT_EQ(-1, GetDirInfo(dir_.File("f").c_str(), &info_));
  EXPECT_EQ(-1, GetDirInfo(dir_.File("missing").c_str(), &info_));
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(-1, GetDirInfo(nullptr, &info_));
  EXPECT_EQ(-1, GetDirInfo(dir_.path().c_str(), nullptr));
  EXPECT_EQ(2, log.Count("quvaidx_folder:N Bad parameter."));
  log.Clear();
  EXPECT_EQ(-1, GetDirInfo(".", &info_));  // a directory with no '/'
  ASSERT_EQ(1u, log.lines().size());
  const std::string& text = log.lines()[0].text;
  EXPECT_EQ(0u, text.find("quvaidx_folder ("));
  EXPECT_NE(std::string::npos, text.find(") Failed to get dir path of ."));
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

}  // namespace
