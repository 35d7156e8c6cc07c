// Typed requests to the index service's daemons.
//
// Each call builds one request object {"command": ..., arguments...}, runs
// one exchange with AutoSendRecvPacket (quvaidx/ipc.h) on the daemon's fixed
// socket path (descriptor -1, no handshake, kIndexRequestAttempts connection
// attempts one second apart, so a call waits up to about 30 minutes for a
// daemon that does not accept; once connected it waits for the reply without
// a time limit) and turns the reply into the caller's result:
//
//   call                        socket        "command"
//   QUVAIDX_GetVideoMetadata    media parser  GET_VIDEO_METADATA
//   QUVAIDX_GetMediaResolution  media parser  GET_MEDIA_RESOLUTION
//   QUVAIDX_GetMediaInfo        media parser  GET_MEDIA_INFO
//   QUVAIDX_IsVideoNeedConvert  plug-in       IS_VIDEO_NEED_CONVERT
//   QUVAIDX_IndexConvertAdd     plug-in       INDEX_CONVERT_ADD
//   QUVAIDX_GetThumbSizeMap     plug-in       GET_THUMB_SIZE_MAP
//   QUVAIDX_GetDirThumbSizeMap  plug-in       GET_DIR_THUMB_SIZE_MAP
//   QUVAIDX_GetAllPluginName    plug-in       GET_ALL_PLUGIN_NAME
//
// Who answers. The fixed paths lie in a folder every user can write, so a
// user could bind one while its daemon is down and then receive root's
// requests and forge the replies. The process at the other end of the
// connection (SO_PEERCRED) must therefore be root or run as the caller's
// effective user; with anyone else the connection is closed before
// anything is sent, "[Error] refused <socket>: served by uid <uid> (pid
// <pid>), neither root nor uid <euid>" is logged at level 3, and the
// exchange fails at once, with no further attempts.
//
// Results: 0 on success, -1 on failure, unless a call says otherwise. A
// reply succeeds when it is an object whose "success" reads as true (a
// missing key, or a reply that is not an object, is a failure). Output
// records and values are written only on success; after a failure they are
// unchanged. Result members are read with the guarded reads of
// quvaidx/mediainfo.h: a missing, mistyped or out-of-range integer reads as
// 0, and nothing ever throws.
//
// Log lines carry the module name "quvaidx_ipc" and go straight to the
// system log at LOG_ERR priority, whatever g_log_level: one
// "[Error] <Call>()" line when the exchange fails, after the connection-level
// lines of quvaidx/ipc.h.
//
// Threads. The calls keep no state; each opens its own connection, so they
// may run in several threads at once.
//
// These names are exported with their parameter types (C++ linkage).
#ifndef QUVAIDX_INDEX_REQUESTS_H_
#define QUVAIDX_INDEX_REQUESTS_H_

#include <json/json.h>

#include "quvaidx/export.h"
#include "quvaidx/mediainfo.h"
#include "quvaidx/paths.h"
#include "quvaidx/system.h"  // _tag_THUMB_TYPE_

// Socket of the media-parser daemon: "/tmp/quvamediaparserd_sock".
#define QUVAIDX_MEDIA_PARSER_SOCKET QUVAIDX_MEDIAD_SOCKET
// Socket of the plug-in daemon: "/tmp/quvaindexplugind_sock".
#define QUVAIDX_PLUGIN_SOCKET QUVAIDX_PLUGIND_SOCKET
// Pid file of the index daemon, read by IsQuvaindexAlive:
// "/var/run/quvaindexd.pid".
#define QUVAIDX_INDEX_PID_FILE QUVAIDX_CONTROLD_PID_FILE
// Connection attempts of every typed request.
constexpr int kIndexRequestAttempts = 1800;

// Asks the media parser for the video metadata of `path`.
// On success fills *metadata from the reply's "metadata" as
// VideoMetadataJson2Object does and returns 0.
// REQUIRES: path and metadata are valid.
QUVAIDX_API int QUVAIDX_GetVideoMetadata(const char* path,
                                         _VIDEO_METADATA_* metadata);

// Asks the media parser for the pixel size of `path`.
// On success sets resolution->width and ->height from the reply's "width"
// and "height" (0 when missing or not a 32-bit integer) and returns 0.
QUVAIDX_API int QUVAIDX_GetMediaResolution(const char* path,
                                           Resolution* resolution);

// Asks the media parser for the media information of `path`.
// On success fills *record from the reply's "media" as MediaInfoJson2Object
// does (a missing or non-object "media" gives a zeroed record) and returns 0.
QUVAIDX_API int QUVAIDX_GetMediaInfo(const char* path,
                                     __tag_QUVA_MEDIA_INFO* record);

// Asks the plug-in daemon whether the video `path` needs converting.
// Returns the reply's "result" as an int (0 when missing or mistyped) when
// "success" is true; 0 when the daemon answered with "success" false or
// missing; -1 when the exchange failed.
QUVAIDX_API int QUVAIDX_IsVideoNeedConvert(const char* path);

// Registers a converted video with the plug-in daemon: sends the JSON forms
// of *source under "src" and of *converted under "convert", and `package`
// under "package" unless it is empty (null, {} or []; any string or number
// is sent). Returns 0 when the reply's "success" is true; -1 otherwise,
// logging "fail" when the daemon answered with "success" false or missing.
QUVAIDX_API int QUVAIDX_IndexConvertAdd(__tag_QUVA_MEDIA_INFO* source,
                                        __tag_QUVA_MEDIA_INFO* converted,
                                        Json::Value package);

// Asks the plug-in daemon for the thumbnail size map of the file `path` for
// thumbnail kind `type` (quvaidx/system.h; sent as its integer value under
// "type").
// On success sets *size_map from the reply's "size_map" and returns 0.
QUVAIDX_API int QUVAIDX_GetThumbSizeMap(const char* path, _tag_THUMB_TYPE_ type,
                                        int* size_map);

// As QUVAIDX_GetThumbSizeMap, for the directory `path`.
QUVAIDX_API int QUVAIDX_GetDirThumbSizeMap(const char* path,
                                           _tag_THUMB_TYPE_ type,
                                           int* size_map);

// Asks the plug-in daemon for the names of all plug-ins. Only when
// IsQuvaindexAlive() is 1; otherwise returns -1 at once, sending and
// logging nothing. On success assigns the reply's "plugin_names" (any JSON
// value; null when missing) to `names` and returns 0.
QUVAIDX_API int QUVAIDX_GetAllPluginName(Json::Value& names);

// Returns 1 when the host's QLIBCProcAliveByPidFile reports the index
// daemon (QUVAIDX_INDEX_PID_FILE) alive, else 0.
QUVAIDX_API int IsQuvaindexAlive();

#endif  // QUVAIDX_INDEX_REQUESTS_H_
