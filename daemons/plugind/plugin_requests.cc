// Map of this file:
//   1. request helpers: guarded reads, replies
//   2. thumbnail size maps (GET_THUMB_SIZE_MAP, GET_DIR_THUMB_SIZE_MAP)
//   3. plug-in names (GET_ALL_PLUGIN_NAME)
//   4. videos that need converting (IS_VIDEO_NEED_CONVERT)
//   5. converted copies' records (INDEX_CONVERT_ADD)
//   6. the dispatcher
#include "plugin_requests.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include <quvahost/quvahost.h>
#include <quvaidx/codec_names.h>
#include <quvaidx/daemon.h>
#include <quvaidx/daemon_info.h>
#include <quvaidx/ea_file.h>
#include <quvaidx/ipc.h>
#include <quvaidx/media_type.h>
#include <quvaidx/mediainfo.h>
#include <quvaidx/path_rules.h>
#include <quvaidx/system.h>

#include "atomic_file.h"
#include "preview_names.h"

namespace plugind {
namespace {

// ---------------------------------------------------------------------------
// 1. Request helpers

// Reads through a const reference, so no member is ever added.
bool TextMember(const Json::Value& request, const char* key, std::string* out) {
  if (!request.isObject() || !request[key].isString()) return false;
  *out = request[key].asString();
  return true;
}

// An absolute path without a zero byte, from request[key]; else a refusal
// in *reply.
bool PathMember(const Json::Value& request, const char* key, std::string* path,
                Json::Value* reply) {
  if (!TextMember(request, key, path) || path->empty() || (*path)[0] != '/' ||
      path->find('\0') != std::string::npos) {
    *reply = MakeResponse(
        false,
        (std::string("\"") + key + "\" must be an absolute path").c_str());
    return false;
  }
  return true;
}

int Fail(Json::Value* reply, const std::string& reason) {
  *reply = MakeResponse(false, reason.c_str());
  return 0;
}

bool IsRegularFile(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

// ---------------------------------------------------------------------------
// 2. Thumbnail size maps

// The size map of `photo`, or -1 when the host cannot place its EA
// directory.
int PhotoSizeMap(const std::string& photo) {
  int map = 0;
  for (const quvaidx_daemons::ThumbSize& size : quvaidx_daemons::kThumbSizes) {
    int present = IsEAFileExist2(photo.c_str(), size.name, size.second_name);
    if (present < 0) return -1;
    if (present == 1) map |= size.bit;
  }
  return map;
}

// The folder's representative photo: the first web photo directly in it,
// in bytewise name order, as the thumbnail daemon lists them. "" for none.
std::string RepresentativePhoto(const std::string& folder) {
  DIR* dir = opendir(folder.c_str());
  if (dir == nullptr) return "";
  std::string first;
  const int fd = dirfd(dir);
  while (struct dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (!EntryNameShouldIndex(name) || !BlQUVAIndexIsPhotoOnWebFile(name)) {
      continue;
    }
    if (!first.empty() && strcmp(name, first.c_str()) >= 0) continue;
    struct stat st;
    if (fstatat(fd, name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
        S_ISREG(st.st_mode)) {
      first = name;
    }
  }
  closedir(dir);
  return first;
}

int ThumbSizeMap(const Json::Value& request, bool folder, Json::Value* reply) {
  std::string path;
  if (!PathMember(request, "path", &path, reply)) return 0;
  const Json::Value& type = request["type"];
  if (!type.isIntegral() || !type.isInt() || type.asInt() != THUMB_TYPE_PHOTO) {
    return Fail(reply, "\"type\" must be 1: only photo thumbnails are made");
  }
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return Fail(reply, strerror(errno));
  std::string photo;
  if (folder) {
    if (!S_ISDIR(st.st_mode)) return Fail(reply, "not a directory");
    std::string name = RepresentativePhoto(path);
    if (!name.empty()) photo = (path == "/" ? "" : path) + "/" + name;
  } else {
    if (!S_ISREG(st.st_mode)) return Fail(reply, "not a regular file");
    if (BlQUVAIndexIsPhotoOnWebFile(path.c_str())) photo = path;
  }
  int map = photo.empty() ? 0 : PhotoSizeMap(photo);
  if (map < 0) return Fail(reply, "no metadata directory for " + photo);
  *reply = MakeResponse(true, nullptr);
  (*reply)["size_map"] = map;
  if (folder && !photo.empty()) (*reply)["photo"] = photo;
  return 0;
}

// ---------------------------------------------------------------------------
// 3. Plug-in names

int AllPluginNames(const PluginConfig& config, Json::Value* reply) {
  Json::Value names(Json::arrayValue);
  for (const auto& [name, pid_file] : config.plugins) {
    if (QLIBCProcAliveByPidFile(pid_file.c_str()) != 0) names.append(name);
  }
  *reply = MakeResponse(true, nullptr);
  (*reply)["plugin_names"] = names;
  return 0;
}

// ---------------------------------------------------------------------------
// 4. Videos that need converting

// The converted-video names, '_' form; the ':' form replaces the '_' after
// QUVAPHOTO. ConvertVideoTypeGet knows both.
constexpr const char* kConvertedNames[] = {
    "QUVAPHOTO_FILM_H264.mp4",
    "QUVAPHOTO_FILM_MPEG4.mp4",
    "QUVAPHOTO_FILM_CONVERT_MPEG4.mp4",
    "QUVAPHOTO_FILM_MOBILE.mp4",
    "QUVAPHOTO_FILM_MOBILE_IPHONE",
    "QUVAPHOTO_FILM_MOBILE_ANDROID",
    "QUVAPHOTO_FILM.flv",
    "QUVAPHOTO_FILM_H.mp4",
    "QUVAPHOTO_FILM_M.mp4",
    "QUVAPHOTO_FILM_L.mp4",
};

std::string SecondForm(const char* name) {
  std::string second = name;
  second[strlen("QUVAPHOTO")] = ':';
  return second;
}

// The name of a converted copy of `video` present in its EA directory, or
// "".
std::string ConvertedCopy(const std::string& video) {
  for (const char* name : kConvertedNames) {
    const std::string second = SecondForm(name);
    char found[PATH_MAX];
    if (GetEAFilePath(video.c_str(), name, second.c_str(), found,
                      sizeof(found)) == 0) {
      const char* slash = strrchr(found, '/');
      return slash != nullptr ? slash + 1 : found;
    }
  }
  return "";
}

bool EqualsAny(const std::string& text,
               std::initializer_list<const char*> names) {
  for (const char* name : names) {
    if (strcasecmp(text.c_str(), name) == 0) return true;
  }
  return false;
}

bool StartsWith(const std::string& text, const char* prefix) {
  return strncasecmp(text.c_str(), prefix, strlen(prefix)) == 0;
}

// True when a web browser plays video with these codecs in this container.
bool WebPlayable(const std::string& video, const std::string& audio,
                 const std::string& container, const std::string& path) {
  if (!EqualsAny(video, {"h264", "avc", "avc1"})) return false;
  if (!audio.empty() && !StartsWith(audio, "aac") &&
      !EqualsAny(audio, {"mp4a", "mp3"})) {
    return false;
  }
  if (container.empty()) {
    const char* ext = QUVAIndexExtGet(path.c_str());
    return ext != nullptr && EqualsAny(ext, {"mp4", "m4v", "mov"});
  }
  return container.find("mp4") != std::string::npos ||
         EqualsAny(container, {"mov", "m4v"});
}

// Asks the media parser for the media record of `path`. Waits for its
// reply to begin at most the configured time. "" or what failed.
std::string AskMediaParser(const PluginConfig& config, const std::string& path,
                           __tag_QUVA_MEDIA_INFO* record) {
  int fd = ConnectPeer(config.media_parser_socket.c_str(), false,
                       config.media_parser_attempts);
  if (fd < 0) return "the media parser does not answer";
  Json::Value value(Json::objectValue);
  value["command"] = "GET_MEDIA_INFO";
  value["path"] = path;
  struct pollfd ready = {fd, POLLIN, 0};
  int polled = -1;
  if (SendPacket(fd, value) == 0) {
    do {
      polled = poll(&ready, 1, config.media_parser_timeout_s * 1000);
    } while (polled < 0 && errno == EINTR);
  }
  Json::Value reply;
  const bool received = polled > 0 && RecvPacket(fd, reply) == 0;
  DisconnectPeer(fd);
  if (!received) return "the media parser does not answer";
  if (!reply.isObject() || !reply["success"].isBool() ||
      !reply["success"].asBool()) {
    std::string reason = "the media parser cannot read the file";
    if (reply.isObject() && reply["reason"].isString()) {
      reason += ": " + reply["reason"].asString();
    }
    return reason;
  }
  Json::Value media = reply["media"];
  MediaInfoJson2Object(media, *record);
  return "";
}

int VideoNeedConvert(const PluginConfig& config, const Json::Value& request,
                     Json::Value* reply) {
  std::string path;
  if (!PathMember(request, "path", &path, reply)) return 0;
  if (!IsRegularFile(path)) return Fail(reply, "no such file");
  Json::Value answer = MakeResponse(true, nullptr);
  answer["result"] = 0;
  if (!BlQUVAIndexIsVideoFile(path.c_str())) {
    *reply = answer;
    return 0;
  }
  const std::string converted = ConvertedCopy(path);
  if (!converted.empty()) {
    answer["converted"] = converted;
    *reply = answer;
    return 0;
  }
  // About 13 KB; the loop runs one handler at a time.
  static __tag_QUVA_MEDIA_INFO record;
  std::string problem = AskMediaParser(config, path, &record);
  if (!problem.empty()) return Fail(reply, problem);
  const std::string video = record.szVideoCodec;
  const std::string audio = record.szAudioCodec;
  const std::string container = record.szContainerType;
  answer["result"] = WebPlayable(video, audio, container, path) ? 0 : 1;
  answer["video_codec"] = video;
  answer["audio_codec"] = audio;
  answer["container"] = container;
  *reply = answer;
  return 0;
}

// ---------------------------------------------------------------------------
// 5. Converted copies' records

// The media record `value` as MediaInfoJson2Object reads it, in its JSON
// form: every field present, of its type and within its size.
Json::Value CleanRecord(const Json::Value& value, __tag_QUVA_MEDIA_INFO* out) {
  Json::Value copy = value;
  MediaInfoJson2Object(copy, *out);
  Json::Value clean;
  MediaInfoObject2Json(*out, clean);
  return clean;
}

int ConvertAdd(const Json::Value& request, Json::Value* reply) {
  if (!request.isObject() || !request["src"].isObject() ||
      !request["convert"].isObject()) {
    return Fail(reply, "\"src\" and \"convert\" must be media records");
  }
  static __tag_QUVA_MEDIA_INFO source;
  static __tag_QUVA_MEDIA_INFO converted;
  Json::Value record(Json::objectValue);
  record["src"] = CleanRecord(request["src"], &source);
  record["convert"] = CleanRecord(request["convert"], &converted);
  const std::string video = source.szPath;
  const std::string copy = converted.szPath;
  if (video.empty() || video[0] != '/' || !IsRegularFile(video) ||
      !BlQUVAIndexIsVideoFile(video.c_str())) {
    return Fail(reply, "\"src\" must name an existing video");
  }
  const size_t slash = copy.rfind('/');
  const std::string name =
      slash == std::string::npos ? copy : copy.substr(slash + 1);
  char type[64];
  if (ConvertVideoTypeGet(name.c_str(), type, sizeof(type)) != 1) {
    return Fail(reply, "\"convert\" must be named as a converted video");
  }
  // The copy must be that item of the source's EA directory, and present.
  char item[PATH_MAX];
  if (GetEAFilePath(video.c_str(), name.c_str(), name.c_str(), item,
                    sizeof(item)) != 0 ||
      copy != item) {
    return Fail(reply, "no converted copy " + name + " beside " + video);
  }
  record["conversion_type"] = type;
  if (request.isMember("package")) record["package"] = request["package"];
  const std::string path = std::string(item) + ".json";
  const std::string text = record.toStyledString();
  std::string problem = quvaidx_daemons::WriteAtomically(
      path, ".", text.data(), text.size(), 0644, true, "the record");
  if (!problem.empty()) return Fail(reply, problem);
  *reply = MakeResponse(true, nullptr);
  (*reply)["record"] = path;
  return 0;
}

}  // namespace

// ---------------------------------------------------------------------------
// 6. The dispatcher

PluginConfig DefaultConfig() {
  PluginConfig config;
  config.media_parser_socket = DaemonInfo().get("mediad", "sock");
  for (const quvaidx_daemons::PreviewPlugin& plugin :
       quvaidx_daemons::kPreviewPlugins) {
    config.plugins.emplace_back(plugin.name, plugin.pid_file);
  }
  return config;
}

int HandlePluginRequest(const PluginConfig& config, const Json::Value& request,
                        Json::Value* reply) {
  try {
    std::string command;
    TextMember(request, "command", &command);
    if (command == "HANDSHAKE") {
      *reply = MakeResponse(true, nullptr);
      return 0;
    }
    if (command == "GET_THUMB_SIZE_MAP")
      return ThumbSizeMap(request, false, reply);
    if (command == "GET_DIR_THUMB_SIZE_MAP") {
      return ThumbSizeMap(request, true, reply);
    }
    if (command == "GET_ALL_PLUGIN_NAME") return AllPluginNames(config, reply);
    if (command == "IS_VIDEO_NEED_CONVERT") {
      return VideoNeedConvert(config, request, reply);
    }
    if (command == "INDEX_CONVERT_ADD") return ConvertAdd(request, reply);
    return Fail(reply, "unknown command");
  } catch (...) {  // out of memory: answer, never end the daemon
    return Fail(reply, "internal error");
  }
}

}  // namespace plugind
