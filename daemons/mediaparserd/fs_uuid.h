// The UUID of the file system that holds a file, from libblkid.
//
// A file's st_dev names its file system's block device; libblkid finds the
// device node and reads the UUID from the file system's superblock (which
// needs read access to the device, as the daemon has when it runs as root).
// File systems without a block device of their own (tmpfs, overlay, NFS,
// FUSE, btrfs subvolumes with anonymous device numbers) have none: their
// UUID is the empty text. Answers are kept per device, so a device is read
// once per daemon life (a new file system on a device cannot appear while
// one of its files is open).
//
// Not thread-safe: one cache per thread.
#ifndef MEDIAPARSERD_FS_UUID_H_
#define MEDIAPARSERD_FS_UUID_H_

#include <sys/types.h>

#include <string>
#include <unordered_map>

namespace mediaparserd {

class FsUuidCache {
 public:
  // The UUID of the file system on device `device`, or "".
  const std::string& Lookup(dev_t device);

 private:
  // Devices seen, with their UUID ("" for none). Bounded: cleared when a
  // daemon has seen more devices than any machine mounts.
  std::unordered_map<dev_t, std::string> known_;
};

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_FS_UUID_H_
