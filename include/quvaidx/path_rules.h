// Index path rules: which directory entries are indexed, recycle bins, the
// kind of mount a path lies on, file times as text, existence tests.
//
// Filesystem kinds come from the host: QUVAGetFSType(path, 0), classified
// by QUVAFSIsRemoteFS and QUVAFSIsImageFS. Type 12 (a user-space
// filesystem, whose data may come from anywhere) counts as a network
// filesystem in all three mount tests. The mount tests write their one
// failure line at debug priority with module name "quvaidx_file".
//
// Time text: "YYYY-MM-DD hh:mm:ss" in local time (19 characters).
//
// No function keeps state; all may run in several threads at once (the
// time conversion uses localtime_r, which reads the process's time zone).
//
// These names are exported without parameter types (C linkage).
#ifndef QUVAIDX_PATH_RULES_H_
#define QUVAIDX_PATH_RULES_H_

#include <stdint.h>
#include <time.h>

#include "quvaidx/export.h"

#ifdef __cplusplus
extern "C" {
#endif

// 1 when the directory entry `name` (one path component) is to be indexed,
// 0 when it is skipped: "." and "..", names beginning with "._", exactly
// "#recycle" or "#snapshot", the host's hidden metadata directory, and
// names whose text from the last '.' is exactly ".app". Case-sensitive:
// "#Recycle" and "Photos.APP" are indexed, as are other names beginning
// with '.'. Null gives 0.
QUVAIDX_API int EntryNameShouldIndex(const char* name);

// 1 when `path` (/volume/share/...) is a share's recycle bin or lies below
// it: the text from the path's third '/' is "/#recycle" or begins with
// "/#recycle/". Else 0, also for null. (The name is spelled so.)
QUVAIDX_API int QUVAPathUnderRecyle(const char* path);

// 1 when `path` lies on a network filesystem (or type 12), else 0. When
// the host cannot tell, logs "failed to statfs <path>, reason=[(<errno>)
// <text>]" and gives 0.
QUVAIDX_API int IndexIsPathRemoteMount(const char* path);

// 1 when `path` lies on a network or image filesystem (or type 12), else 0;
// the same line and 0 when the host cannot tell.
QUVAIDX_API int IndexIsPathRemoteOrImageMount(const char* path);

// 1 when EA directories may be written where `path` lies: 0 on network,
// image and type 12 filesystems. When the host cannot tell, logs "failed to
// statfs, reason=[(<errno>)<text>]: <path>" and gives 1.
QUVAIDX_API int IndexIsPathSupportEAWrite(const char* path);

// Writes the creation time of `path` (the host's extended status record,
// QLIBCFileStat option 9) as time text into ctime_buf[ctime_size] and its
// modification time into mtime_buf[mtime_size], each cut to its size; a
// null buffer or a size < 1 receives nothing. A time that local time
// cannot represent is written as "0000-00-00 00:00:00".
// Returns the length of the whole modification-time text (19, also when
// the buffer cut it), or the host's negative result, both buffers
// untouched, when the file cannot be examined.
QUVAIDX_API int QUVAIndexCTimeMTimeGet(const char* path, char* ctime_buf,
                                       int ctime_size, char* mtime_buf,
                                       int mtime_size);

// The modification time of `path` (stat(2), links followed) in seconds
// since the epoch; 0 for null or when it cannot be examined.
QUVAIDX_API time_t QUVAIndexModifyTimeGet(const char* path);

// 1 when `path` is an existing directory (links followed), else 0 (null 0).
QUVAIDX_API int IsDirExist(const char* path);

// 1 when `path` is an existing regular file (links followed), storing its
// size in *size when `size` is not null; else 0 with *size untouched
// (null path 0). Directories, devices, sockets and pipes give 0.
QUVAIDX_API int IsFileExist(const char* path, int64_t* size);

#ifdef __cplusplus
}  // extern "C"
#endif

#endif  // QUVAIDX_PATH_RULES_H_
