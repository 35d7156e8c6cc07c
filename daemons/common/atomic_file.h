// Files that readers see whole or not at all, for the reference daemons.
#ifndef QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_
#define QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_

#include <stddef.h>
#include <sys/types.h>

#include <string>

namespace quvaidx_daemons {

// Writes the `length` bytes of `data` to `path` through a temporary file
// beside it (`path`, `temp_suffix` and six random characters), gives it
// `mode`, syncs it when `sync`, and renames it over `path`: a reader sees
// the old file or the whole new one. Returns "", or what failed: "cannot
// create a file: REASON" or "cannot write WHAT: REASON", with no temporary
// file left behind.
std::string WriteAtomically(const std::string& path,
                            const std::string& temp_suffix, const void* data,
                            size_t length, mode_t mode, bool sync,
                            const std::string& what);

}  // namespace quvaidx_daemons

#endif  // QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_
