// quvaindexplugind: the plug-in daemon. It answers the library's typed
// plug-in requests (QUVAIDX_GetThumbSizeMap, QUVAIDX_GetDirThumbSizeMap,
// QUVAIDX_GetAllPluginName, QUVAIDX_IsVideoNeedConvert,
// QUVAIDX_IndexConvertAdd) on its socket, as plugin_requests.h describes.
// Its life (options, pid file, socket, signals) is the common one of
// daemons/common.
#include <string>

#include <json/json.h>
#include <quvaidx/quvaidx.h>

#include "daemon_runner.h"
#include "plugin_requests.h"

namespace {

plugind::PluginConfig g_config;
bool g_plugins_given = false;  // --plugin replaces the default list

// --plugin NAME=PIDFILE. Returns "" or why the value is refused.
std::string AddPlugin(const char* value) {
  std::string text = value;
  size_t equals = text.find('=');
  if (equals == 0 || equals == std::string::npos || equals + 1 == text.size() ||
      text[equals + 1] != '/') {
    return "NAME=PIDFILE, with an absolute PIDFILE";
  }
  if (!g_plugins_given) g_config.plugins.clear();
  g_plugins_given = true;
  g_config.plugins.emplace_back(text.substr(0, equals),
                                text.substr(equals + 1));
  return "";
}

int Handle(Json::Value& request, Json::Value& reply, EventArgs*) {
  return plugind::HandlePluginRequest(g_config, request, &reply);
}

}  // namespace

int main(int argc, char** argv) {
  g_config = plugind::DefaultConfig();
  quvaidx_daemons::DaemonSpec spec;
  spec.program = "quvaindexplugind";
  spec.summary = "the plug-in daemon of the media index";
  spec.description =
      "Answers HANDSHAKE, GET_THUMB_SIZE_MAP, GET_DIR_THUMB_SIZE_MAP,\n"
      "GET_ALL_PLUGIN_NAME, IS_VIDEO_NEED_CONVERT and INDEX_CONVERT_ADD on a\n"
      "Unix-domain socket until SIGINT or SIGTERM: which thumbnails a photo\n"
      "or folder has, which preview plug-ins run, whether a video needs a\n"
      "web copy (asking the media parser for its codecs), and records of\n"
      "converted copies.\n";
  static const std::string socket = DaemonInfo().get("plugind", "sock");
  static const std::string pid_file = DaemonInfo().get("plugind", "pid");
  spec.default_socket = socket.c_str();
  spec.default_pidfile = pid_file.c_str();
  spec.handler = Handle;
  spec.context = nullptr;
  spec.options = {
      quvaidx_daemons::PathOption(
          "media-parser", 'm', "PATH", &g_config.media_parser_socket,
          "the media parser's socket, asked for videos'\n"
          "codecs (default " +
              g_config.media_parser_socket + ")"),
      quvaidx_tools::Custom("plugin", 0, "NAME=PIDFILE", AddPlugin,
                            "a preview plug-in, run by the daemon of\n"
                            "PIDFILE; repeatable; replaces the default\n"
                            "list (photo_thumbnail=/var/run/quvamkthumbd.pid,\n"
                            "web_video=/var/run/quvamkflvd.pid)"),
      quvaidx_tools::Number("media-parser-timeout", 0, "SECONDS", 1, 600,
                            &g_config.media_parser_timeout_s,
                            "wait at most SECONDS for the media parser's\n"
                            "reply (default 5); nothing else is answered\n"
                            "meanwhile"),
  };
  spec.epilog =
      "Thumbnail size maps: XL (1280 px) 0x8, B (640) 0x4, M (320) 0x2,\n"
      "S (120) 0x1, for the items QUVAPHOTO_THUMB_<size>.jpg (or\n"
      "QUVAPHOTO:THUMB_<size>.jpg) of a photo's metadata directory.\n";
  spec.start = nullptr;
  spec.stop = nullptr;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
