// Canonical paths, non-replacing renames and head trimming on real files.
#include <dirent.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

namespace {

using quvaidx::test::kNobody;
using quvaidx::test::LogCapture;
using quvaidx::test::RunUnprivileged;
using quvaidx::test::TempDir;

std::string ReadFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream(path) << text;
}

int EntriesIn(const std::string& dir) {
  int count = 0;
  DIR* d = opendir(dir.c_str());
  while (struct dirent* e = readdir(d)) count += e->d_name[0] != '.';
  closedir(d);
  return count;
}

TEST(GetRealPathTest, ResolvesOrCopies) {
  TempDir dir;
  ASSERT_EQ(mkdir(dir.File("a").c_str(), 0755), 0);
  ASSERT_EQ(symlink("a", dir.File("link").c_str()), 0);
  char* real = GetRealPath((dir.File("link") + "/../a/.").c_str());
  ASSERT_NE(real, nullptr);
  char* expected = realpath(dir.File("a").c_str(), nullptr);
  EXPECT_STREQ(real, expected);
  free(real);
  free(expected);
  char* copy = GetRealPath("relative/missing/../x");
  EXPECT_STREQ(copy, "relative/missing/../x");
  free(copy);
  LogCapture log;
  EXPECT_EQ(GetRealPath(nullptr), nullptr);
  EXPECT_EQ(log.lines().size(), 1u);
}

class RenameFileTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string source_ = dir_.File("source");
  std::string destination_ = dir_.File("destination");
};

TEST_F(RenameFileTest, MovesTheSource) {
  WriteFile(source_, "s");
  EXPECT_EQ(RenameFile(source_.c_str(), destination_.c_str()), 0);
  EXPECT_EQ(ReadFile(destination_), "s");
  EXPECT_NE(access(source_.c_str(), F_OK), 0);
}

TEST_F(RenameFileTest, ExistingDestinationIsKeptAndSourceStays) {
  WriteFile(source_, "s");
  WriteFile(destination_, "d");
  EXPECT_EQ(RenameFile(source_.c_str(), destination_.c_str()), 0);
  EXPECT_EQ(ReadFile(source_), "s");
  EXPECT_EQ(ReadFile(destination_), "d");
}

TEST_F(RenameFileTest, DestinationThatEscapesTheExistenceTestIsKept) {
  // A dangling link is invisible to the existence test, like a destination
  // created just after it: the rename itself must still not replace it.
  WriteFile(source_, "s");
  ASSERT_EQ(symlink("nowhere", destination_.c_str()), 0);
  EXPECT_EQ(RenameFile(source_.c_str(), destination_.c_str()), 0);
  EXPECT_EQ(ReadFile(source_), "s");
  char target[64] = "";
  ASSERT_GT(readlink(destination_.c_str(), target, sizeof(target) - 1), 0);
  EXPECT_STREQ(target, "nowhere");
}

