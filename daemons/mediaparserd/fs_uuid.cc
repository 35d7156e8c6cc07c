#include "fs_uuid.h"

#include <stdlib.h>

#include <blkid/blkid.h>

namespace mediaparserd {
namespace {

constexpr size_t kMaxDevices = 1024;

// Probes the superblock on the device node; "" when there is none or it
// cannot be read. No blkid cache file is read or written.
std::string ProbeUuid(dev_t device) {
  char* node = blkid_devno_to_devname(device);
  if (node == nullptr) return "";
  std::string uuid;
  blkid_probe probe = blkid_new_probe_from_filename(node);
  free(node);
  if (probe == nullptr) return "";
  blkid_probe_enable_superblocks(probe, 1);
  blkid_probe_set_superblocks_flags(probe, BLKID_SUBLKS_UUID);
  const char* value = nullptr;
  if (blkid_do_safeprobe(probe) == 0 &&
      blkid_probe_lookup_value(probe, "UUID", &value, nullptr) == 0 &&
      value != nullptr) {
    uuid = value;
  }
  blkid_free_probe(probe);
  return uuid;
}

}  // namespace

const std::string& FsUuidCache::Lookup(dev_t device) {
  auto it = known_.find(device);
  if (it != known_.end()) return it->second;
  if (known_.size() >= kMaxDevices) known_.clear();
  return known_.emplace(device, ProbeUuid(device)).first->second;
}

}  // namespace mediaparserd
