#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <tuple>

#include "support/fake_host.h"

namespace quvahost::test {
namespace {

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The path is written only whole: one that does not fit leaves the buffer
// as it was.
TEST(EaDirTest, PathOfFileIsHiddenDirInItsFolderWrittenOnlyWhole) {
  // File, buffer size, the buffer after ("untouched": failed), errno.
  const std::tuple<const char*, int, const char*, int> cases[] = {
      {"/x.jpg", 64, "/.quvameta/x.jpg", 0},
      {"x.jpg", 64, ".quvameta/x.jpg", 0},
      {"/share/a/dir//", 64, "/share/a/.quvameta/dir", 0},
      {"/share/a/x.jpg", 25, "/share/a/.quvameta/x.jpg", 0},
      {"/share/a/x.jpg", 24, "untouched", ERANGE},
      {"/", 64, "untouched", EINVAL},
      {"/share/a/..", 64, "untouched", EINVAL},
      {"/share/a/.quvameta", 64, "untouched", EINVAL},
      {"/share/a/.quvameta/x.jpg", 64, "untouched", EINVAL},
      {"/a/b", -5, "untouched", EINVAL}};
  for (const auto& [file, size, ea_dir, error] : cases) {
    SCOPED_TRACE(file);
    char buffer[65] = "untouched";
    memset(buffer + 10, '#', sizeof buffer - 10);
    EXPECT_EQ(QUVAEADirPath(0, file, buffer, size), error == 0 ? 0 : -1);
    EXPECT_STREQ(buffer, ea_dir);
    EXPECT_EQ(buffer[size < 0 ? 64 : size], '#');
    EXPECT_TRUE(error == 0 || QLIBCErrGet() == error);
  }
  char buffer[64];
  EXPECT_EQ(QUVAEADirPath(1, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", nullptr, sizeof buffer), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// Only what is missing is made (never the media folder, never over a file);
// an existing one keeps its mode; paths of no EA directory are refused.
TEST(EaDirTest, MakeDirCreatesOnlyWhatIsMissing) {
  TempDir dir;
  std::string ea = dir.File(".quvameta/x.jpg");
  EXPECT_EQ(QUVAEAMKDir(1, (ea + "/").c_str()), 0);
  EXPECT_TRUE(IsDir(ea));
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/x").c_str()), 0);
  EXPECT_TRUE(IsDir(dir.File(".quvameta/x")));
  EXPECT_EQ(QUVAEAMKDir(1, ea.c_str()), 0);
  ASSERT_EQ(chmod(dir.File(".quvameta").c_str(), 0700), 0);
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/y.mp4").c_str()), 0);
  struct stat st;
  ASSERT_EQ(stat(dir.File(".quvameta").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
  EXPECT_EQ(QUVAEAMKDir(1, dir.File("missing/.quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  ASSERT_EQ(mkdir(dir.File("a").c_str(), 0777), 0);
  WriteFile(dir.File("a/.quvameta"), "someone's data");
  EXPECT_EQ(QUVAEAMKDir(1, dir.File("a/.quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOTDIR);
  EXPECT_EQ(ReadFile(dir.File("a/.quvameta")), "someone's data");
  for (std::string path :
       {dir.File("plain/x.jpg"), dir.File("b/.quvameta"),
        dir.File(".quvameta/.quvameta"), dir.File("b/.quvameta/.."),
        dir.File(".quvameta/b/.quvameta/x"), std::string("x.jpg")}) {
    EXPECT_EQ(QUVAEAMKDir(1, path.c_str()), -1) << path;
    EXPECT_EQ(QLIBCErrGet(), EINVAL);
  }
  EXPECT_EQ(QUVAEAMKDir(0, dir.File("b/.quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QUVAEAMKDir(1, nullptr), -1);
  EXPECT_FALSE(IsDir(dir.File("plain")) || IsDir(dir.File("missing")) ||
               IsDir(dir.File("b")));
  EXPECT_EQ(QUVAEAIsHiddenDir(QUVA_EA_HIDDEN_DIR), 1);
  for (const char* name :
       {".QUVAMETA", ".quvameta2", "", static_cast<const char*>(nullptr)})
    EXPECT_EQ(QUVAEAIsHiddenDir(name), 0) << (name ? name : "null");
}

}  // namespace
}  // namespace quvahost::test
