#include <errno.h>
#include <gtest/gtest.h>

#include "fs_type.h"
#include "host_test_util.h"
#include "quvahost/quvahost.h"

namespace quvahost::test {
namespace {

TEST(FsTypeTest, MagicNumbersAndTheRemoteAndImageTable) {
  const struct {
    uint32_t magic;
    int code, remote, image;
  } cases[] = {{0xEF53, QUVA_FS_EXT, 0, 0},
               {0x01021994, QUVA_FS_TMPFS, 0, 0},
               {0x6969, QUVA_FS_NFS, 1, 0},
               {0xFF534D42, QUVA_FS_CIFS, 1, 0},
               {0x65735546, QUVA_FS_FUSE, 1, 0},
               {0x00C36400, QUVA_FS_NETWORK_OTHER, 1, 0},
               {0x9660, QUVA_FS_ISO9660, 0, 1},
               {0xE0F5E1E2, QUVA_FS_ROM_IMAGE, 0, 1},
               {0x12345678, QUVA_FS_OTHER, 0, 0}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.magic);
    EXPECT_EQ(FSTypeCodeFromMagic(c.magic), c.code);
    EXPECT_EQ(QUVAFSIsRemoteFS(c.code), c.remote);
    EXPECT_EQ(QUVAFSIsImageFS(c.code), c.image);
  }
  EXPECT_EQ(QUVA_FS_FUSE, 12);
  for (int code : {int(QUVA_FS_NTFS), int(QUVA_FS_OVERLAY), -1, 999}) {
    EXPECT_EQ(QUVAFSIsRemoteFS(code), 0) << code;
    EXPECT_EQ(QUVAFSIsImageFS(code), 0) << code;
  }
}

TEST(FsTypeTest, RealStatfsAndItsFailures) {
  EXPECT_EQ(QUVAGetFSType("/proc/self", 0), QUVA_FS_OTHER);
  errno = 0;
  EXPECT_EQ(QUVAGetFSType("/nonexistent/quvahost/path", 0), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(QLIBCErrGet(), ENOENT);
  EXPECT_STREQ(QLIBCErrorGetFile(), "fs_type.cc");
  EXPECT_GT(QLIBCErrorGetLine(), 0);
  EXPECT_EQ(QUVAGetFSType("/", 1), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(errno, EINVAL);
}

}  // namespace
}  // namespace quvahost::test
