// Metadata side directories: host failures through the fake host, then the
// real stand-in on a real directory tree.
#include "quvaidx/ea_file.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "quvaidx/path_rules.h"
#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;
using quvaidx::test::WriteFile;

bool IsLink(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISLNK(st.st_mode);
}

// Bad parameters never reach the host; a host failure is logged with the
// host's error by every caller.
TEST(EADirHostFailure, BadParametersNeverReachTheHostAndFailuresAreLogged) {
  LogCapture log;
  FakeHost host;
  char buf[64];
  for (auto* fn : {MakeEADir, GetEADirPath}) {
    EXPECT_EQ(-1, fn(nullptr, buf, sizeof(buf)));
    EXPECT_EQ(-1, fn("/v/a.jpg", nullptr, 16));
    EXPECT_EQ(-1, fn("/v/a.jpg", buf, 0));
  }
  EXPECT_EQ(6, log.Count("quvaidx_eafile:N Bad parameters."));
  EXPECT_EQ(0, host.Calls(HostOp::kEADirPath));
  host.Fail(HostOp::kEADirPath, ENAMETOOLONG);
  EXPECT_EQ(-1, MakeEADir("/v/a.jpg", buf, sizeof(buf)));
  EXPECT_EQ(-1, RemoveEAFile2("/v/a.jpg", "n1", "n2"));
  EXPECT_EQ(-1, GetEAFilePath("/v/a.jpg", "n1", "n2", buf, sizeof(buf)));
  EXPECT_EQ(-1, IsEAFileExist2("/v/a.jpg", "n1", "n2"));
  char line[256];
  snprintf(line, sizeof(line),
           "quvaidx_eafile:N QUVAEADirPath error [0x0024 %s:%d] on /v/a.jpg",
           QLIBCErrorGetFile(), QLIBCErrorGetLine());
  EXPECT_EQ(4, log.Count(line)) << log.lines().back().text;
  for (const auto& logged : log.lines()) EXPECT_EQ(LOG_ERR, logged.priority);
  EXPECT_EQ(-1, GetEADirPath("/v/a.jpg", buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Get ea dir path error. file path: "
                         "/v/a.jpg"));
}

TEST(EADirMaking, FailuresAreLoggedAndExistingDirNeedsNoCall) {
  TempDir dir;
  const std::string ea = dir.File(".quvameta/a.jpg");
  LogCapture log;
  FakeHost host;
  host.Fail(HostOp::kEAMKDir, EACCES);
  const std::string media = dir.File("a.jpg");
  char buf[4096];
  EXPECT_EQ(-1, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Make ea dir path error. eaDir "
                         "path: " +
                         ea));
  host.Pass(HostOp::kEAMKDir);
  EXPECT_EQ(0, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(ea, buf);
  EXPECT_EQ(0, GetEADirPath(media.c_str(), buf, sizeof(buf)));
  EXPECT_EQ(2, host.Calls(HostOp::kEAMKDir)) << "made an existing directory";
  EXPECT_EQ(-1, MakeEADir(dir.File("missing/a.jpg").c_str(), buf, sizeof(buf)));
  EXPECT_EQ(1, log.Count("quvaidx_eafile:N Cannot mkdir " +
                         dir.File("missing/.quvameta") + ", error:2"));
}

// The real stand-in: the EA directory of <dir>/a.jpg is <dir>/.quvameta/a.jpg.
class RealTree : public ::testing::Test {
 protected:
  void SetUp() override { WriteFile(media_, "jpeg"); }
  TempDir dir_, outside_;
  std::string media_ = dir_.File("a.jpg"), hidden_ = dir_.File(".quvameta"),
              ea_ = hidden_ + "/a.jpg";
};

TEST_F(RealTree, BothFunctionsCreateTheDirectoriesAndKeepItems) {
  for (auto* fn : {MakeEADir, GetEADirPath}) {
    char buf[4096];
    ASSERT_EQ(0, fn(media_.c_str(), buf, sizeof(buf)));
    EXPECT_EQ(ea_, buf);
    EXPECT_EQ(1, IsDirExist(ea_.c_str()));
    WriteFile(ea_ + "/thumb", "data");
    EXPECT_EQ(0, fn(media_.c_str(), buf, sizeof(buf)));
    EXPECT_EQ(1, IsFileExist((ea_ + "/thumb").c_str(), nullptr));
    ASSERT_EQ(0, unlink((ea_ + "/thumb").c_str()));
    ASSERT_EQ(0, rmdir(ea_.c_str()));
  }
}

