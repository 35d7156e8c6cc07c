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
//                           answer makes the reply fail.
//   INDEX_CONVERT_ADD       {"src", "convert"[, "package"]}: records the
//                           converted copy beside it: "convert"'s szPath must
//                           be an item of the EA directory of "src"'s szPath
//                           (a video) under a converted-video name, present
//                           with 2 bytes or more. The record, {"src",
//                           "convert" (both as media records, every field
//                           read as MediaInfoJson2Object reads it),
//                           "conversion_type" (ConvertVideoTypeGet),
//                           "package" (when given)}, is written to
//                           "<item>.json" through a temporary file renamed
//                           into place; its path is in "record".
//
// Anything else: "success" false, "reason" "unknown command".
#ifndef QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_
#define QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_

#include <string>
#include <vector>

#include <json/json.h>

namespace plugind {

// How the daemon reaches the others.
struct PluginConfig {
  // The media parser, asked for a video's codecs.
  std::string media_parser_socket;
  // Connection attempts (one second apart) and seconds to wait for its
  // reply to begin: the daemon answers nobody else meanwhile.
  int media_parser_attempts = 1;
  int media_parser_timeout_s = 5;
  // The preview plug-ins: name and pid file of the daemon that runs it.
  std::vector<std::pair<std::string, std::string>> plugins;
};

// The configuration with the installation's fixed paths.
PluginConfig DefaultConfig();

// Fills `reply` with the answer to `request` (see above). Never throws;
// returns 0 (the connection stays open).
int HandlePluginRequest(const PluginConfig& config, const Json::Value& request,
                        Json::Value* reply);

}  // namespace plugind

#endif  // QUVAIDX_DAEMONS_PLUGIND_PLUGIN_REQUESTS_H_
