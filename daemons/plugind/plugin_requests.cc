// Map of this file:
//   1. request helpers: guarded reads, replies, the peer's identity
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
#include <stdio.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include <quvahost/quvahost.h>
#include <quvaidx/codec_names.h>
#include <quvaidx/daemon.h>
#include <quvaidx/daemon_info.h>
#include <quvaidx/ea_file.h>
#include <quvaidx/media_type.h>
#include <quvaidx/mediainfo.h>
#include <quvaidx/path_rules.h>
#include <quvaidx/system.h>

#include "atomic_file.h"
#include "media_parser_query.h"
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

// While it lives, the calling thread's file access is the peer's: its own
// identity for a peer that is neither root nor the daemon's own user.
class AsPeer {
 public:
  explicit AsPeer(const quvaidx_daemons::FsUser& peer) {
    if (peer.uid != 0 && peer.uid != geteuid()) {
      identity_ = std::make_unique<quvaidx_daemons::FsIdentity>(peer);
    }
  }
  // False when the peer's identity could not be taken: nothing may be done
  // for it then.
  bool ok() const { return identity_ == nullptr || identity_->taken(); }

 private:
  std::unique_ptr<quvaidx_daemons::FsIdentity> identity_;
};

constexpr char kNoRights[] = "cannot take the rights of the asking process";

