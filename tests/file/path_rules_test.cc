// Index path rules: entry names, recycle bins, mount kinds through the fake
// host, time texts under a fixed time zone, existence tests on real files.
#include "quvaidx/path_rules.h"

#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>
#include <utime.h>

#include <string>
#include <tuple>

#include <gtest/gtest.h>

#include "support/fake_host.h"
#include "support/fd_check.h"
#include "support/log_capture.h"

namespace {

using quvahost::test::FakeHost;
using quvahost::test::HostOp;
using quvaidx::test::LogCapture;
using quvaidx::test::TempDir;

// Reserved names are skipped exactly; a recycle bin counts only right after
// the share name.
TEST(PathNames, ReservedEntriesAndRecycleBins) {
  const std::pair<const char*, int> names[] = {
      {".", 0},          {"..", 0},         {"...", 1},
      {"Photos.app", 0}, {".app", 0},       {"Photos.APP", 1},
      {"a.app.mp4", 1},  {"a.apps", 1},     {"._", 0},
      {"._x.jpg", 0},    {".hidden", 1},    {"a._b", 1},
      {"#recycle", 0},   {"#recycle2", 1},  {"#Recycle", 1},
      {"#snapshot", 0},  {"#snapshots", 1}, {"#Snapshot", 1},
      {"x#snapshot", 1}, {".quvameta", 0},  {".quvameta2", 1}};
  for (const auto& [name, index] : names)
    EXPECT_EQ(index, EntryNameShouldIndex(name)) << name;
  EXPECT_EQ(0, EntryNameShouldIndex(nullptr));
  const std::pair<const char*, int> paths[] = {
      {"/vol1/video/#recycle", 1},    {"/vol1/video/#recycle/a.mp4", 1},
      {"/vol1/video/#recyclebin", 0}, {"/vol1/video/#Recycle", 0},
      {"/vol1/video/a/#recycle", 0},  {"/vol1/#recycle", 0}};
  for (const auto& [path, under] : paths)
    EXPECT_EQ(under, QUVAPathUnderRecyle(path)) << path;
  EXPECT_EQ(0, QUVAPathUnderRecyle(nullptr));
}

// Type 12 is remote even where the host's table says no; an untellable type
// (-1) is neither remote nor an image, takes EA writes, logged at debug.
TEST(MountTests, AnswerByFilesystemTypeCode) {
  // The code, whether the host's tables answer (else they say no), the
  // answers: remote, remote or image, EA writes.
  const std::tuple<int, bool, int, int, int> cases[] = {
      {1, true, 0, 0, 1},                         // ext4
      {10, true, 1, 1, 0},                        // NFS
      {12, true, 1, 1, 0},                        // user-space filesystem
      {12, false, 1, 1, 0}, {13, true, 0, 1, 0},  // ISO 9660
      {18, true, 0, 0, 1},                        // overlayfs
      {-1, true, 0, 0, 1}};
  for (const auto& [code, host_table, remote, remote_or_image, ea] : cases) {
    SCOPED_TRACE(code);
    LogCapture log(7);
    FakeHost host;
    if (code < 0) host.Fail(HostOp::kGetFSType, ENOENT);
    if (code >= 0) host.Answer(HostOp::kGetFSType, {code});
    if (!host_table) {
      host.Answer(HostOp::kFSIsRemoteFS, {0});
      host.Answer(HostOp::kFSIsImageFS, {0});
    }
    EXPECT_EQ(remote, IndexIsPathRemoteMount("/x"));
    EXPECT_EQ(remote_or_image, IndexIsPathRemoteOrImageMount("/x"));
    EXPECT_EQ(ea, IndexIsPathSupportEAWrite("/x"));
    if (code >= 0) continue;
    ASSERT_EQ(3u, log.lines().size());
    for (const auto& line : log.lines()) EXPECT_EQ(LOG_DEBUG, line.priority);
  }
}

// Sets TZ for the rest of this test's process.
TEST(TimeTexts, LocalAndCutToTheirBuffers) {
  setenv("TZ", "QTZ-9", 1);  // nine hours east of UTC, no summer time
  tzset();
  FakeHost host;
  QLIBCFileStatRecord record = {};
  record.llCTime = 1425686703;  // 2015-03-07 09:05:03 in QTZ-9
  record.llMTime = 1483228799;  // 2017-01-01 08:59:59
  host.AnswerFileStat(record);
  char c[32], m[32];
  EXPECT_EQ(19, QUVAIndexCTimeMTimeGet("/f", c, sizeof(c), m, sizeof(m)));
  EXPECT_STREQ("2015-03-07 09:05:03", c);
  EXPECT_STREQ("2017-01-01 08:59:59", m);
  char small[11];
  EXPECT_EQ(19, QUVAIndexCTimeMTimeGet("/f", c, 0, small, sizeof(small)));
  EXPECT_STREQ("2017-01-01", small);
  EXPECT_STREQ("2015-03-07 09:05:03", c) << "size 0 must not be written";
  host.Fail(HostOp::kFileStat, ENOENT, -3);
  EXPECT_EQ(-3, QUVAIndexCTimeMTimeGet("/f", c, sizeof(c), m, sizeof(m)));
  EXPECT_STREQ("2015-03-07 09:05:03", c);
  EXPECT_STREQ("2017-01-01 08:59:59", m);
}

TEST(ExistenceTests, RegularFilesDirectoriesAndLinks) {
  TempDir dir;
  const std::string file = dir.File("a.mp4"), sub = dir.File("sub");
  quvaidx::test::WriteFile(file, "12345");
  ASSERT_EQ(0, mkdir(sub.c_str(), 0755));
  ASSERT_EQ(0, symlink(file.c_str(), dir.File("to_file").c_str()));
  int64_t size = -7;
  EXPECT_EQ(1, IsFileExist(file.c_str(), &size));
  EXPECT_EQ(5, size);
  EXPECT_EQ(1, IsFileExist(dir.File("to_file").c_str(), nullptr));
  size = -7;
  EXPECT_EQ(0, IsFileExist(sub.c_str(), &size));
  EXPECT_EQ(-7, size) << "size out changed on a directory";
  EXPECT_EQ(0, IsFileExist("/dev/null", &size));
  EXPECT_EQ(1, IsDirExist(sub.c_str()));
  EXPECT_EQ(0, IsDirExist(file.c_str()));
  EXPECT_EQ(0, IsDirExist(nullptr));
  struct utimbuf times = {1000, 1425686703};
  ASSERT_EQ(0, utime(file.c_str(), &times));
  EXPECT_EQ(1425686703, QUVAIndexModifyTimeGet(file.c_str()));
  EXPECT_EQ(0, QUVAIndexModifyTimeGet(dir.File("missing").c_str()));
}

}  // namespace
