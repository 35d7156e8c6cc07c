// The host stand-in's small services: boot step, error stack, filesystem
// types, file status, pid files, and the dispatch table's seam.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <tuple>

#include "fs_type.h"
#include "host_ops.h"
#include "support/fake_host.h"
#include "support/unprivileged.h"

namespace quvahost::test {
namespace {

TEST(BootStepTest, FileContents) {
  HostEtc etc;
  EXPECT_EQ(QUVASystemGetBootStep(), QUVA_BOOT_STEP_READY);  // no file
  const std::pair<const char*, int> cases[] = {
      {" 3 \r\n", 3}, {"0", 0},    {"", -1},
      {"four", -1},   {"4 4", -1}, {"2147483648", -1}};
  for (const auto& [text, step] : cases) {
    WriteFile(etc.File("boot_step"), text);
    EXPECT_EQ(QUVASystemGetBootStep(), step) << text;
    EXPECT_TRUE(step >= 0 || QLIBCErrGet() == EINVAL);
  }
  HostEtc other;  // the directory is looked up on every call
  ASSERT_EQ(mkdir(other.File("boot_step").c_str(), 0755), 0);
  EXPECT_EQ(QUVASystemGetBootStep(), -1) << "a directory is not booted";
  EXPECT_EQ(QLIBCErrGet(), EISDIR);
}

TEST(ErrorStackTest, LastFailureOfThisThreadWithFileAndLine) {
  char buffer[64];
  EXPECT_EQ(QUVAEADirPath(7, "/a/b", buffer, sizeof buffer), -1);
  EXPECT_STREQ(QLIBCErrorGetFile(), "ea_dir.cc");
  errno = 0;
  EXPECT_EQ(QUVAGetFSType("/nonexistent/x", 0), -1);
  EXPECT_EQ(errno, ENOENT);
  int line = QLIBCErrorGetLine();
  EXPECT_GT(line, 0);
  EXPECT_EQ(QUVAEADirPath(0, "/a/b", buffer, sizeof buffer), 0);
  int other_code = -1;
  const char* other_file = nullptr;
  std::thread([&] {
    other_code = QLIBCErrGet();
    other_file = QLIBCErrorGetFile();
    QUVAEADirPath(0, "/a/long-name", buffer, 4);  // ERANGE
  }).join();
  EXPECT_EQ(other_code, 0);
  EXPECT_STREQ(other_file, "");
  EXPECT_EQ(QLIBCErrGet(), ENOENT) << "kept after success and other threads";
  EXPECT_STREQ(QLIBCErrorGetFile(), "fs_type.cc");
  EXPECT_EQ(QLIBCErrorGetLine(), line);
}

// Code 12 (user-space filesystems) counts as remote.
TEST(FsTypeTest, MagicNumbersAndTheRemoteAndImageTable) {
  // The magic number, the code, remote, image.
  const std::tuple<uint32_t, int, int, int> cases[] = {
      {0xEF53, QUVA_FS_EXT, 0, 0},
      {0x6969, QUVA_FS_NFS, 1, 0},
      {0xFF534D42, QUVA_FS_CIFS, 1, 0},  // top bit set
      {0x65735546, 12, 1, 0},
      {0x00C36400, QUVA_FS_NETWORK_OTHER, 1, 0},
      {0x9660, QUVA_FS_ISO9660, 0, 1},
      {0xE0F5E1E2, QUVA_FS_ROM_IMAGE, 0, 1},
      {0x12345678, QUVA_FS_OTHER, 0, 0}};
  for (const auto& [magic, code, remote, image] : cases) {
    SCOPED_TRACE(magic);
    EXPECT_EQ(FSTypeCodeFromMagic(magic), code);
    EXPECT_EQ(QUVAFSIsRemoteFS(code), remote);
    EXPECT_EQ(QUVAFSIsImageFS(code), image);
  }
  EXPECT_EQ(QUVAFSIsRemoteFS(999) + QUVAFSIsImageFS(-1), 0);
  EXPECT_EQ(QUVAGetFSType("/proc/self", 0), QUVA_FS_OTHER);
  EXPECT_EQ(QUVAGetFSType("/", 1), -1);
  EXPECT_EQ(QLIBCErrGet(), EINVAL);
}

// The creation time is the birth time where recorded (flagged), else the
// status-change time, also without statx; failures leave the record as it was.
TEST(FileStatTest, TypeSizeOwnerAndTimesAndNothingWrittenOnFailure) {
  TempDir dir;
  const std::string file = dir.File("f");
  WriteFile(file, "12345");
  ASSERT_EQ(symlink(file.c_str(), dir.File("link").c_str()), 0);
  ASSERT_EQ(mkfifo(dir.File("fifo").c_str(), 0600), 0);
  QLIBCFileStatRecord record;
  for (auto [name, type] : {std::pair<const char*, mode_t>{"link", S_IFREG},
                            {"", S_IFDIR},
                            {"fifo", S_IFIFO}}) {
    ASSERT_EQ(QLIBCFileStat(dir.File(name).c_str(), QLIBC_STAT_TIMES, &record),
              0);
    EXPECT_EQ(record.uMode & S_IFMT, type) << name;
  }
  sleep(1);  // the status changes a second after the birth
  struct timespec times[2] = {{1425719103, 0}, {1425719104, 0}};
  ASSERT_EQ(utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
  if (getuid() == 0) {
    ASSERT_EQ(chown(file.c_str(), 65534, 65533), 0);  // no owner of 0
  }
  struct stat st;
  struct statx stx;
  ASSERT_EQ(stat(file.c_str(), &st), 0);
  ASSERT_EQ(statx(AT_FDCWD, file.c_str(), 0, STATX_BTIME, &stx), 0);
  const bool birth = (stx.stx_mask & STATX_BTIME) != 0;
  memset(&record, 0x5A, sizeof record);
  ASSERT_EQ(QLIBCFileStat(file.c_str(), QLIBC_STAT_TIMES, &record), 0);
  EXPECT_EQ(record.llSize, 5);
  EXPECT_EQ(record.llATime, 1425719103);
  EXPECT_EQ(record.llMTime, 1425719104);
  EXPECT_EQ(record.llChangeTime, st.st_ctime);
  EXPECT_EQ(record.llCTime, birth ? stx.stx_btime.tv_sec : st.st_ctime);
  EXPECT_EQ(record.uFlags, birth ? QLIBC_STAT_FLAG_BIRTH_TIME : 0u);
  EXPECT_EQ(record.uUid, st.st_uid);
  EXPECT_EQ(record.uGid, st.st_gid);
  EXPECT_EQ(record.ullInode, st.st_ino);
  EXPECT_EQ(record.ullDevice, st.st_dev);
  for (unsigned char byte : record.reserved) EXPECT_EQ(byte, 0);
  QLIBCFileStatRecord from_stat = record;
  from_stat.llCTime = st.st_ctime;
  from_stat.uFlags = 0;
  auto same_from_stat = [&] {
    QLIBCFileStatRecord got;
    memset(&got, 0x5A, sizeof got);
    return QLIBCFileStat(file.c_str(), QLIBC_STAT_TIMES, &got) != 0 ||
           memcmp(&got, &from_stat, sizeof got) != 0;
  };
  for (int error : {ENOSYS, EPERM}) {
    EXPECT_EQ(quvaidx::test::RunWithSyscallsFailing({{SYS_statx, error}},
                                                    same_from_stat),
              0)
        << error;
  }
  memset(&record, 0x5A, sizeof record);
  EXPECT_EQ(QLIBCFileStat("/nonexistent/f", QLIBC_STAT_TIMES, &record), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_EQ(QLIBCFileStat("/", 0, &record), -1);
  EXPECT_EQ(QLIBCFileStat("/", QLIBC_STAT_TIMES, nullptr), -1);
  const unsigned char* bytes = reinterpret_cast<unsigned char*>(&record);
  for (size_t i = 0; i < sizeof record; ++i) EXPECT_EQ(bytes[i], 0x5A);
}

// A pid file names a live writer only if its process runs (no zombie) and
// did not start after the file was written (a recycled pid).
TEST(PidFileTest, ContentsAndLiveZombieDeadOrRecycled) {
  TempDir dir;
  const std::string pid_file = dir.File("pid");
  const std::pair<const char*, int> cases[] = {
      {"123\n", 123}, {" 42 \r\n", 42}, {"2147483647", 2147483647}, {"0", -1},
      {"-5", -1},     {"1 2", -1},      {"2147483648", -1}};
  for (const auto& [text, pid] : cases) {
    WriteFile(pid_file, text);
    EXPECT_EQ(QLIBCReadPidFile(pid_file.c_str()), pid) << text;
  }
  WriteFile(pid_file, "1" + std::string(100, ' '));
  EXPECT_EQ(QLIBCReadPidFile(pid_file.c_str()), -1);
  EXPECT_EQ(QLIBCReadPidFile("/nonexistent/x.pid"), -1);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  auto alive = [&](pid_t pid, time_t age) {
    WriteFile(pid_file, std::to_string(pid));
    struct timespec times[2] = {{time(nullptr) - age, 0},
                                {time(nullptr) - age, 0}};
    utimensat(AT_FDCWD, pid_file.c_str(), times, 0);
    return QLIBCProcAliveByPidFile(pid_file.c_str());
  };
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    for (;;) pause();
  }
  EXPECT_EQ(alive(child, 0), 1);
  EXPECT_EQ(alive(child, 1), 1) << "clock granularity";
  EXPECT_EQ(alive(child, 3600), 0) << "started an hour after the file";
  EXPECT_EQ(QLIBCErrGet(), ESRCH);
  EXPECT_EQ(alive(getpid(), 0), 1);
  kill(child, SIGKILL);
  siginfo_t info;  // ended, not reaped
  ASSERT_EQ(waitid(P_PID, child, &info, WEXITED | WNOWAIT), 0);
  EXPECT_EQ(alive(child, 0), 0) << "zombie";
  ASSERT_EQ(waitpid(child, nullptr, 0), child);
  EXPECT_EQ(alive(child, 0), 0) << "dead";
  WriteFile(pid_file, "abc");
  EXPECT_EQ(QLIBCProcAliveByPidFile(pid_file.c_str()), 0);
  EXPECT_EQ(QLIBCProcAliveByPidFile(dir.File("none").c_str()), 0);
  EXPECT_EQ(QLIBCProcAliveByPidFile(nullptr), 0);
}

int FixedErrorCode() { return 4242; }

// A table with null entries must not leave a null pointer for an exported
// function to call, and null must bring the stand-in back.
TEST(HostOpsTest, NullEntriesAndNullTableRestoreTheStandIn) {
  HostOps mine{};
  mine.ErrGet = FixedErrorCode;
  HostOps before = SetHostOps(&mine);
  EXPECT_EQ(QLIBCErrGet(), 4242);
  EXPECT_EQ(QLIBCUnicodeUTF8StrCountChar("ab"), 2);  // null: the stand-in's
  HostOps replaced = SetHostOps(nullptr);
  EXPECT_EQ(replaced.ErrGet, &FixedErrorCode);
  EXPECT_EQ(replaced.UnicodeUTF8StrCountChar, before.UnicodeUTF8StrCountChar);
  EXPECT_EQ(SetHostOps(&before).ErrGet, before.ErrGet);
}

}  // namespace
}  // namespace quvahost::test