TEST_F(RenameFileTest, MissingSourceFailsQuietly) {
  LogCapture log;
  EXPECT_EQ(RenameFile(source_.c_str(), destination_.c_str()), -1);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(RenameFileTest, MissingDestinationFolderFailsAtOnce) {
  LogCapture log;
  WriteFile(source_, "s");
  std::string nowhere = dir_.File("no/such/dir");
  EXPECT_EQ(RenameFile(source_.c_str(), nowhere.c_str()), -1);
  EXPECT_EQ(log.Normalized(),
            (std::vector<std::string>{"quvaidx_system:N [Error] rename: " +
                                      source_ + " -> " + nowhere}));
  EXPECT_EQ(ReadFile(source_), "s");
}

TEST_F(RenameFileTest, PersistentFailureStopsAfterSixteenTries) {
  LogCapture log;
  WriteFile(source_, "s");
  ASSERT_EQ(mkdir(destination_.c_str(), 0755), 0);
  rmdir(destination_.c_str());
  // A directory cannot be renamed into its own subdirectory: EINVAL every
  // time.
  ASSERT_EQ(mkdir(dir_.File("d").c_str(), 0755), 0);
  std::string inside = dir_.File("d/sub");
  EXPECT_EQ(RenameFile(dir_.File("d").c_str(), inside.c_str()), -1);
  EXPECT_EQ(log.Count("quvaidx_system:N [Error] rename reach max retry: " +
                      dir_.File("d") + " -> " + inside),
            1);
}

class TrimTest : public ::testing::Test {
 protected:
  TempDir dir_;
  std::string file_ = dir_.File("q.queue");
};

TEST_F(TrimTest, DropsTheFirstLines) {
  const struct {
    std::string text;
    int n;
    std::string left;
  } kCases[] = {
      {"a\nb\nc\n", 1, "b\nc\n"},   {"a\nb\nc\n", 0, "a\nb\nc\n"},
      {"a\nb\nc\n", -4, "a\nb\nc\n"}, {"a\nb\nc\n", 3, ""},
      {"a\nb\nc\n", 99, ""},        {"a\nb\nlast", 2, "last"},
      {"", 5, ""},                  {"\n\nx\n", 2, "x\n"},
  };
  for (const auto& c : kCases) {
    WriteFile(file_, c.text);
    ASSERT_EQ(FileRemoveHeadingLine(file_.c_str(), c.n), 0) << c.text;
    EXPECT_EQ(ReadFile(file_), c.left) << c.text << " n=" << c.n;
  }
  EXPECT_EQ(EntriesIn(dir_.path()), 1);  // no temporary file left
}

TEST_F(TrimTest, LongLinesAcrossCopyBlocks) {
  std::string first(200000, 'f');
  std::string second(70000, 's');
  WriteFile(file_, first + "\n" + second + "\n");
  ASSERT_EQ(FileRemoveHeadingLine(file_.c_str(), 1), 0);
  EXPECT_EQ(ReadFile(file_), second + "\n");
}

TEST_F(TrimTest, OwnerAndModeAreKept) {
  WriteFile(file_, "a\nb\n");
  ASSERT_EQ(chmod(file_.c_str(), 02640), 0);
  if (getuid() == 0) {
    ASSERT_EQ(chown(file_.c_str(), kNobody, kNobody), 0);
  }
  struct stat before;
  stat(file_.c_str(), &before);
  ASSERT_EQ(FileRemoveHeadingLine(file_.c_str(), 5), 0);
  struct stat after;
  stat(file_.c_str(), &after);
  EXPECT_EQ(after.st_mode & 07777, before.st_mode & 07777);
  EXPECT_EQ(after.st_uid, before.st_uid);
  EXPECT_EQ(after.st_gid, before.st_gid);
  EXPECT_EQ(after.st_size, 0);
}

TEST_F(TrimTest, AnotherUsersFileIsLeftUnchanged) {
  if (getuid() != 0) {
    GTEST_SKIP() << "needs root to own a file as another user";
  }
  WriteFile(file_, "a\nb\n");
  chmod(file_.c_str(), 0644);
  chmod(dir_.path().c_str(), 0777);  // the trimmer may create its copy
  int result = RunUnprivileged(
      [&] { return FileRemoveHeadingLine(file_.c_str(), 1) == -1 ? 0 : 1; });
  EXPECT_EQ(result, 0);
  EXPECT_EQ(ReadFile(file_), "a\nb\n");
  EXPECT_EQ(EntriesIn(dir_.path()), 1);  // its temporary file removed
}

TEST_F(TrimTest, MissingFileOrFolderFails) {
  EXPECT_EQ(FileRemoveHeadingLine(file_.c_str(), 1), -1);
  EXPECT_EQ(FileRemoveHeadingLine(dir_.path().c_str(), 1), -1);
  EXPECT_EQ(FileRemoveHeadingLine(nullptr, 1), -1);
  EXPECT_EQ(EntriesIn(dir_.path()), 0);
}

}  // namespace
