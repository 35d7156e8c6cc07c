// Shared folders on the stand-in's share database, through the fake host.
#include "quvaidx/share_folder.h"

#include <errno.h>
#include <string.h>
#include <syslog.h>

#include <functional>
#include <string>

#include <gtest/gtest.h>

#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostEtc;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

// A share database with the share "video" at `path` with `status`.
void WriteShares(const HostEtc& etc, const std::string& path = "/vol1/video",
                 unsigned status = 0) {
  WriteFile(etc.File("shares.conf"), "[video]\npath = " + path + "\nstatus = " +
                                         std::to_string(status) + "\n");
}

unsigned Status(const char* name) {
  ShareRecord* record = nullptr;
  unsigned status = QUVAShareGet(name, &record) == 0 ? record->uStatus : ~0u;
  QUVAShareFree(record);
  return status;
}

TEST(IndexStatus, SetsOrClearsOnlyWhatDiffersAndFreesEveryRecord) {
  const struct {
    unsigned before;
    bool set;
    int updates;
    unsigned after;
  } cases[] = {
      {0x00, true, 1, 0x20}, {0x21, false, 1, 0x01}, {0x25, true, 0, 0x25}};
  for (const auto& c : cases) {
    HostEtc etc;
    WriteShares(etc, "/vol1/video", c.before);
    FakeHost host;
    EXPECT_EQ(0, c.set ? ShareIndexStatusSet("video")
                       : ShareIndexStatusClear("video"));
    EXPECT_EQ(c.updates, host.Calls(HostOp::kShareUpdate)) << c.before;
    EXPECT_EQ(0, host.OutstandingShareRecords());
    EXPECT_EQ(c.after, Status("video"));
  }
}

TEST(IndexStatus, MissingShareIsMinusOneAndFailedUpdateStillZero) {
  HostEtc etc;
  WriteShares(etc);
  LogCapture log;
  FakeHost host;
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
  for (const char* name : {"photo", "MUSIC", "vIdEo"})
    EXPECT_EQ(1, IsDefaultShare(name)) << name;
  for (const char* name : {"photos", "", "photo "})
    EXPECT_EQ(0, IsDefaultShare(name)) << name;
  EXPECT_EQ(0, IsDefaultShare(nullptr));
}

TEST(SharePath, ShareRelativePathsBecomeDiskPaths) {
  HostEtc etc;
  WriteShares(etc);
  FakeHost host;
  const struct {
    const char* path;
    int out_size;
    const char* out;  // "untouched": -1
  } cases[] = {{"/video/movies/a.mkv", 64, "/vol1/video/movies/a.mkv"},
               {"/video/a", 8, "/vol1/v"},  // cut to the out size
               {"/video/", 64, "/vol1/video"},
               {"/Video/a", 64, "untouched"},
               {"video/a", 64, "untouched"},  // not share-relative
               {"/video/a", 0, "untouched"}};
  for (const auto& c : cases) {
    char out[64] = "untouched";
    EXPECT_EQ(strcmp(c.out, "untouched") ? 0 : -1,
              QUVAIndexSharePathGet(c.path, out, c.out_size))
        << c.path;
    EXPECT_STREQ(c.out, out) << c.path;
  }
  EXPECT_EQ(-1, QUVAIndexSharePathGet(nullptr, nullptr, 64));
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

// A host may hand out a record even when the lookup fails: every caller
// releases it, so none leaks on a failed lookup either.
TEST(ShareRecords, ReleasedAfterAFailedLookupToo) {
  TempDir outside;
  HostEtc etc;
  WriteShares(etc);
  LogCapture log;
  FakeHost host;
  host.HandOutRecordsOnFailure();
  char out[64] = "untouched";
  DirInfo info = {};
  const struct {
    const char* call;
    std::function<int()> run;
    int result;
  } cases[] = {
      {"SharePath, no such share",
       [&] { return QUVAIndexSharePathGet("/music/a", out, sizeof out); }, -1},
      {"IndexStatusSet", [] { return ShareIndexStatusSet("music"); }, -1},
      {"GetDirInfo, outside the shares",
       [&] { return GetDirInfo(outside.path().c_str(), &info); }, 0},
      {"SharePath, host failure",
       [&] {
         host.Fail(HostOp::kShareGet, EIO);
         return QUVAIndexSharePathGet("/video/a", out, sizeof out);
       },
       -1}};
  for (const auto& c : cases) {
    EXPECT_EQ(c.result, c.run()) << c.call;
    EXPECT_EQ(0, host.OutstandingShareRecords()) << c.call;
  }
  EXPECT_STREQ("untouched", out);
}

TEST(DirInfo, GuidFromTheMapOnlyInsideAShare) {
  TempDir dir;
  DirInfo info = {};
  strcpy(info.szGuid, "caller's");
  HostEtc etc;
  WriteShares(etc);
  FakeHost host;
  EXPECT_EQ(0, GetDirInfo(dir.path().c_str(), &info));  // outside shares
  EXPECT_EQ(0, host.Calls(HostOp::kFileGetSectionValue));
  WriteShares(etc, dir.path());
  host.Fail(HostOp::kFileGetSectionValue, ENOENT);  // no map entry
  EXPECT_EQ(0, GetDirInfo(dir.path().c_str(), &info));
  EXPECT_EQ(1, host.Calls(HostOp::kFileGetSectionValue));
  EXPECT_STREQ("caller's", info.szGuid);
  host.Pass(HostOp::kFileGetSectionValue);
  host.AnswerSectionValue("6f1c-guid");
  ASSERT_EQ(0, GetDirInfo(dir.path().c_str(), &info));
  EXPECT_EQ(dir.path(), info.szPath);
  EXPECT_EQ(dir.path().substr(dir.path().rfind('/') + 1), info.szName);
  EXPECT_STREQ("6f1c-guid", info.szGuid);
  EXPECT_EQ(25u, strlen(info.szCTime));  // "Sat Mar  7 09:05:03 2015\n"
  EXPECT_EQ('\n', info.szMTime[24]);
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

TEST(DirInfo, FilesMissingPathsAndBadArgumentsFail) {
  TempDir dir;
  DirInfo info = {};
  LogCapture log;
  FakeHost host;
  quvaidx::test::WriteFile(dir.File("f"), "x");
  EXPECT_EQ(-1, GetDirInfo(dir.File("f").c_str(), &info));
  EXPECT_EQ(-1, GetDirInfo(dir.File("missing").c_str(), &info));
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(-1, GetDirInfo(nullptr, &info));
  EXPECT_EQ(-1, GetDirInfo(dir.path().c_str(), nullptr));
  EXPECT_EQ(2, log.Count("quvaidx_folder:N Bad parameter."));
  log.Clear();
  EXPECT_EQ(-1, GetDirInfo(".", &info));  // a directory with no '/'
  ASSERT_EQ(1u, log.lines().size());
  const std::string& text = log.lines()[0].text;
  EXPECT_EQ(0u, text.find("quvaidx_folder ("));
  EXPECT_NE(std::string::npos, text.find(") Failed to get dir path of ."));
  EXPECT_EQ(0, host.OutstandingShareRecords());
}

}  // namespace
