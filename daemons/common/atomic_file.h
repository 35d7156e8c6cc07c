// Files that readers see whole or not at all, for the reference daemons.
//
// The bytes go to a temporary file beside the target, renamed over the
// target, so that a reader sees the old file or the whole new one, never a
// part. All works relative to an open directory: no path is resolved, so a
// symbolic link planted in a folder a user can write is never followed.
#ifndef QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_
#define QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_

#include <stddef.h>
#include <sys/types.h>

#include <functional>
#include <string>

namespace quvaidx_daemons {

// Prepares the written temporary file, open as `fd`, before it is renamed
// into place (its owner and mode, say). Returns "" or what failed.
using PrepareFile = std::function<std::string(int fd)>;

// Writes the `length` bytes of `data` to the entry `name` (one path
// component) of the directory open as `dir_fd`, through a temporary file
// "<name><temp_suffix>XXXXXX" created there (O_EXCL, O_NOFOLLOW, mode 0600;
// the X are random), then `prepare`s it, syncs it when `sync`, and renames
// it over `name` with renameat. Nothing is ever resolved through a link.
// A symbolic link that stands at `name` is left alone and nothing is
// written: the caller's entry is refused, not replaced.
// Returns "", or what failed: "cannot create WHAT: REASON", "cannot
// write WHAT: REASON" or "cannot write WHAT: a symbolic link is in its
// place", with no temporary file left behind.
std::string WriteAtomicallyAt(int dir_fd, const std::string& name,
                              const std::string& temp_suffix, const void* data,
                              size_t length, const PrepareFile& prepare,
                              bool sync, const std::string& what);

}  // namespace quvaidx_daemons

#endif  // QUVAIDX_DAEMONS_COMMON_ATOMIC_FILE_H_
