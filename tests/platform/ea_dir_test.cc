#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

TEST(EaDirTest, PathOfFileIsHiddenDirInItsFolder) {
  struct Case {
    const char* file;
    const char* ea_dir;  // null: no EA directory (EINVAL)
  } cases[] = {
      {"/share/a/x.jpg", "/share/a/.quvameta/x.jpg"},
      {"/x.jpg", "/.quvameta/x.jpg"},
      {"x.jpg", ".quvameta/x.jpg"},
      {"/share/a/dir/", "/share/a/.quvameta/dir"},
      {"/share/a/.hidden", "/share/a/.quvameta/.hidden"},
      {"/share/a/b c.mp4", "/share/a/.quvameta/b c.mp4"},
      {"/", nullptr},
      {"", nullptr},
      {"/share/a/.", nullptr},
      {"/share/a/..", nullptr},
      {"/share/a/.quvameta", nullptr},
      {"/share/a/.quvameta/x.jpg", nullptr},
      {"/share/a/.quvameta/x.jpg/thumb.jpg", nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.file);
    char buffer[4096] = "untouched";
    int result = QUVAEADirPath(0, c.file, buffer, sizeof buffer);
    if (c.ea_dir == nullptr) {
      EXPECT_EQ(result, -1);
      EXPECT_EQ(QLIBCErrGet(), EINVAL);
      EXPECT_STREQ(buffer, "untouched");
    } else {
      EXPECT_EQ(result, 0);
      EXPECT_STREQ(buffer, c.ea_dir);
    }
  }
}

TEST(EaDirTest, TooSmallBufferFailsWithoutWritingPastIt) {
  const char* file = "/share/a/x.jpg";  // EA dir: 24 characters
  char buffer[32];
  memset(buffer, '#', sizeof buffer);
  EXPECT_EQ(QUVAEADirPath(0, file, buffer, 24), -1);
  EXPECT_EQ(QLIBCErrGet(), ERANGE);
  for (char c : buffer) EXPECT_EQ(c, '#');
  EXPECT_EQ(QUVAEADirPath(0, file, buffer, 25), 0);
  EXPECT_STREQ(buffer, "/share/a/.quvameta/x.jpg");
  EXPECT_EQ(buffer[25], '#');
}

TEST(EaDirTest, BadArgumentsFail) {
  char buffer[64];
  EXPECT_EQ(QUVAEADirPath(1, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, nullptr, buffer, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", nullptr, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, 0), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, -5), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

TEST(EaDirTest, MakeDirCreatesHiddenAndEaDirectory) {
  TempDir dir;
  std::string file = dir.File("x.jpg");
  char ea[4096];
  ASSERT_EQ(QUVAEADirPath(0, file.c_str(), ea, sizeof ea), 0);
  EXPECT_EQ(QUVAEAMKDir(1, ea), 0);
  EXPECT_TRUE(IsDir(dir.File(".quvameta")));
  EXPECT_TRUE(IsDir(ea));
  EXPECT_EQ(QUVAEAMKDir(1, ea), 0) << "an existing directory is success";
}

TEST(EaDirTest, MakeDirCreatesOnlyTheMissingEaDirectory) {
  TempDir dir;
  ASSERT_EQ(mkdir(dir.File(".quvameta").c_str(), 0700), 0);
  std::string ea = dir.File(".quvameta/y.mp4");
  EXPECT_EQ(QUVAEAMKDir(1, ea.c_str()), 0);
  EXPECT_TRUE(IsDir(ea));
  struct stat st;
  ASSERT_EQ(stat(dir.File(".quvameta").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u) << "existing hidden dir left alone";
}

TEST(EaDirTest, MakeDirNeverCreatesTheMediaFolder) {
  TempDir dir;
  std::string ea = dir.File("missing/.quvameta/x.jpg");
  EXPECT_EQ(QUVAEAMKDir(1, ea.c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_FALSE(IsDir(dir.File("missing")));
}

TEST(EaDirTest, FileInTheWayIsKeptAndReported) {
  TempDir dir;
  WriteFile(dir.File(".quvameta"), "someone's data");
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOTDIR);
  EXPECT_EQ(ReadFile(dir.File(".quvameta")), "someone's data");
}

TEST(EaDirTest, LinkToDirectoryCountsAsDirectory) {
  TempDir dir;
  ASSERT_EQ(mkdir(dir.File("real").c_str(), 0777), 0);
  ASSERT_EQ(symlink(dir.File("real").c_str(), dir.File(".quvameta").c_str()),
            0);
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/x.jpg").c_str()), 0);
  EXPECT_TRUE(IsDir(dir.File("real/x.jpg")));
}

TEST(EaDirTest, MakeDirRefusesPathsThatAreNotEaDirectories) {
  TempDir dir;
  struct Case {
    int option;
    std::string path;
  } cases[] = {
      {1, dir.File("plain/x.jpg")},
      {1, dir.File(".quvameta")},
      {1, dir.File(".quvameta/..")},
      {1, dir.File(".quvameta/.quvameta")},
      {1, dir.File(".quvameta/x/.quvameta/y")},
      {1, "x.jpg"},
      {0, dir.File(".quvameta/x.jpg")},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path);
    EXPECT_EQ(QUVAEAMKDir(c.option, c.path.c_str()), -1);
    EXPECT_EQ(QLIBCErrGet(), EINVAL);
  }
  EXPECT_EQ(QUVAEAMKDir(1, nullptr), -1);
  EXPECT_FALSE(IsDir(dir.File("plain")));
  EXPECT_FALSE(IsDir(dir.File(".quvameta")));
}

TEST(EaDirTest, HiddenDirNameIsRecognisedExactly) {
  EXPECT_EQ(QUVAEAIsHiddenDir(".quvameta"), 1);
  EXPECT_EQ(QUVAEAIsHiddenDir(QUVA_EA_HIDDEN_DIR), 1);
  for (const char* name : {".QUVAMETA", "quvameta", ".quvameta2", "", "."}) {
    EXPECT_EQ(QUVAEAIsHiddenDir(name), 0) << name;
  }
  EXPECT_EQ(QUVAEAIsHiddenDir(nullptr), 0);
}

}  // namespace
}  // namespace quvahost::test