// A descriptor closed when it goes out of scope.
class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() {
    if (fd_ >= 0) close(fd_);  // read or already synced: nothing to lose
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

// The folder part and the last component of an absolute path ("/" for a
// file at the root).
void SplitPath(const std::string& path, std::string* folder,
               std::string* name) {
  const size_t slash = path.rfind('/');
  *folder = slash == 0 ? "/" : path.substr(0, slash);
  *name = path.substr(slash + 1);
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
// in bytewise name order, as the thumbnail daemon lists them, into *first
// ("" for none). Returns 0, or the errno that kept the folder from being
// listed.
int RepresentativePhoto(const std::string& folder, std::string* first) {
  DIR* dir = opendir(folder.c_str());
  if (dir == nullptr) return errno;
  const int fd = dirfd(dir);
  first->clear();
  errno = 0;
  while (struct dirent* entry = readdir(dir)) {
    const char* name = entry->d_name;
    if (!EntryNameShouldIndex(name) || !BlQUVAIndexIsPhotoOnWebFile(name) ||
        (!first->empty() && strcmp(name, first->c_str()) >= 0)) {
      continue;
    }
    struct stat st;
    if (fstatat(fd, name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
        S_ISREG(st.st_mode)) {
      *first = name;
    }
    errno = 0;
  }
  const int err = errno;
  closedir(dir);
  return err;
}

int ThumbSizeMap(const quvaidx_daemons::FsUser& peer,
                 const Json::Value& request, bool folder, Json::Value* reply) {
  std::string path;
  if (!PathMember(request, "path", &path, reply)) return 0;
  const Json::Value& type = request["type"];
  if (!type.isIntegral() || !type.isInt() || type.asInt() != THUMB_TYPE_PHOTO) {
    return Fail(reply, "\"type\" must be 1: only photo thumbnails are made");
  }
  AsPeer as_peer(peer);
  if (!as_peer.ok()) return Fail(reply, kNoRights);
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return Fail(reply, strerror(errno));
  std::string photo;
  if (folder) {
    if (!S_ISDIR(st.st_mode)) return Fail(reply, "not a directory");
    std::string name;
    const int err = RepresentativePhoto(path, &name);
    if (err != 0) return Fail(reply, strerror(err));
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

// True when `path` is a regular file that the calling thread may open for
// reading (opened without waiting on a FIFO or device, and closed again);
// else false with *reason set.
bool ReadableFile(const std::string& path, std::string* reason) {
  Descriptor file(
      open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (file.get() < 0) {
    *reason = errno == ENOENT ? "no such file" : strerror(errno);
    return false;
  }
  struct stat st;
  if (fstat(file.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    *reason = "not a regular file";
    return false;
  }
  return true;
}

int VideoNeedConvert(const PluginConfig& config,
                     const quvaidx_daemons::FsUser& peer,
                     const Json::Value& request, Json::Value* reply) {
  std::string path;
  if (!PathMember(request, "path", &path, reply)) return 0;
  Json::Value answer = MakeResponse(true, nullptr);
  answer["result"] = 0;
  std::string problem;
  std::string converted;
  {
    AsPeer as_peer(peer);
    if (!as_peer.ok()) return Fail(reply, kNoRights);
    if (!ReadableFile(path, &problem)) return Fail(reply, problem);
    if (BlQUVAIndexIsVideoFile(path.c_str())) converted = ConvertedCopy(path);
  }
  if (!BlQUVAIndexIsVideoFile(path.c_str())) {
    *reply = answer;
    return 0;
  }
  if (!converted.empty()) {
    answer["converted"] = converted;
    *reply = answer;
    return 0;
  }
  // The media parser is asked with the peer's credentials, so it opens the
  // file as the peer: whatever is at the path by then, it reads only what
  // the peer could.
  Json::Value media;
  problem = AskMediaInfo(config, peer, path, &media);
  if (!problem.empty()) return Fail(reply, problem);
  // About 13 KB, so not on a worker's stack.
  auto record = std::make_unique<__tag_QUVA_MEDIA_INFO>();
  MediaInfoJson2Object(media, *record);
  const std::string video_codec = record->szVideoCodec;
  const std::string audio_codec = record->szAudioCodec;
  const std::string container = record->szContainerType;
  answer["result"] =
      WebPlayable(video_codec, audio_codec, container, path) ? 0 : 1;
  answer["video_codec"] = video_codec;
  answer["audio_codec"] = audio_codec;
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

// The EA directory of `video` as the peer reaches it, without a link at the
// metadata directory or below: the descriptor, or -1 with *reason set.
int VideoEADir(const std::string& video, std::string* reason) {
  std::string folder, name;
  SplitPath(video, &folder, &name);
  Descriptor folder_fd(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  struct stat st;
  if (folder_fd.get() < 0 ||
      fstatat(folder_fd.get(), name.c_str(), &st, 0) != 0 ||
      !S_ISREG(st.st_mode)) {
    *reason = "\"src\" must name an existing video";
    return -1;
  }
  int ea_dir = OpenEADir(video.c_str(), folder_fd.get(), 0);
  if (ea_dir < 0) {
    *reason = std::string("no EA directory beside ") + video + ": " +
              (errno == ELOOP ? "a link is in the way" : strerror(errno));
  }
  return ea_dir;
}

// True when the folder of `path` is the directory `dir_fd`: the same one,
// whatever path leads there.
bool FolderIs(const std::string& path, int dir_fd) {
  std::string folder, name;
  SplitPath(path, &folder, &name);
  Descriptor folder_fd(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  struct stat there, dir;
  return folder_fd.get() >= 0 && fstat(folder_fd.get(), &there) == 0 &&
         fstat(dir_fd, &dir) == 0 && there.st_dev == dir.st_dev &&
         there.st_ino == dir.st_ino;
}

int ConvertAdd(const quvaidx_daemons::FsUser& peer, const Json::Value& request,
               Json::Value* reply) {
  if (!request.isObject() || !request["src"].isObject() ||
      !request["convert"].isObject()) {
    return Fail(reply, "\"src\" and \"convert\" must be media records");
  }
  auto source = std::make_unique<__tag_QUVA_MEDIA_INFO>();
  auto converted = std::make_unique<__tag_QUVA_MEDIA_INFO>();
  Json::Value record(Json::objectValue);
  record["src"] = CleanRecord(request["src"], source.get());
  record["convert"] = CleanRecord(request["convert"], converted.get());
  const std::string video = source->szPath;
  const std::string copy = converted->szPath;
  if (video.empty() || video[0] != '/' ||
      !BlQUVAIndexIsVideoFile(video.c_str())) {
    return Fail(reply, "\"src\" must name an existing video");
  }
  std::string copy_folder, name;
  SplitPath(copy, &copy_folder, &name);
  char type[64];
  if (copy.empty() || copy[0] != '/' ||
      ConvertVideoTypeGet(name.c_str(), type, sizeof(type)) != 1) {
    return Fail(reply, "\"convert\" must be named as a converted video");
  }
  record["conversion_type"] = type;
  if (request.isMember("package")) record["package"] = request["package"];

  // The peer's own work from here: the kernel decides what it may reach
  // and whether it may write there.
  AsPeer as_peer(peer);
  if (!as_peer.ok()) return Fail(reply, kNoRights);
  std::string problem;
  Descriptor ea_dir(VideoEADir(video, &problem));
  if (ea_dir.get() < 0) return Fail(reply, problem);
  // The copy is that item of the video's EA directory if its path leads
  // there, and present.
  struct stat item;
  if (!FolderIs(copy, ea_dir.get()) ||
      fstatat(ea_dir.get(), name.c_str(), &item, AT_SYMLINK_NOFOLLOW) != 0 ||
      !S_ISREG(item.st_mode) || item.st_size < 2) {
    return Fail(reply, "no converted copy " + name + " beside " + video);
  }
  const std::string text = record.toStyledString();
  // Readable as the copy is, no more.
  const mode_t mode = S_IRUSR | S_IWUSR | (item.st_mode & 0044);
  problem = quvaidx_daemons::WriteAtomicallyAt(
      ea_dir.get(), name + ".json", ".part-", text.data(), text.size(),
      [mode](int fd) {
        return fchmod(fd, mode) == 0 ? "" : std::string(strerror(errno));
      },
      true, "the record");
  if (!problem.empty()) return Fail(reply, problem);
  *reply = MakeResponse(true, nullptr);
  (*reply)["record"] = copy + ".json";
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

bool AnsweredAtOnce(const Json::Value& request) {
  std::string command;
  TextMember(request, "command", &command);
  return command != "GET_THUMB_SIZE_MAP" &&
         command != "GET_DIR_THUMB_SIZE_MAP" &&
         command != "IS_VIDEO_NEED_CONVERT" && command != "INDEX_CONVERT_ADD";
}

int HandlePluginRequest(const PluginConfig& config,
                        const quvaidx_daemons::FsUser& peer,
                        const Json::Value& request, Json::Value* reply) {
  try {
    std::string command;
    TextMember(request, "command", &command);
    if (command == "HANDSHAKE") {
      *reply = MakeResponse(true, nullptr);
      return 0;
    }
    if (command == "GET_THUMB_SIZE_MAP") {
      return ThumbSizeMap(peer, request, false, reply);
    }
    if (command == "GET_DIR_THUMB_SIZE_MAP") {
      return ThumbSizeMap(peer, request, true, reply);
    }
    if (command == "GET_ALL_PLUGIN_NAME") return AllPluginNames(config, reply);
    if (command == "IS_VIDEO_NEED_CONVERT") {
      return VideoNeedConvert(config, peer, request, reply);
    }
    if (command == "INDEX_CONVERT_ADD") return ConvertAdd(peer, request, reply);
    return Fail(reply, "unknown command");
  } catch (...) {  // out of memory: answer, never end the daemon
    return Fail(reply, "internal error");
  }
}

}  // namespace plugind
