// Canonical paths, non-replacing renames and head trimming on real files.
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <iterator>
#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "quvaidx/system.h"
#include "support/fake_sleep.h"
#include "support/fd_check.h"
#include "support/log_capture.h"
#include "support/unprivileged.h"

namespace quvaidx::test {
namespace {

// Every entry, hidden ones too: a temporary file left behind shows.
int EntriesIn(const std::string& dir) {
  using std::filesystem::directory_iterator;
  return std::distance(directory_iterator(dir), directory_iterator());
}

class FileTest : public ::testing::Test {
 protected:
  int Rename() { return RenameFile(source_.c_str(), destination_.c_str()); }
  TempDir dir_;
  std::string source_ = dir_.File("source");
  std::string destination_ = dir_.File("destination");
};

// Links and dots are resolved; a path that does not resolve is handed back
// as it came; only null fails, with a line. The caller frees the result.
TEST_F(FileTest, RealPathResolvesOrKeepsThePath) {
  char real_dir[PATH_MAX];
  ASSERT_NE(realpath(dir_.path().c_str(), real_dir), nullptr);
  ASSERT_EQ(symlink(".", dir_.File("here").c_str()), 0);
  const std::pair<std::string, std::string> cases[] = {
      {dir_.File("here/./here/"), real_dir},
      {dir_.File("missing/../x"), dir_.File("missing/../x")}};
  for (const auto& [path, expected] : cases) {
    char* got = GetRealPath(path.c_str());
    ASSERT_NE(got, nullptr) << path;
    EXPECT_EQ(got, expected);
    free(got);
  }
  LogCapture log;
  EXPECT_EQ(GetRealPath(nullptr), nullptr);
  EXPECT_EQ(log.Count("quvaidx_system:N [Error] GetRealPath: (null)"), 1);
}

// Never over a destination, even a dangling link the existence test misses.
// A missing source fails quietly, a missing folder at once, a persistent
// failure (a folder into itself) after sixteen tries, each with a yield.
TEST_F(FileTest, RenameNeverReplacesTheDestination) {
  LogCapture log;
  FakeSleep sleep;
  EXPECT_EQ(Rename(), -1);
  EXPECT_TRUE(log.lines().empty());
  WriteFile(source_, "s");
  EXPECT_EQ(Rename(), 0);
  EXPECT_EQ(ReadFile(destination_), "s");
  EXPECT_NE(access(source_.c_str(), F_OK), 0);
  WriteFile(source_, "t");
  EXPECT_EQ(Rename(), 0);
  EXPECT_EQ(ReadFile(source_), "t");
  EXPECT_EQ(ReadFile(destination_), "s");
  ASSERT_EQ(unlink(destination_.c_str()), 0);
  ASSERT_EQ(symlink("nowhere", destination_.c_str()), 0);
  EXPECT_EQ(Rename(), 0);
  EXPECT_EQ(ReadFile(source_), "t");
  char target[64] = "";
  ASSERT_GT(readlink(destination_.c_str(), target, sizeof(target) - 1), 0);
  EXPECT_STREQ(target, "nowhere");
  std::string nowhere = dir_.File("no/such/dir");
  EXPECT_EQ(RenameFile(source_.c_str(), nowhere.c_str()), -1);
  EXPECT_EQ(ReadFile(source_), "t");
  EXPECT_EQ(sleep.yields(), 0);
  ASSERT_EQ(mkdir(dir_.File("d").c_str(), 0755), 0);
  std::string inside = dir_.File("d/sub");
  EXPECT_EQ(RenameFile(dir_.File("d").c_str(), inside.c_str()), -1);
  EXPECT_EQ(sleep.yields(), 16);
  EXPECT_EQ(sleep.calls(), 0);
  EXPECT_EQ(
      log.Normalized(),
      (std::vector<std::string>{
          "quvaidx_system:N [Error] rename: " + source_ + " -> " + nowhere,
          "quvaidx_system:N [Error] rename reach max retry: " + dir_.File("d") +
              " -> " + inside}));
}

// Without a no-replace rename a hard link stands in; without hard links too,
// the plain rename after the existence test is all there is.
TEST_F(FileTest, RenameWhereTheFilesystemLacksNoReplaceOrLinks) {
  const std::vector<std::pair<long, int>> kinds[] = {
      {{SYS_renameat2, EINVAL}},
      {{SYS_renameat2, ENOSYS}, {SYS_link, EPERM}, {SYS_linkat, EPERM}}};
  for (const auto& failures : kinds) {
    WriteFile(source_, "s");
    unlink(destination_.c_str());
    EXPECT_EQ(RunWithSyscallsFailing(failures, [&] { return Rename(); }), 0);
    EXPECT_EQ(ReadFile(destination_), "s");
    EXPECT_NE(access(source_.c_str(), F_OK), 0);
  }
  WriteFile(source_, "t");
  ASSERT_EQ(unlink(destination_.c_str()), 0);
  ASSERT_EQ(symlink("nowhere", destination_.c_str()), 0);
  EXPECT_EQ(RunWithSyscallsFailing(kinds[0], [&] { return Rename(); }), 0);
  EXPECT_EQ(ReadFile(source_), "t");
}

// The first n lines go; owner and mode stay, no temporary file does. What is
// no regular file is refused at once (a planted FIFO must not block).
TEST_F(FileTest, TrimDropsTheFirstLines) {
  const std::tuple<std::string, int, std::string> kCases[] = {
      {"a\nb\nc\n", 1, "b\nc\n"},
      {"a\nb\n", 0, "a\nb\n"},
      {"a\nb\n", -4, "a\nb\n"},
      {"a\nb\n", 99, ""},
      {"a\nb\nlast", 2, "last"},
      {"\n\nx\n", 2, "x\n"},
      {std::string(200000, 'f') + "\n" + std::string(70000, 's'), 1,
       std::string(70000, 's')}};  // across copy blocks
  WriteFile(source_, "");
  ASSERT_EQ(chmod(source_.c_str(), 02640), 0);
  ASSERT_EQ(chown(source_.c_str(), kNobody, kNobody), 0);
  struct stat before, after;
  ASSERT_EQ(stat(source_.c_str(), &before), 0);
  for (const auto& [text, n, left] : kCases) {
    WriteFile(source_, text);
    ASSERT_EQ(FileRemoveHeadingLine(source_.c_str(), n), 0);
    EXPECT_EQ(ReadFile(source_), left) << text.substr(0, 9) << " " << n;
  }
  ASSERT_EQ(stat(source_.c_str(), &after), 0);
  EXPECT_EQ(after.st_mode & 07777, before.st_mode & 07777);
  EXPECT_EQ(after.st_uid, before.st_uid);
  EXPECT_EQ(after.st_gid, before.st_gid);
  EXPECT_EQ(EntriesIn(dir_.path()), 1);
  const std::string fifo = dir_.File("fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  ASSERT_EQ(symlink(source_.c_str(), dir_.File("link").c_str()), 0);
  LogCapture log;
  alarm(5);  // a trim that waits on the FIFO ends the test here
  for (const std::string& odd :
       {destination_, dir_.path(), fifo, dir_.File("link")}) {
    EXPECT_EQ(FileRemoveHeadingLine(odd.c_str(), 1), -1) << odd;
  }
  alarm(0);
  EXPECT_EQ(FileRemoveHeadingLine(nullptr, 1), -1);
  EXPECT_EQ(EntriesIn(dir_.path()), 3);  // the source, the FIFO, the link
  EXPECT_EQ(
      log.Normalized(),
      std::vector<std::string>{"quvaidx_system:N [Error] " + dir_.File("link") +
                               " is a symbolic link; not trimmed"});
}

// A full disk or a file of another user fails the trim, keeping every line
// and no temporary file, without retrying for ever.
TEST_F(FileTest, TrimThatCannotWriteItsCopyKeepsEveryLine) {
  std::string text;
  for (int i = 0; i < 300; ++i)
    text += "/share/entry" + std::to_string(i) + "\n";
  WriteFile(source_, text);
  auto trim_fails = [&] {
    return FileRemoveHeadingLine(source_.c_str(), 1) == -1 ? 0 : 1;
  };
  EXPECT_EQ(RunWithFileSizeLimit(1000, trim_fails), 0);
  EXPECT_EQ(RunWithSyscallsFailing(  // a copy that cannot be renamed in
                {{SYS_rename, EIO}, {SYS_renameat, EIO}, {SYS_renameat2, EIO}},
                trim_fails),
            0);
  chmod(dir_.path().c_str(), 0777);  // the trimmer may create its copy
  if (getuid() == 0) {
    EXPECT_EQ(RunUnprivileged(trim_fails), 0);
  }
  EXPECT_EQ(ReadFile(source_), text);
  EXPECT_EQ(EntriesIn(dir_.path()), 1);
}

}  // namespace
}  // namespace quvaidx::test
