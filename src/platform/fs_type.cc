// Filesystem type codes: one table from statfs magic numbers to codes, one
// table of which codes are remote and which are images.
#include "fs_type.h"

#include <sys/vfs.h>

#include "host_error.h"
#include "host_io.h"
#include "host_ops.h"
#include "quvahost/quvahost.h"

namespace quvahost {
namespace {

struct MagicCode {
  uint32_t magic;  // f_type as statfs reports it (see statfs(2))
  int code;        // QuvaFsType
};

constexpr MagicCode kMagicCodes[] = {
    {0x0000EF53, QUVA_FS_EXT},            // ext2, ext3, ext4
    {0x58465342, QUVA_FS_XFS},            //
    {0x9123683E, QUVA_FS_BTRFS},          //
    {0x01021994, QUVA_FS_TMPFS},          // tmpfs
    {0x858458F6, QUVA_FS_TMPFS},          // ramfs
    {0x2FC12FC1, QUVA_FS_ZFS},            //
    {0x00004D44, QUVA_FS_FAT},            // msdos, vfat
    {0x2011BAB0, QUVA_FS_EXFAT},          //
    {0x5346544E, QUVA_FS_NTFS},           // ntfs
    {0x7366746E, QUVA_FS_NTFS},           // ntfs3
    {0x0000482B, QUVA_FS_HFSPLUS},        //
    {0x00006969, QUVA_FS_NFS},            // NFS 2, 3, 4
    {0xFF534D42, QUVA_FS_CIFS},           // CIFS
    {0xFE534D42, QUVA_FS_CIFS},           // SMB2
    {0x0000517B, QUVA_FS_CIFS},           // smbfs
    {0x65735546, QUVA_FS_FUSE},           // fuse, fuseblk
    {0x00009660, QUVA_FS_ISO9660},        //
    {0x15013346, QUVA_FS_UDF},            //
    {0x73717368, QUVA_FS_SQUASHFS},       //
    {0x28CD3D45, QUVA_FS_ROM_IMAGE},      // cramfs
    {0x00007275, QUVA_FS_ROM_IMAGE},      // romfs
    {0xE0F5E1E2, QUVA_FS_ROM_IMAGE},      // EROFS
    {0x5346414F, QUVA_FS_NETWORK_OTHER},  // AFS (OpenAFS)
    {0x6B414653, QUVA_FS_NETWORK_OTHER},  // AFS (kAFS)
    {0x00C36400, QUVA_FS_NETWORK_OTHER},  // Ceph
    {0x01021997, QUVA_FS_NETWORK_OTHER},  // 9P
    {0x73757245, QUVA_FS_NETWORK_OTHER},  // Coda
    {0x794C7630, QUVA_FS_OVERLAY},        //
};

struct CodeKind {
  int code;     // QuvaFsType
  bool remote;  // data on another machine
  bool image;   // read-only image
};

constexpr CodeKind kCodeKinds[] = {
    {QUVA_FS_NFS, true, false},      {QUVA_FS_CIFS, true, false},
    {QUVA_FS_FUSE, true, false},     {QUVA_FS_NETWORK_OTHER, true, false},
    {QUVA_FS_ISO9660, false, true},  {QUVA_FS_UDF, false, true},
    {QUVA_FS_SQUASHFS, false, true}, {QUVA_FS_ROM_IMAGE, false, true},
};

const CodeKind* FindKind(int type) {
  for (const CodeKind& kind : kCodeKinds) {
    if (kind.code == type) return &kind;
  }
  return nullptr;
}

}  // namespace

int FSTypeCodeFromMagic(uint32_t magic) {
  for (const MagicCode& entry : kMagicCodes) {
    if (entry.magic == magic) return entry.code;
  }
  return QUVA_FS_OTHER;
}

int GetFSTypeImpl(const char* path, int option) {
  if (path == nullptr || option != 0) return HOST_FAIL(EINVAL);
  struct statfs st;
  if (RetryOnEintr([&] { return statfs(path, &st); }) != 0) {
    return HOST_FAIL(errno);
  }
  // f_type is a signed word: magic numbers with the top bit set would be
  // negative on 32-bit machines, so compare the low 32 bits.
  return FSTypeCodeFromMagic(static_cast<uint32_t>(st.f_type));
}

int FSIsRemoteFSImpl(int type) {
  const CodeKind* kind = FindKind(type);
  return kind != nullptr && kind->remote ? 1 : 0;
}

int FSIsImageFSImpl(int type) {
  const CodeKind* kind = FindKind(type);
  return kind != nullptr && kind->image ? 1 : 0;
}

}  // namespace quvahost
