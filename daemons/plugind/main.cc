// quvaindexplugind: the plug-in daemon. It answers the library's typed
// plug-in requests (QUVAIDX_GetThumbSizeMap, QUVAIDX_GetDirThumbSizeMap,
// QUVAIDX_GetAllPluginName, QUVAIDX_IsVideoNeedConvert,
// QUVAIDX_IndexConvertAdd) on its socket, as plugin_requests.h describes,
// each for the peer that asks and with its rights. Requests about paths are
// answered by a pool of workers (request_pool.h), so that the loop answers
// everyone else at once while they wait on files or on the media parser.
// Its life (options, pid file, socket, signals) is the common one of
// daemons/common.
#include <unistd.h>

#include <string>
#include <utility>

#include <json/json.h>
#include <quvaidx/quvaidx.h>

#include "daemon_runner.h"
#include "plugin_requests.h"
#include "request_pool.h"

namespace {

struct Daemon {
  plugind::PluginConfig config;
  bool plugins_given = false;  // --plugin replaces the default list
  int workers = 4;             // --workers
  int max_requests = 64;       // --max-requests
  plugind::RequestPool pool;
};

Daemon g_daemon;

// --plugin NAME=PIDFILE. Returns "" or why the value is refused.
std::string AddPlugin(const char* value) {
  std::string text = value;
  size_t equals = text.find('=');
  if (equals == 0 || equals == std::string::npos || equals + 1 == text.size() ||
      text[equals + 1] != '/') {
    return "NAME=PIDFILE, with an absolute PIDFILE";
  }
  if (!g_daemon.plugins_given) g_daemon.config.plugins.clear();
  g_daemon.plugins_given = true;
  g_daemon.config.plugins.emplace_back(text.substr(0, equals),
                                       text.substr(equals + 1));
  return "";
}

int Handle(Json::Value& request, Json::Value& reply, EventArgs* args) {
  auto* daemon = static_cast<Daemon*>(args->context);
  if (plugind::AnsweredAtOnce(request)) {
    return plugind::HandlePluginRequest(
        daemon->config, quvaidx_daemons::FsUser(), request, &reply);
  }
  // Who asks, with the groups its process holds: its requests are answered
  // with its rights.
  PeerCredentials credentials;
  if (GetPeerCredentials(&credentials) != 0) {
    reply = MakeResponse(false, "cannot tell who is asking");
    return 0;
  }
  quvaidx_daemons::FsUser peer;
  peer.uid = credentials.uid;
  peer.gid = credentials.gid;
  if (peer.uid != 0 && peer.uid != geteuid() &&
      GetPeerGroups(&peer.groups) != 0) {
    reply = MakeResponse(false, "cannot tell the groups of who is asking");
    return 0;
  }
  if (!daemon->pool.HasRoom()) {
    AppLogError(4,
                "quvaindexplugind:%d [%s] busy: refused a request of uid "
                "%u, %d requests are being answered",
                __LINE__, args->name, static_cast<unsigned>(peer.uid),
                daemon->pool.taken());
    reply =
        MakeResponse(false, ("busy: " + std::to_string(daemon->max_requests) +
                             " requests are being answered; try again "
                             "later")
                                .c_str());
    return 0;
  }
  DeferredReply* deferred = DeferReply();
  if (deferred == nullptr) {
    reply = MakeResponse(false, "internal error");
    return 0;
  }
  const plugind::PluginConfig* config = &daemon->config;
  daemon->pool.Submit(deferred, [config, peer, request] {
    Json::Value answer;
    plugind::HandlePluginRequest(*config, peer, request, &answer);
    return answer;
  });
  return 0;
}

int Start(struct event_base* base, void* context) {
  auto* daemon = static_cast<Daemon*>(context);
  if (!daemon->pool.Start(base, daemon->workers, daemon->max_requests)) {
    AppLogError(3, "quvaindexplugind:%d [Error] cannot start %d workers",
                __LINE__, daemon->workers);
    return 1;
  }
  daemon->config.stop_fd = daemon->pool.stop_fd();
  return 0;
}

void Stop(void* context) { static_cast<Daemon*>(context)->pool.Stop(); }

}  // namespace

int main(int argc, char** argv) {
  g_daemon.config = plugind::DefaultConfig();
  quvaidx_daemons::DaemonSpec spec;
  spec.program = "quvaindexplugind";
  spec.summary = "the plug-in daemon of the media index";
  spec.description =
      "Answers HANDSHAKE, GET_THUMB_SIZE_MAP, GET_DIR_THUMB_SIZE_MAP,\n"
      "GET_ALL_PLUGIN_NAME, IS_VIDEO_NEED_CONVERT and INDEX_CONVERT_ADD on a\n"
      "Unix-domain socket until SIGINT or SIGTERM: which thumbnails a photo\n"
      "or folder has, which preview plug-ins run, whether a video needs a\n"
      "web copy (asking the media parser for its codecs), and records of\n"
      "converted copies. Each request about a path is answered with the\n"
      "rights of the process that asks, by a pool of workers, while\n"
      "HANDSHAKE and GET_ALL_PLUGIN_NAME are answered at once.\n";
  static const std::string socket = DaemonInfo().get("plugind", "sock");
  static const std::string pid_file = DaemonInfo().get("plugind", "pid");
  spec.default_socket = socket.c_str();
  spec.default_pidfile = pid_file.c_str();
  spec.handler = Handle;
  spec.context = &g_daemon;
  spec.options = {
      quvaidx_daemons::PathOption(
          "media-parser", 'm', "PATH", &g_daemon.config.media_parser_socket,
          "the media parser's socket, asked for videos'\n"
          "codecs (default " +
              g_daemon.config.media_parser_socket + ")"),
      quvaidx_tools::Custom("plugin", 0, "NAME=PIDFILE", AddPlugin,
                            "a preview plug-in, run by the daemon of\n"
                            "PIDFILE; repeatable; replaces the default\n"
                            "list (photo_thumbnail=/var/run/quvamkthumbd.pid,\n"
                            "web_video=/var/run/quvamkflvd.pid)"),
      quvaidx_tools::Number("media-parser-timeout", 0, "SECONDS", 1, 600,
                            &g_daemon.config.media_parser_timeout_s,
                            "give the media parser at most SECONDS per\n"
                            "request (default 5)"),
      quvaidx_tools::Number("workers", 0, "N", 1, 64, &g_daemon.workers,
                            "answer requests about paths with N threads\n"
                            "(default 4)"),
      quvaidx_tools::Number("max-requests", 0, "N", 1, 4096,
                            &g_daemon.max_requests,
                            "take at most N requests about paths at once,\n"
                            "answered or waiting; refuse more (default 64)"),
  };
  spec.epilog =
      "Thumbnail size maps: XL (1280 px) 0x8, B (640) 0x4, M (320) 0x2,\n"
      "S (120) 0x1, for the items QUVAPHOTO_THUMB_<size>.jpg (or\n"
      "QUVAPHOTO:THUMB_<size>.jpg) of a photo's metadata directory.\n";
  spec.start = Start;
  spec.stop = Stop;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
