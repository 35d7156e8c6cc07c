// Shared folders through the fake host, which hands out a blank record even
// when a lookup fails: every caller must release it.
#include "quvaidx/share_folder.h"

#include <errno.h>
#include <string.h>
#include <syslog.h>

#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::HostOp;
using quvaidx::test::LogCapture;

// The share "video" at /vol1/video.
class ShareFolderTest : public ::testing::Test {
 protected:
  ShareFolderTest() {
    WriteShares("/vol1/video", 0);
    host_.HandOutRecordsOnFailure();
  }
  ~ShareFolderTest() override { EXPECT_EQ(host_.OutstandingShareRecords(), 0); }
  void WriteShares(const std::string& path, unsigned status) {
    quvaidx::test::WriteFile(etc_.File("shares.conf"),
                             "[video]\npath = " + path +
                                 "\nstatus = " + std::to_string(status) + "\n");
  }
  static unsigned Status() {
    ShareRecord* record = nullptr;
    unsigned status =
        QUVAShareGet("video", &record) == 0 ? record->uStatus : ~0u;
    QUVAShareFree(record);
    return status;
  }

  quvahost::test::HostEtc etc_;
  LogCapture log_;
  quvahost::test::FakeHost host_;
};

// Only a mark that differs is written; a missing share is -1, a failed
// update is logged and still 0 (the next scan asks again).
TEST_F(ShareFolderTest, IndexStatusSetsOrClearsOnlyWhatDiffers) {
  // Status before, set or clear, updates written, status after.
  const std::tuple<unsigned, bool, int, unsigned> cases[] = {
      {0x00, true, 1, 0x20},
      {0x21, false, 1, 0x01},
      {0x25, true, 0, 0x25},
      {0x04, false, 0, 0x04}};
  int updates = 0;
  for (const auto& [before, set, written, after] : cases) {
    WriteShares("/vol1/video", before);
    EXPECT_EQ(
        set ? ShareIndexStatusSet("video") : ShareIndexStatusClear("video"), 0);
    updates += written;
    EXPECT_EQ(host_.Calls(HostOp::kShareUpdate), updates) << before;
    EXPECT_EQ(Status(), after);
  }
  EXPECT_EQ(ShareIndexStatusSet("nope"), -1);
  EXPECT_EQ(ShareIndexStatusClear("nope"), -1);
  EXPECT_EQ(log_.Count("quvaidx_folder:N QUVAShareGet failed: nope"), 2);
  host_.Fail(HostOp::kShareUpdate, EACCES);
  EXPECT_EQ(ShareIndexStatusSet("video"), 0);
  EXPECT_EQ(log_.Count("quvaidx_folder:N QUVAShareUpdate failed[D]"), 1);
  host_.Fail(HostOp::kShareGet, EIO);
  EXPECT_EQ(ShareIndexStatusSet("video"), -1);
  for (const auto& line : log_.lines()) EXPECT_EQ(line.priority, LOG_ERR);
}

TEST_F(ShareFolderTest, DefaultSharesAreThreeNamesInAnyCase) {
  for (const char* name : {"photo", "MUSIC", "vIdEo"})
    EXPECT_EQ(IsDefaultShare(name), 1) << name;
  for (const char* name : {"photos", "", "photo ", "phot", "m@sic"})
    EXPECT_EQ(IsDefaultShare(name), 0) << name;
  EXPECT_EQ(IsDefaultShare(nullptr), 0);
}

TEST_F(ShareFolderTest, ShareRelativePathsBecomeDiskPaths) {
  // The path, the out size, what is written ("untouched": -1); a path
  // without a share name is not share-relative, the out size cuts.
  const std::tuple<const char*, int, const char*> cases[] = {
      {"/video/movies/a.mkv", 64, "/vol1/video/movies/a.mkv"},
      {"/video/a", 8, "/vol1/v"},
      {"/video/", 64, "/vol1/video"},
      {"/video", 64, "/vol1/video"},
      {"/Video/a", 64, "untouched"},
      {"/music/a", 64, "untouched"},
      {"video/a", 64, "untouched"},
      {"/video/a", 0, "untouched"}};
  for (const auto& [path, out_size, written] : cases) {
    char out[64] = "untouched";
    EXPECT_EQ(QUVAIndexSharePathGet(path, out, out_size),
              strcmp(written, "untouched") ? 0 : -1)
        << path;
    EXPECT_STREQ(out, written) << path;
  }
  EXPECT_EQ(QUVAIndexSharePathGet(nullptr, nullptr, 64), -1);
  host_.Fail(HostOp::kShareGet, EIO);
  char out[64] = "untouched";
  EXPECT_EQ(QUVAIndexSharePathGet("/video/a", out, sizeof out), -1);
  EXPECT_STREQ(out, "untouched");
}

// The guid comes from the map only inside a share, a missing entry leaving
// the caller's; only bad arguments and unresolvable paths are logged.
TEST_F(ShareFolderTest, DirInfoOfAFolder) {
  quvaidx::test::TempDir dir;
  DirInfo info = {};
  strcpy(info.szGuid, "caller's");
  EXPECT_EQ(GetDirInfo(dir.path().c_str(), &info), 0);  // outside shares
  EXPECT_EQ(host_.Calls(HostOp::kFileGetSectionValue), 0);
  WriteShares(dir.path(), 0);
  host_.Fail(HostOp::kFileGetSectionValue, ENOENT);  // no map entry
  EXPECT_EQ(GetDirInfo(dir.path().c_str(), &info), 0);
  EXPECT_EQ(host_.Calls(HostOp::kFileGetSectionValue), 1);
  EXPECT_STREQ(info.szGuid, "caller's");
  host_.Pass(HostOp::kFileGetSectionValue);
  host_.AnswerSectionValue("6f1c-guid");
  ASSERT_EQ(GetDirInfo(dir.path().c_str(), &info), 0);
  EXPECT_EQ(info.szPath, dir.path());
  EXPECT_EQ(info.szName, dir.path().substr(dir.path().rfind('/') + 1));
  EXPECT_STREQ(info.szGuid, "6f1c-guid");
  EXPECT_EQ(strlen(info.szCTime), 25u);  // "Sat Mar  7 09:05:03 2015\n"
  EXPECT_EQ(info.szMTime[24], '\n');
  quvaidx::test::WriteFile(dir.File("f"), "x");
  EXPECT_EQ(GetDirInfo(dir.File("f").c_str(), &info), -1);
  EXPECT_EQ(GetDirInfo(dir.File("missing").c_str(), &info), -1);
  EXPECT_TRUE(log_.lines().empty());
  EXPECT_EQ(GetDirInfo(nullptr, &info), -1);
  EXPECT_EQ(GetDirInfo(dir.path().c_str(), nullptr), -1);
  EXPECT_EQ(log_.Count("quvaidx_folder:N Bad parameter."), 2);
  log_.Clear();
  EXPECT_EQ(GetDirInfo(".", &info), -1);  // a directory with no '/'
  ASSERT_EQ(log_.lines().size(), 1u);
  EXPECT_EQ(log_.lines()[0].text.find("quvaidx_folder ("), 0u);
  EXPECT_NE(log_.lines()[0].text.find(") Failed to get dir path of ."),
            std::string::npos);
}

}  // namespace
