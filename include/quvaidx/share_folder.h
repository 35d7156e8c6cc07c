// Shared folders: the indexed mark of a share, the default media shares,
// share-relative paths, and the facts about a directory that the index
// shows.
//
// Shares are the host's (QUVAShareGet and friends); a share record is
// obtained and released inside each call, on every path. Bit 0x20 of a
// share's status flags is its indexed mark. No lock is taken around the
// read-modify-write of the flags: ordering concurrent updates of one share
// is the host database's business.
//
// Failures are written to the system log at error priority with module
// name "quvaidx_folder". No state is kept between calls.
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_SHARE_FOLDER_H_
#define QUVAIDX_SHARE_FOLDER_H_

#include "quvaidx/export.h"

#ifdef __cplusplus
extern "C" {
#endif

// The host file that maps a share name (section) to its "guid" key.
#define QUVAIDX_SHARE_RIGHT_MAP "/usr/quva/etc/share_right.map"

// What GetDirInfo tells about a directory; every field is a zero-terminated
// text.
typedef struct DirInfo {
  char szPath[4096]; /* the directory path passed in (cut to fit) */
  char szName[4096]; /* its last path component */
  char szCTime[32];  /* creation time as ctime(3) writes it, with '\n' */
  char szMTime[32];  /* modification time, the same form */
  char szGuid[256];  /* guid of the share holding the directory */
} DirInfo;

// Sets (Clear: clears) the indexed mark of the share `name`. When the mark
// already has that value no update is made.
// Returns 0, also when storing the record fails (logged as "QUVAShareUpdate
// failed[<host error, hex>]"); -1 when the share is not found (logged as
// "QUVAShareGet failed: <name>").
QUVAIDX_API int ShareIndexStatusSet(const char* name);
QUVAIDX_API int ShareIndexStatusClear(const char* name);

// 1 for "photo", "music" or "video" in any ASCII letter case, else 0 (also
// for null).
QUVAIDX_API int IsDefaultShare(const char* name);

// Turns the share-relative path "/share[/rest]" into the path on disk: the
// share's path followed by "/rest", cut to fit out[out_size], with one
// final '/' removed ("/video/" -> "/vol1/video", "/video/a//" ->
// "/vol1/video/a/").
// Returns 0; -1 when the share is not found, `path` does not begin with
// '/', an argument is null or out_size < 1 (out untouched then), or the
// path cannot be copied ("Out of memory").
QUVAIDX_API int QUVAIndexSharePathGet(const char* path, char* out,
                                      int out_size);

// Fills *info for the directory `path`: szPath, the ctime(3) texts of its
// creation and modification times (host record, QLIBCFileStat option 9),
// szName after its last '/', and, when a share holds the path and the share
// rights map has a "guid" for it, szGuid. Fields not reached keep what the
// caller put there: szPath is written before the checks, szGuid only when
// found.
// Returns 0 (whether or not a guid was found); -1 when path or info is null
// ("Bad parameter."), the path is not an existing directory, or it holds no
// '/' ("quvaidx_folder (<line>) Failed to get dir path of <path>").
QUVAIDX_API int GetDirInfo(const char* path, DirInfo* info);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUVAIDX_SHARE_FOLDER_H_
