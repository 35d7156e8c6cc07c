// Typed requests to the media-parser and plug-in daemons (module
// quvaidx_ipc): one request object, one exchange, the reply read with the
// guarded reads so that no reply can make a call throw.
#include <string.h>
#include <syslog.h>

#include "ipc/client_internal.h"
#include "quvahost/quvahost.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "requests/index_requests_internal.h"
#include "util/json_read.h"
#include "util/log_internal.h"

namespace {

constexpr char kModule[] = "quvaidx_ipc";

quvaidx::IndexSockets g_sockets = {QUVAIDX_MEDIA_PARSER_SOCKET,
                                   QUVAIDX_PLUGIN_SOCKET};

enum class Outcome {
  kExchangeFailed,  // no reply: the caller logs its error line
  kRefused,         // a reply whose "success" is not true
  kDone,            // "success" true; the reply is in the request value
};

// Sends `value` to the daemon at `socket` and leaves the reply in it. Only
// root or this process's own user may answer: a stranger who bound the
// fixed path while the daemon was down gets nothing.
Outcome Exchange(const char* socket, Json::Value& value) {
  if (quvaidx::ExchangeWithDaemon(socket, value, kIndexRequestAttempts) == -1) {
    return Outcome::kExchangeFailed;
  }
  return quvaidx::ReadBool(quvaidx::MemberOf(value, "success"))
             ? Outcome::kDone
             : Outcome::kRefused;
}

Json::Value Request(const char* command) {
  Json::Value request(Json::objectValue);
  request["command"] = command;
  return request;
}

Json::Value PathRequest(const char* command, const char* path) {
  Json::Value request = Request(command);
  request["path"] = path;
  return request;
}

int ThumbSizeMap(const char* command, const char* path, _tag_THUMB_TYPE_ type,
                 int* size_map, Outcome* outcome) {
  Json::Value value = PathRequest(command, path);
  value["type"] = static_cast<int>(type);
  *outcome = Exchange(g_sockets.plugin, value);
  if (*outcome != Outcome::kDone) return -1;
  *size_map = quvaidx::ReadInt32(quvaidx::MemberOf(value, "size_map"));
  return 0;
}

}  // namespace

namespace quvaidx {

IndexSockets SetIndexSockets(IndexSockets sockets) {
  IndexSockets previous = g_sockets;
  g_sockets.media_parser = sockets.media_parser != nullptr
                               ? sockets.media_parser
                               : QUVAIDX_MEDIA_PARSER_SOCKET;
  g_sockets.plugin =
      sockets.plugin != nullptr ? sockets.plugin : QUVAIDX_PLUGIN_SOCKET;
  return previous;
}

}  // namespace quvaidx

// Every call below catches what jsoncpp may still throw (running out of
// memory) and reports it as a failure, since no exception may leave the
// library.

int QUVAIDX_GetVideoMetadata(const char* path, _VIDEO_METADATA_* metadata) {
  try {
    Json::Value value = PathRequest("GET_VIDEO_METADATA", path);
    Outcome outcome = Exchange(g_sockets.media_parser, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetVideoMetadata(): %s",
                         kModule, __LINE__, path);
    }
    if (outcome != Outcome::kDone) return -1;
    _VIDEO_METADATA_ result;
    VideoMetadataJson2Object(value["metadata"], result);
    *metadata = result;
    return 0;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_GetMediaResolution(const char* path, Resolution* resolution) {
  try {
    Json::Value value = PathRequest("GET_MEDIA_RESOLUTION", path);
    Outcome outcome = Exchange(g_sockets.media_parser, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetMediaResolution()", kModule,
                         __LINE__);
    }
    if (outcome != Outcome::kDone) return -1;
    resolution->width = quvaidx::ReadInt32(quvaidx::MemberOf(value, "width"));
    resolution->height = quvaidx::ReadInt32(quvaidx::MemberOf(value, "height"));
    return 0;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_GetMediaInfo(const char* path, __tag_QUVA_MEDIA_INFO* record) {
  try {
    Json::Value value = PathRequest("GET_MEDIA_INFO", path);
    Outcome outcome = Exchange(g_sockets.media_parser, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetMediaInfo()", kModule,
                         __LINE__);
    }
    if (outcome != Outcome::kDone) return -1;
    // Converted aside first, so the caller's record changes only whole.
    __tag_QUVA_MEDIA_INFO result;
    MediaInfoJson2Object(value["media"], result);
    memcpy(record, &result, sizeof(result));
    return 0;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_IsVideoNeedConvert(const char* path) {
  try {
    Json::Value value = PathRequest("IS_VIDEO_NEED_CONVERT", path);
    Outcome outcome = Exchange(g_sockets.plugin, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] IsVideoNeedConvert()", kModule,
                         __LINE__);
      return -1;
    }
    if (outcome == Outcome::kRefused) return 0;
    return quvaidx::ReadInt32(quvaidx::MemberOf(value, "result"));
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_IndexConvertAdd(__tag_QUVA_MEDIA_INFO* source,
                            __tag_QUVA_MEDIA_INFO* converted,
                            Json::Value package) {
  try {
    Json::Value value = Request("INDEX_CONVERT_ADD");
    MediaInfoObject2Json(*source, value["src"]);
    MediaInfoObject2Json(*converted, value["convert"]);
    if (!package.empty()) value["package"].swap(package);
    Outcome outcome = Exchange(g_sockets.plugin, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] IndexConvertAdd()", kModule,
                         __LINE__);
      return -1;
    }
    if (outcome == Outcome::kRefused) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d fail", kModule, __LINE__);
      return -1;
    }
    return 0;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_GetThumbSizeMap(const char* path, _tag_THUMB_TYPE_ type,
                            int* size_map) {
  try {
    Outcome outcome = Outcome::kRefused;
    int result =
        ThumbSizeMap("GET_THUMB_SIZE_MAP", path, type, size_map, &outcome);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetThumbSizeMap()", kModule,
                         __LINE__);
    }
    return result;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_GetDirThumbSizeMap(const char* path, _tag_THUMB_TYPE_ type,
                               int* size_map) {
  try {
    Outcome outcome = Outcome::kRefused;
    int result =
        ThumbSizeMap("GET_DIR_THUMB_SIZE_MAP", path, type, size_map, &outcome);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetDirThumbSizeMap()", kModule,
                         __LINE__);
    }
    return result;
  } catch (...) {
    return -1;
  }
}

int QUVAIDX_GetAllPluginName(Json::Value& names) {
  if (IsQuvaindexAlive() == 0) return -1;
  try {
    Json::Value value = Request("GET_ALL_PLUGIN_NAME");
    Outcome outcome = Exchange(g_sockets.plugin, value);
    if (outcome == Outcome::kExchangeFailed) {
      quvaidx::LogDirect(LOG_ERR, "%s:%d [Error] GetAllPluginName()", kModule,
                         __LINE__);
    }
    if (outcome != Outcome::kDone) return -1;
    Json::Value result = quvaidx::MemberOf(value, "plugin_names");
    names.swap(result);
    return 0;
  } catch (...) {
    return -1;
  }
}

int IsQuvaindexAlive() {
  return QLIBCProcAliveByPidFile(QUVAIDX_INDEX_PID_FILE) != 0 ? 1 : 0;
}
