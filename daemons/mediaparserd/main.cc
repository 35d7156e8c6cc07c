// quvamediaparserd: the media-parser daemon. Its life (options, pid file,
// socket, signals) is the common one of daemons/common; requests are
// answered from what a file's status, name and first bytes tell (see probe.h),
// so the library's media-parser calls (QUVAIDX_GetMediaInfo,
// QUVAIDX_GetMediaResolution, QUVAIDX_GetVideoMetadata) get real answers.
#include <string>

#include <json/json.h>
#include <quvaidx/quvaidx.h>

#include "daemon_runner.h"
#include "probe.h"

namespace {

// GET_* requests name a file by its "path"; anything else in the request
// is ignored. Read through a const reference, so no member is added.
bool PathOf(const Json::Value& request, std::string* path) {
  if (!request["path"].isString()) return false;
  *path = request["path"].asString();
  return true;
}

int Handle(Json::Value& request, Json::Value& reply, EventArgs*) {
  const Json::Value& in = request;
  std::string command;
  if (in.isObject() && in["command"].isString()) {
    command = in["command"].asString();
  }
  if (command == "HANDSHAKE") {
    reply = MakeResponse(true, nullptr);
    return 0;
  }
  if (command != "GET_MEDIA_INFO" && command != "GET_MEDIA_RESOLUTION" &&
      command != "GET_VIDEO_METADATA") {
    reply = MakeResponse(false, "unknown command");
    return 0;
  }
  std::string path, reason;
  if (!PathOf(in, &path)) {
    reply = MakeResponse(false, "missing \"path\"");
    return 0;
  }
  // About 13 KB; the loop runs one handler at a time.
  static __tag_QUVA_MEDIA_INFO record;
  if (!mediaparserd::ProbeMediaFile(path, &record, &reason)) {
    reply = MakeResponse(false, reason.c_str());
    return 0;
  }
  reply = MakeResponse(true, nullptr);
  if (command == "GET_MEDIA_INFO") {
    MediaInfoObject2Json(record, reply["media"]);
  } else if (command == "GET_MEDIA_RESOLUTION") {
    reply["width"] = record.resolutionX;
    reply["height"] = record.resolutionY;
  } else {
    // Rotation and pixel aspect ratio need a decoder: reported unknown (0).
    _VIDEO_METADATA_ metadata = {0, 0, 0};
    VideoMetadataObject2Json(metadata, reply["metadata"]);
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  quvaidx_daemons::DaemonSpec spec;
  spec.program = "quvamediaparserd";
  spec.summary = "the media-parser daemon of the media index";
  spec.description =
      "Answers HANDSHAKE, GET_MEDIA_INFO, GET_MEDIA_RESOLUTION and\n"
      "GET_VIDEO_METADATA {\"path\": ABSOLUTE_PATH} on a Unix-domain "
      "socket\nuntil SIGINT or SIGTERM.\n";
  spec.default_socket = QUVAIDX_MEDIAD_SOCKET;
  spec.default_pidfile = QUVAIDX_MEDIAD_PID_FILE;
  spec.handler = Handle;
  spec.context = nullptr;
  spec.start = nullptr;
  spec.stop = nullptr;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
