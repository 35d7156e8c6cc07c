// quvamediaparserd: the media-parser daemon. Its life (options, pid file,
// socket, signals) is the common one of daemons/common; each request is
// answered by the media parser (media_parser.h) through request_handler.h.
#include <memory>
#include <string>

#include <json/json.h>
#include <quvaidx/quvaidx.h>

#include "daemon_runner.h"
#include "media_parser.h"
#include "request_handler.h"

namespace {

// The daemon's own settings and its parser, made once the options are read.
struct Daemon {
  double time_limit = 5;     // --time-limit, seconds
  int read_limit_mib = 128;  // --read-limit
  std::unique_ptr<mediaparserd::MediaParser> parser;
};

int Handle(Json::Value& request, Json::Value& reply, EventArgs* args) {
  auto* daemon = static_cast<Daemon*>(args->context);
  // Only about files the asking process could read itself, with the groups
  // it holds.
  PeerCredentials credentials;
  if (GetPeerCredentials(&credentials) != 0) {
    reply = MakeResponse(false, "cannot tell who is asking");
    return 0;
  }
  mediaparserd::PeerIdentity peer;
  peer.uid = credentials.uid;
  peer.gid = credentials.gid;
  if (mediaparserd::PeerNeedsCheck(peer) && GetPeerGroups(&peer.groups) != 0) {
    reply = MakeResponse(false, "cannot tell the groups of who is asking");
    return 0;
  }
  mediaparserd::HandleRequest(daemon->parser.get(), request, &reply, &peer);
  return 0;
}

int Start(struct event_base*, void* context) {
  auto* daemon = static_cast<Daemon*>(context);
  mediaparserd::ParserOptions options;
  options.read.time_ms = static_cast<int64_t>(daemon->time_limit * 1000);
  options.read.bytes = static_cast<int64_t>(daemon->read_limit_mib) << 20;
  mediaparserd::InitMediaLibraries(mediaparserd::kDefaultMaxAlloc);
  daemon->parser = std::make_unique<mediaparserd::MediaParser>(options);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  static Daemon daemon;
  quvaidx_daemons::DaemonSpec spec;
  spec.program = "quvamediaparserd";
  spec.summary = "the media-parser daemon of the media index";
  spec.description =
      "Answers HANDSHAKE, GET_MEDIA_INFO, GET_MEDIA_RESOLUTION and\n"
      "GET_VIDEO_METADATA {\"path\": ABSOLUTE_PATH} on a Unix-domain "
      "socket\nuntil SIGINT or SIGTERM. Files are read with libavformat, "
      "TagLib\nand exiv2; what a file is depends on its content, not its "
      "name.\n";
  spec.options = {
      quvaidx_tools::Seconds("time-limit", 't', 600, &daemon.time_limit,
                             "give up on a file after SECONDS (default 5)"),
      quvaidx_tools::Number("read-limit", 0, "MIB", 1, 4096,
                            &daemon.read_limit_mib,
                            "give up on a file after reading MIB mebibytes\n"
                            "(default 128)"),
  };
  spec.epilog =
      "A file that is not media, cannot be read, or reaches a limit is\n"
      "refused with {\"success\": false, \"reason\": ...}.\n";
  spec.default_socket = QUVAIDX_MEDIAD_SOCKET;
  spec.default_pidfile = QUVAIDX_MEDIAD_PID_FILE;
  spec.handler = Handle;
  spec.context = &daemon;
  spec.start = Start;
  spec.stop = nullptr;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
