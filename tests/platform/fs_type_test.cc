#include <errno.h>
#include <gtest/gtest.h>

#include "fs_type.h"
#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(FsTypeTest, MagicNumbersMapToTheirCodes) {
  struct Case {
    uint32_t magic;
    int code;
  } cases[] = {
      {0xEF53, QUVA_FS_EXT},
      {0x58465342, QUVA_FS_XFS},
      {0x9123683E, QUVA_FS_BTRFS},
      {0x01021994, QUVA_FS_TMPFS},
      {0x6969, QUVA_FS_NFS},
      {0xFF534D42, QUVA_FS_CIFS},
      {0xFE534D42, QUVA_FS_CIFS},
      {0x65735546, QUVA_FS_FUSE},
      {0x9660, QUVA_FS_ISO9660},
      {0x15013346, QUVA_FS_UDF},
      {0x73717368, QUVA_FS_SQUASHFS},
      {0xE0F5E1E2, QUVA_FS_ROM_IMAGE},
      {0x00C36400, QUVA_FS_NETWORK_OTHER},
      {0x9FA0, QUVA_FS_OTHER},  // proc
      {0x12345678, QUVA_FS_OTHER},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.magic);
    EXPECT_EQ(FSTypeCodeFromMagic(c.magic), c.code);
  }
}

TEST(FsTypeTest, RemoteAndImageTable) {
  struct Case {
    int code;
    int remote, image;
  } cases[] = {
      {QUVA_FS_OTHER, 0, 0},
      {QUVA_FS_EXT, 0, 0},
      {QUVA_FS_TMPFS, 0, 0},
      {QUVA_FS_NTFS, 0, 0},
      {QUVA_FS_OVERLAY, 0, 0},
      {QUVA_FS_NFS, 1, 0},
      {QUVA_FS_CIFS, 1, 0},
      {12, 1, 0},
      {QUVA_FS_NETWORK_OTHER, 1, 0},
      {QUVA_FS_ISO9660, 0, 1},
      {QUVA_FS_UDF, 0, 1},
      {QUVA_FS_SQUASHFS, 0, 1},
      {QUVA_FS_ROM_IMAGE, 0, 1},
      {-1, 0, 0},
      {999, 0, 0},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.code);
    EXPECT_EQ(QUVAFSIsRemoteFS(c.code), c.remote);
    EXPECT_EQ(QUVAFSIsImageFS(c.code), c.image);
  }
}

TEST(FsTypeTest, Code12IsFuseAndCountsAsRemote) {
  EXPECT_EQ(QUVA_FS_FUSE, 12);
  EXPECT_EQ(QUVAFSIsRemoteFS(12), 1);
}

TEST(FsTypeTest, RealStatfsOfTmpfsAndProc) {
  if (access("/dev/shm", F_OK) == 0) {
    EXPECT_EQ(QUVAGetFSType("/dev/shm", 0), QUVA_FS_TMPFS);
  }
  int proc = QUVAGetFSType("/proc/self", 0);
  EXPECT_EQ(proc, QUVA_FS_OTHER);
  EXPECT_EQ(QUVAFSIsRemoteFS(proc), 0);
  EXPECT_EQ(QUVAFSIsImageFS(proc), 0);
}

TEST(FsTypeTest, RealStatfsOfTemporaryFileIsLocal) {
  TempDir dir;
  WriteFile(dir.File("a"), "x");
  int code = QUVAGetFSType(dir.File("a").c_str(), 0);
  EXPECT_GE(code, 0);
  EXPECT_EQ(QUVAFSIsRemoteFS(code), 0);
  EXPECT_EQ(QUVAFSIsImageFS(code), 0);
}

TEST(FsTypeTest, MissingPathFailsWithErrnoAndErrorStack) {
  errno = 0;
  EXPECT_EQ(QUVAGetFSType("/nonexistent/quvahost/path", 0), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_STREQ(QLIBCErrorGetFile(), "fs_type.cc");
  EXPECT_GT(QLIBCErrorGetLine(), 0);
}

TEST(FsTypeTest, BadOptionOrNullPathFailsWithEinval) {
  errno = 0;
  EXPECT_EQ(QUVAGetFSType("/", 1), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(QUVAGetFSType(nullptr, 0), -1);
  EXPECT_EQ(errno, EINVAL);
}

}  // namespace
}  // namespace quvahost::test
