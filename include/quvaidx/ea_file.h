// Metadata side directories (EA directories) and the items in them.
//
// Data derived from a media file lives in files ("items") of the file's EA
// directory, which sits inside the host's hidden metadata directory of the
// file's folder. Only the host knows where: QUVAEADirPath turns a media
// file path into its EA directory path and QUVAEAMKDir creates one.
//
// Every item operation takes two candidate names of the same item; where
// one is chosen, name 1 wins when both exist. Functions without a digit
// take the EA directory path itself; those ending in 2, and
// GetEAFilePath, take the media file path and ask the host first.
//
// An item's path is the EA directory path, '/', and the name, composed in
// a 4096-byte buffer. A path that does not fit names no item: it is never
// cut and then used, so a long name cannot make an operation test or
// remove a different file; nor does a name holding a '/'. Items are
// regular files; GetEAFilePath and IsEAFileExist2 count only items of 2
// bytes or more.
//
// Links: a user may plant anything in the metadata directory of a folder
// they own, so no function here follows a symbolic link at the metadata
// directory or below it. Each opens the last two components of the EA
// directory path (the metadata directory and the EA directory) one at a
// time without following links, starting at the directory before them
// (links there are the caller's business), and tests and removes items
// relative to the EA directory without following links. A link found at
// either directory, or a FIFO, socket or device there, is refused and
// logged:
//   "Refused symbolic link at <path> (not followed, not removed)"
//   "Refused <path>: neither a directory nor a regular file (not opened,
//   not removed)"
// then the function fails as it would for a missing directory. A link
// among the items is not an item: it is logged the same way, never
// counted, never removed.
//
// Failures are written to the system log at error priority with module
// name "quvaidx_eafile"; each function lists its lines. No state is kept
// between calls: every function may run in several threads at once.
//
// OpenEADir is an addition beside the specified functions: it hands out a
// descriptor of the EA directory, reached without following links, so that
// a caller (a root daemon working for a folder's owner) can create and
// read items relative to it with openat and never through a link planted
// in the folder.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_EA_FILE_H_
#define QUVAIDX_EA_FILE_H_

#include <stdint.h>

#include "quvaidx/export.h"

#ifdef __cplusplus
extern "C" {
#endif

// Opens the EA directory of `file_path` without following a symbolic link
// at the metadata directory or below it. The walk starts at `folder_fd`, an
// open descriptor of the file's own folder, or, when it is -1, at that
// folder opened by its path (links in the folder's own path are the
// caller's business). The metadata directory and the EA directory are each
// opened with openat(O_NOFOLLOW|O_DIRECTORY). With `create` non-zero, each
// that is missing is made (mode 0777 less the umask), and a regular file in
// the way is replaced as MakeEADir does. A symbolic link (or anything but a
// directory or regular file) in the way is refused and logged ("Refused
// symbolic link at <path> ..." / "Refused <path>: neither a directory nor a
// regular file ..."), never removed and never followed. `folder_fd` stays
// the caller's.
// Returns a descriptor of the EA directory (O_RDONLY|O_DIRECTORY|
// O_CLOEXEC) that the caller closes; -1 with errno: ENOENT (missing and not
// `create`), ELOOP (a link in the way), ENOTDIR (a regular file in the way
// and not `create`, or a special file), EACCES, EINVAL (bad arguments, the
// host cannot give the path, logged as the QUVAEADirPath error line below,
// or the host places the EA directory outside the file's folder, logged),
// EAGAIN (the entry kept changing under the walk), or another errno of
// open or mkdir.
QUVAIDX_API int OpenEADir(const char* file_path, int folder_fd, int create);

// Makes sure that the EA directory of `file_path` and the metadata
// directory above it exist, and stores the EA directory path in
// buffer[size].
// A regular file standing where either directory should be is unlinked and
// replaced by a directory made with mode 0777 less the umask; a link,
// FIFO, socket or device there is refused (see Links above), never removed.
// A directory is never removed. A directory made by another process at the
// same moment counts as success.
// Returns 0. Returns -1 when:
// - file_path or buffer is null or size < 1: "Bad parameters.";
// - the host cannot give the path: "QUVAEADirPath error [0x<code>
//   <file>:<line>] on <file_path>" with the host's last error;
// - a directory cannot be made or opened: "Cannot mkdir <path>,
//   error:<errno>" (ELOOP for a refused link, ENOTDIR for a special file,
//   ENOENT when the file's folder is missing: it is never made).
// The buffer may hold the host's answer after a failure of the last kind.
QUVAIDX_API int MakeEADir(const char* file_path, char* buffer, int size);

// As MakeEADir, but leaves the creation to the host (QUVAEAMKDir), which
// does not replace entries in the way. The whole buffer is cleared first.
// The host is asked only when the EA directory cannot be opened and no
// link or special file was refused on the way; what it made is opened
// again the same way.
// Returns 0 with the EA directory existing; -1 with "Bad parameters." (as
// above), "Get ea dir path error. file path: <file_path>" or "Make ea dir
// path error. eaDir path: <path>" (also after a refusal).
QUVAIDX_API int GetEADirPath(const char* file_path, char* buffer, int size);

// Unlinks the items `name1` and `name2` of the EA directory `ea_dir`, each
// independently. Returns how many were removed: 0, 1 or 2 (a missing or
// null name, a directory or a link does not count). Logs only refusals.
QUVAIDX_API int RemoveEAFile(const char* ea_dir, const char* name1,
                             const char* name2);

// RemoveEAFile on the EA directory of `file_path`. Returns -1 without
// touching any file, logging the QUVAEADirPath error line, when the host
// cannot give that directory.
QUVAIDX_API int RemoveEAFile2(const char* file_path, const char* name1,
                              const char* name2);

// Returns `name1` (the pointer passed in) when it names an item of
// `ea_dir`, else `name2` when that does, else null. When one is found and
// `size` is not null, *size receives its size in bytes; else *size is
// untouched. Any size counts here. Logs only refusals.
QUVAIDX_API const char* IsEAFileExist(const char* ea_dir, int64_t* size,
                                      const char* name1, const char* name2);

// Stores in out[out_size] the full path of the item of `file_path`'s EA
// directory that IsEAFileExist finds, cut to out_size.
// Returns 0; -1 when none is found, the one found has fewer than 2 bytes,
// out is null or out_size < 1 (out untouched then), or the host cannot
// give the EA directory (logged as QUVAEADirPath error).
QUVAIDX_API int GetEAFilePath(const char* file_path, const char* name1,
                              const char* name2, char* out, int out_size);

// 1 when IsEAFileExist finds an item of 2 bytes or more in the EA
// directory of `file_path`, 0 when not, -1 when the host cannot give that
// directory (logged as QUVAEADirPath error).
QUVAIDX_API int IsEAFileExist2(const char* file_path, const char* name1,
                               const char* name2);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUVAIDX_EA_FILE_H_
