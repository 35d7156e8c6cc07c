#include <errno.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "support/fake_host.h"

namespace quvahost::test {
namespace {

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

TEST(EaDirTest, PathOfFileIsHiddenDirInItsFolder) {
  const struct {
    const char* file;
    const char* ea_dir;  // "untouched": EINVAL
  } cases[] = {{"/x.jpg", "/.quvameta/x.jpg"},
               {"x.jpg", ".quvameta/x.jpg"},
               {"/share/a/dir/", "/share/a/.quvameta/dir"},
               {"/", "untouched"},
               {"/share/a/..", "untouched"},
               {"/share/a/.quvameta", "untouched"},
               {"/share/a/.quvameta/x.jpg", "untouched"}};
  for (const auto& c : cases) {
    char buffer[4096] = "untouched";
    bool ok = strcmp(c.ea_dir, "untouched") != 0;
    EXPECT_EQ(QUVAEADirPath(0, c.file, buffer, sizeof buffer), ok ? 0 : -1);
    EXPECT_STREQ(buffer, c.ea_dir);
    EXPECT_TRUE(ok || QLIBCErrGet() == EINVAL) << c.file;
  }
}

TEST(EaDirTest, BufferBoundsAndBadArguments) {
  const char* file = "/share/a/x.jpg";  // EA dir: 24 characters
  char buffer[32];
  memset(buffer, '#', sizeof buffer);
  EXPECT_EQ(QUVAEADirPath(0, file, buffer, 24), -1);
  EXPECT_EQ(QLIBCErrGet(), ERANGE);
  for (char c : buffer) EXPECT_EQ(c, '#');
  EXPECT_EQ(QUVAEADirPath(0, file, buffer, 25), 0);
  EXPECT_STREQ(buffer, "/share/a/.quvameta/x.jpg");
  EXPECT_EQ(buffer[25], '#');
  EXPECT_EQ(QUVAEADirPath(1, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", nullptr, sizeof buffer), -1);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, -5), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

TEST(EaDirTest, MakeDirCreatesOnlyWhatIsMissing) {
  TempDir dir;
  std::string ea = dir.File(".quvameta/x.jpg");
  EXPECT_EQ(QUVAEAMKDir(1, ea.c_str()), 0);
  EXPECT_TRUE(IsDir(ea));
  EXPECT_EQ(QUVAEAMKDir(1, ea.c_str()), 0)
      << "an existing directory is success";
  ASSERT_EQ(chmod(dir.File(".quvameta").c_str(), 0700), 0);
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/y.mp4").c_str()), 0);
  struct stat st;
  ASSERT_EQ(stat(dir.File(".quvameta").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u) << "existing hidden dir left alone";
  // Never the media folder.
  EXPECT_EQ(QUVAEAMKDir(1, dir.File("missing/.quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_FALSE(IsDir(dir.File("missing")));
}

TEST(EaDirTest, WhatStandsInPlaceOfTheHiddenDir) {
  TempDir dir;
  ASSERT_EQ(mkdir(dir.File("a").c_str(), 0777), 0);
  WriteFile(dir.File("a/.quvameta"), "someone's data");
  EXPECT_EQ(QUVAEAMKDir(1, dir.File("a/.quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOTDIR);
  EXPECT_EQ(ReadFile(dir.File("a/.quvameta")), "someone's data");
  ASSERT_EQ(mkdir(dir.File("real").c_str(), 0777), 0);
  ASSERT_EQ(symlink(dir.File("real").c_str(), dir.File(".quvameta").c_str()),
            0);
  EXPECT_EQ(QUVAEAMKDir(1, dir.File(".quvameta/x.jpg").c_str()), 0);
  EXPECT_TRUE(IsDir(dir.File("real/x.jpg")));
}

TEST(EaDirTest, MakeDirRefusesPathsThatAreNotEaDirectories) {
  TempDir dir;
  for (std::string path : {dir.File("plain/x.jpg"), dir.File(".quvameta"),
                           dir.File(".quvameta/.."), std::string("x.jpg")}) {
    EXPECT_EQ(QUVAEAMKDir(1, path.c_str()), -1) << path;
    EXPECT_EQ(QLIBCErrGet(), EINVAL);
  }
  EXPECT_EQ(QUVAEAMKDir(0, dir.File(".quvameta/x.jpg").c_str()), -1);
  EXPECT_EQ(QUVAEAMKDir(1, nullptr), -1);
  EXPECT_FALSE(IsDir(dir.File("plain")));
  EXPECT_FALSE(IsDir(dir.File(".quvameta")));
}

TEST(EaDirTest, HiddenDirNameIsRecognisedExactly) {
  EXPECT_EQ(QUVAEAIsHiddenDir(QUVA_EA_HIDDEN_DIR), 1);
  for (const char* name : {".QUVAMETA", ".quvameta2", ""})
    EXPECT_EQ(QUVAEAIsHiddenDir(name), 0) << name;
  EXPECT_EQ(QUVAEAIsHiddenDir(nullptr), 0);
}

}  // namespace
}  // namespace quvahost::test
