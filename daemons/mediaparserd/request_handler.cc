#include "request_handler.h"

#include <memory>
#include <string>

#include <quvaidx/daemon.h>

namespace mediaparserd {
namespace {

const char* KindName(MediaKind kind) {
  switch (kind) {
    case MediaKind::kVideo:
      return "video";
    case MediaKind::kPhoto:
      return "photo";
    case MediaKind::kMusic:
      break;
  }
  return "music";
}

}  // namespace

void HandleRequest(MediaParser* parser, const Json::Value& request,
                   Json::Value* reply, const PeerIdentity* peer) {
  std::string command;
  if (request.isObject() && request["command"].isString()) {
    command = request["command"].asString();
  }
  if (command == "HANDSHAKE") {
    *reply = MakeResponse(true, nullptr);
    return;
  }
  if (command != "GET_MEDIA_INFO" && command != "GET_MEDIA_RESOLUTION" &&
      command != "GET_VIDEO_METADATA") {
    *reply = MakeResponse(false, "unknown command");
    return;
  }
  if (!request["path"].isString()) {
    *reply = MakeResponse(false, "missing \"path\"");
    return;
  }
  // About 13 KB: kept off the stack.
  auto media = std::make_unique<ParsedMedia>();
  std::string reason;
  if (!parser->Parse(request["path"].asString(), media.get(), &reason, peer)) {
    *reply = MakeResponse(false, reason.c_str());
    return;
  }
  if (command == "GET_VIDEO_METADATA" && media->kind != MediaKind::kVideo) {
    *reply = MakeResponse(false, "not a video");
    return;
  }
  *reply = MakeResponse(true, nullptr);
  if (command == "GET_MEDIA_INFO") {
    MediaInfoObject2Json(media->record, (*reply)["media"]);
    (*reply)["media_type"] = KindName(media->kind);
  } else if (command == "GET_MEDIA_RESOLUTION") {
    (*reply)["width"] = media->record.resolutionX;
    (*reply)["height"] = media->record.resolutionY;
  } else {
    VideoMetadataObject2Json(media->video, (*reply)["metadata"]);
  }
}

}  // namespace mediaparserd
