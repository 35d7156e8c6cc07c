// The answers of the plug-in daemon (quvaindexplugind), apart from its
// socket, so that they can be tested without one.
//
// Requests and replies are those of the library's typed calls
// (quvaidx/index_requests.h); every reply has "success", and "reason" when
// it is false. Paths must be absolute.
//
//   HANDSHAKE               {"success": true}
//   GET_THUMB_SIZE_MAP      {"path", "type"}: "size_map", the bits of the
//                           photo's thumbnails present (preview_names.h:
//                           XL 0x8, B 0x4, M 0x2, S 0x1), decided with the
//                           library's IsEAFileExist2 on both names of each
//                           size. A file that is not a web photo has 0. Only
//                           type 1 (photo thumbnails) is known.
//   GET_DIR_THUMB_SIZE_MAP  {"path", "type"}: the same for the folder's
//                           representative photo: the first, in bytewise
//                           name order, of the web photos directly in the
//                           folder (regular files whose names the index
//                           accepts, as the thumbnail daemon picks them),
//                           named in "photo"; 0 and no "photo" when there is
//                           none.
//   GET_ALL_PLUGIN_NAME     "plugin_names": an array of the names of the
//                           preview plug-ins whose daemon is alive by its pid
//                           file ("photo_thumbnail", "web_video").
//   IS_VIDEO_NEED_CONVERT   {"path"}: "result" 1 when the file is a video
//                           (BlQUVAIndexIsVideoFile) that has no converted
//                           copy in its EA directory under any of the
//                           converted-video names (either form) and whose
//                           codecs, as the media parser reports them
//                           (GET_MEDIA_INFO), a web browser cannot play;
//                           else 0. Playable: H.264 video ("h264", "avc",
//                           "avc1"), no audio or AAC ("aac...", "mp4a") or
//                           MP3 audio, in an MP4 or QuickTime container (the
//                           media parser's container name, or the file's
//                           extension mp4, m4v or mov when it names none).
//                           The reply also carries "video_codec",
//                           "audio_codec", "container" and, when a copy
//                           exists, "converted". A media parser that does not
//                           answer in time makes the reply fail.
//   INDEX_CONVERT_ADD       {"src", "convert"[, "package"]}: records the
//                           converted copy beside it: "convert"'s szPath must
//                           resolve to an item, under a converted-video name
//                           and present with 2 bytes or more, of the EA
//                           directory of "src"'s szPath (an existing video).
//                           The record, {"src", "convert" (both as media
//                           records, every field read as
//                           MediaInfoJson2Object reads it),
//                           "conversion_type" (ConvertVideoTypeGet),
//                           "package" (when given)}, is written as
//                           "<item>.json" in that EA directory through a
//                           temporary file renamed into place, readable as
//                           the copy is; its path ("convert"'s szPath and
//                           ".json") is in "record".
//
// Anything else: "success" false, "reason" "unknown command".
//
// Whom it answers for. Every request about a path is answered as the peer
// that asked could answer it itself: its file work (status, folder
// listings, EA items, opening the video, writing the record) is done with
// the peer's file-system identity (its user, group and the groups it holds;
// quvaidx_daemons::FsIdentity), so the kernel decides what it may see, and
// a refusal is the system's reason ("Permission denied"). Root peers and
// peers of the daemon's own user are answered with the daemon's own rights;
// a daemon that is not root cannot take another identity and refuses other
// peers ("cannot take the rights of the asking process").
//
// The EA directory of the video in INDEX_CONVERT_ADD is reached without
// following links (OpenEADir) from the video's folder, and the record is
// created and renamed relative to it: a link planted at the metadata
// directory or below is refused, never followed.
//
// The media parser runs as root and would answer the daemon about any file.
// So the daemon asks it on a connection made with the peer's credentials
// (media_parser_query.h): the media parser then opens the file as the peer,
// and whatever is renamed or swapped at the path after the daemon's own
// check, it reads only what the peer could read itself.
//
// Threads: HandlePluginRequest may run on several threads at once; the
// identity it takes is that of the calling thread alone.
#ifndef QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_
#define QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_

#include <string>
#include <utility>
#include <vector>

#include <json/json.h>

#include "fs_identity.h"

namespace plugind {

// How the daemon reaches the others.
struct PluginConfig {
  // The media parser, asked for a video's codecs; it must run as root or as
  // the daemon's own user (ConnectDaemon refuses anyone else).
  std::string media_parser_socket;
  // Seconds for the whole exchange with it: connecting, asking, its reply.
  int media_parser_timeout_s = 5;
  // A descriptor that becomes readable when the daemon stops, which cuts a
  // wait on the media parser short; -1 for none.
  int stop_fd = -1;
  // The preview plug-ins: name and pid file of the daemon that runs it.
  std::vector<std::pair<std::string, std::string>> plugins;
};

// The configuration with the installation's fixed paths.
PluginConfig DefaultConfig();

// True when `request` is answered without any file work or other daemon
// (HANDSHAKE, GET_ALL_PLUGIN_NAME, and any request that is refused for its
// command alone), so that an event loop may answer it at once.
bool AnsweredAtOnce(const Json::Value& request);

// Fills `reply` with the answer to `request` (see above) for `peer`. Never
// throws; returns 0 (the connection stays open).
int HandlePluginRequest(const PluginConfig& config,
                        const quvaidx_daemons::FsUser& peer,
                        const Json::Value& request, Json::Value* reply);

}  // namespace plugind

#endif  // QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_
