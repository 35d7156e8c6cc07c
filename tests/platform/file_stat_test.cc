#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <utility>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(FileStatTest, TypeSizeAndTimes) {
  static_assert(sizeof(QLIBCFileStatRecord) == 128);
  TempDir dir;
  time_t before = time(nullptr);
  WriteFile(dir.File("f"), "12345");
  ASSERT_EQ(symlink(dir.File("f").c_str(), dir.File("link").c_str()), 0);
  ASSERT_EQ(mkfifo(dir.File("fifo").c_str(), 0600), 0);
  QLIBCFileStatRecord record;
  for (auto [path, type] :
       {std::pair<std::string, mode_t>{dir.File("link"), S_IFREG},
        {dir.path(), S_IFDIR},
        {dir.File("fifo"), S_IFIFO}}) {
    ASSERT_EQ(QLIBCFileStat(path.c_str(), QLIBC_STAT_TIMES, &record), 0);
    EXPECT_EQ(record.uMode & S_IFMT, type) << path;
  }
  // Dating the file back must not move the creation time: the birth time,
  // or else the status-change time, both "now".
  struct timespec times[2] = {{1425719103, 0}, {1425719103, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, dir.File("f").c_str(), times, 0), 0);
  memset(&record, 0x5A, sizeof record);
  ASSERT_EQ(QLIBCFileStat(dir.File("f").c_str(), QLIBC_STAT_TIMES, &record), 0);
  EXPECT_EQ(record.llSize, 5);
  EXPECT_EQ(record.llMTime, 1425719103);
  EXPECT_EQ(record.llATime, 1425719103);
  EXPECT_GE(record.llCTime, before - 1);
  EXPECT_LE(record.llCTime, time(nullptr) + 1);
  EXPECT_GE(record.llChangeTime, before - 1);
  if ((record.uFlags & QLIBC_STAT_FLAG_BIRTH_TIME) == 0) {
    EXPECT_EQ(record.llCTime, record.llChangeTime);
  }
  for (unsigned char byte : record.reserved) EXPECT_EQ(byte, 0);
}

TEST(FileStatTest, FailuresLeaveRecordUntouched) {
  QLIBCFileStatRecord record;
  memset(&record, 0x5A, sizeof record);
  EXPECT_EQ(QLIBCFileStat("/nonexistent/f", QLIBC_STAT_TIMES, &record), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(QLIBCFileStat("/", 0, &record), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
  EXPECT_EQ(QLIBCFileStat(nullptr, QLIBC_STAT_TIMES, &record), -1);
  EXPECT_EQ(QLIBCFileStat("/", QLIBC_STAT_TIMES, nullptr), -1);
  const unsigned char* bytes = reinterpret_cast<unsigned char*>(&record);
  for (size_t i = 0; i < sizeof record; ++i) EXPECT_EQ(bytes[i], 0x5A);
}

}  // namespace
}  // namespace quvahost::test
