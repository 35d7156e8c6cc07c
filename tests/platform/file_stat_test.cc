#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(FileStatTest, RecordIs128Bytes) {
  EXPECT_EQ(sizeof(QLIBCFileStatRecord), 128u);
}

TEST(FileStatTest, TypeBitsOfFileDirectoryAndLink) {
  TempDir dir;
  WriteFile(dir.File("f"), "12345");
  ASSERT_EQ(symlink(dir.File("f").c_str(), dir.File("link").c_str()), 0);
  ASSERT_EQ(mkfifo(dir.File("fifo").c_str(), 0600), 0);
  struct Case {
    std::string path;
    mode_t type;
  } cases[] = {{dir.File("f"), S_IFREG},
               {dir.File("link"), S_IFREG},  // links are followed
               {dir.path(), S_IFDIR},
               {dir.File("fifo"), S_IFIFO}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path);
    QLIBCFileStatRecord record;
    memset(&record, 0, sizeof record);
    ASSERT_EQ(QLIBCFileStat(c.path.c_str(), QLIBC_STAT_TIMES, &record), 0);
    EXPECT_EQ(record.uMode & S_IFMT, c.type);
  }
  QLIBCFileStatRecord record;
  ASSERT_EQ(QLIBCFileStat(dir.File("f").c_str(), QLIBC_STAT_TIMES, &record), 0);
  EXPECT_EQ(record.llSize, 5);
}

TEST(FileStatTest, ModificationTimeIsTheOneSet) {
  TempDir dir;
  WriteFile(dir.File("f"), "x");
  struct timespec times[2] = {{1425719103, 0}, {1425719103, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, dir.File("f").c_str(), times, 0), 0);
  QLIBCFileStatRecord record;
  ASSERT_EQ(QLIBCFileStat(dir.File("f").c_str(), QLIBC_STAT_TIMES, &record), 0);
  EXPECT_EQ(record.llMTime, 1425719103);
  EXPECT_EQ(record.llATime, 1425719103);
}

// Setting the modification time into the past must not move the creation
// time: it is the birth time, or else the status-change time, both "now".
TEST(FileStatTest, CreationTimeIsNotTheModificationTime) {
  TempDir dir;
  time_t before = time(nullptr);
  WriteFile(dir.File("f"), "x");
  struct timespec times[2] = {{1000000000, 0}, {1000000000, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, dir.File("f").c_str(), times, 0), 0);
  QLIBCFileStatRecord record;
  ASSERT_EQ(QLIBCFileStat(dir.File("f").c_str(), QLIBC_STAT_TIMES, &record), 0);
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