// A file in the way is replaced, a link to a file too (its target survives),
// a link to a directory is kept.
TEST_F(RealTree, MakeEADirReplacesNonDirectoriesButNothingBeyondThem) {
  const std::string file = outside_.File("victim");
  const std::string dir = outside_.File("elsewhere");
  WriteFile(file, "keep me");
  mkdir(dir.c_str(), 0755);
  for (const std::string& link_to : {std::string(), file, dir}) {
    SCOPED_TRACE(link_to);
    if (link_to.empty()) {
      WriteFile(hidden_, "in the way");
    } else {
      mkdir(hidden_.c_str(), 0755);
      ASSERT_EQ(0, symlink(link_to.c_str(), ea_.c_str()));
    }
    char buf[4096];
    ASSERT_EQ(0, MakeEADir(media_.c_str(), buf, sizeof(buf)));
    EXPECT_EQ(1, IsDirExist(ea_.c_str()));
    EXPECT_EQ(link_to == dir, IsLink(ea_));
    EXPECT_EQ(1, IsFileExist(file.c_str(), nullptr)) << "link target lost";
    unlink(ea_.c_str());
    rmdir(ea_.c_str());
    rmdir(hidden_.c_str());
  }
}

TEST_F(RealTree, ItemsArePreferredInOrderAndNeedTwoBytesToCount) {
  char buf[4096];
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf, sizeof(buf)));
  mkdir((ea_ + "/dir_item").c_str(), 0755);
  WriteFile(ea_ + "/one", "1");
  WriteFile(ea_ + "/big", "12345");
  WriteFile(ea_ + "/two", "12");
  const char* n1 = "big";
  int64_t size = -1;
  EXPECT_EQ(n1, IsEAFileExist(ea_.c_str(), &size, n1, "two"));  // pointer kept
  EXPECT_EQ(5, size);
  EXPECT_STREQ("two", IsEAFileExist(ea_.c_str(), &size, "dir_item", "two"));
  EXPECT_STREQ("one", IsEAFileExist(ea_.c_str(), &size, "one", "big"));
  EXPECT_EQ(1, size);
  const struct {
    const char *n1, *n2, *path;          // path null: not present
  } cases[] = {{"one", "big", nullptr},  // a 1-byte item hides the big one
               {"none", "two", "two"},
               {"dir_item", "none", nullptr}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.n1);
    char out[4096] = "untouched";
    EXPECT_EQ(c.path != nullptr, IsEAFileExist2(media_.c_str(), c.n1, c.n2));
    EXPECT_EQ(c.path ? 0 : -1,
              GetEAFilePath(media_.c_str(), c.n1, c.n2, out, sizeof(out)));
    EXPECT_EQ(c.path ? ea_ + "/" + c.path : "untouched", out);
  }
  char cut[8];
  EXPECT_EQ(0, GetEAFilePath(media_.c_str(), "big", nullptr, cut, sizeof(cut)));
  EXPECT_EQ(std::string(ea_, 0, 7), cut);
  EXPECT_EQ(-1, GetEAFilePath(media_.c_str(), "big", nullptr, cut, 0));
}

TEST_F(RealTree, RemoveCountsWhatWasThereAndSparesDirectories) {
  char buf[4096];
  ASSERT_EQ(0, MakeEADir(media_.c_str(), buf, sizeof(buf)));
  mkdir((ea_ + "/d").c_str(), 0755);
  for (int removed : {2, 1, 0}) {  // both items, the second, none
    if (removed == 2) WriteFile(ea_ + "/x", "1");
    if (removed >= 1) WriteFile(ea_ + "/y", "1");
    EXPECT_EQ(removed, RemoveEAFile2(media_.c_str(), "x", "y"));
    EXPECT_EQ(0, IsFileExist((ea_ + "/y").c_str(), nullptr));
  }
  EXPECT_EQ(0, RemoveEAFile(ea_.c_str(), "d", nullptr));
  EXPECT_EQ(1, IsDirExist((ea_ + "/d").c_str()));
  EXPECT_EQ(0, RemoveEAFile(nullptr, "x", "y"));
}

// An item path too long for the 4096-byte buffer, whose cut prefix names
// another, existing file: it must be neither found nor removed.
TEST_F(RealTree, OverlongItemPathNeverTouchesTheFileItsCutNames) {
  const std::string victim = dir_.File("victim");
  WriteFile(victim, "precious");
  std::string ea_dir = dir_.path();
  while (ea_dir.size() < 4088) ea_dir += 4088 - ea_dir.size() == 1 ? "/" : "/.";
  ASSERT_EQ(4095u, ea_dir.size() + 7);  // ea_dir + "/victim" fills 4095 chars
  EXPECT_EQ(nullptr,
            IsEAFileExist(ea_dir.c_str(), nullptr, "victimXYZ", nullptr));
  EXPECT_EQ(0, RemoveEAFile(ea_dir.c_str(), "victimXYZ", "victim_long_name"));
  EXPECT_EQ(1, IsFileExist(victim.c_str(), nullptr));
  EXPECT_STREQ("victim",
               IsEAFileExist(ea_dir.c_str(), nullptr, "victim", nullptr));
}

}  // namespace
