// The media parser's requests, from a request object to a reply object.
//
//   {"command": "HANDSHAKE"}
//       -> {"success": true}
//   {"command": "GET_MEDIA_INFO", "path": P}
//       -> {"success": true, "media": RECORD, "media_type": "music" |
//           "video" | "photo"}
//   {"command": "GET_MEDIA_RESOLUTION", "path": P}
//       -> {"success": true, "width": W, "height": H} (0 and 0 for music)
//   {"command": "GET_VIDEO_METADATA", "path": P}
//       -> {"success": true, "metadata": {"rotation": R, "par": {"width":
//           W, "height": H}}}, for videos only
//
// Every refusal is MakeResponse(false, reason): "unknown command", "missing
// \"path\"", "not a video", or the parser's reason (media_parser.h). Reading
// the request adds nothing to it.
#ifndef MEDIAPARSERD_REQUEST_HANDLER_H_
#define MEDIAPARSERD_REQUEST_HANDLER_H_

#include <json/json.h>

#include "media_parser.h"

namespace mediaparserd {

// Answers `request` into *reply (replacing what it held) with `parser`;
// with `peer`, only about files that process could read itself.
void HandleRequest(MediaParser* parser, const Json::Value& request,
                   Json::Value* reply, const PeerIdentity* peer = nullptr);

}  // namespace mediaparserd

#endif  // MEDIAPARSERD_REQUEST_HANDLER_H_
