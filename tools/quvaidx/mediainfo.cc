// quvaidx mediainfo and quvaidx resolution: the media-parser daemon's
// answers about files, as the library's callers receive them.
//
// Both send exactly the requests of QUVAIDX_GetMediaInfo and
// QUVAIDX_GetMediaResolution ({"command": ..., "path": FILE}, no handshake)
// and read the reply the same way: it counts only when "success" is a boolean
// true or a nonzero number; the record comes from "media" through
// MediaInfoJson2Object, and "width" and "height" are read as 32-bit
// integers (0 when missing or out of range). Only the exchange differs: the
// library's calls wait up to half an hour for a daemon and repeat a request
// whose connection was closed, the tool's exchange (daemon_client.h) tries
// --attempts (default 3) times within --timeout and sends it once. For
// a video, the readable view also asks GET_VIDEO_METADATA, for its rotation
// and pixel aspect.
#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "daemon_client.h"
#include "media_view.h"
#include "quvaidx/ipc.h"
#include "quvaidx/media_type.h"
#include "quvaidx/mediainfo.h"
#include "quvaidx/paths.h"

namespace quvaidx_cli {
namespace {

// The record's fields in their order, for the readable listing.
constexpr const char* kFields[] = {
    "ID",
    "szPath",
    "szName",
    "szDesc",
    "track",
    "disc",
    "year",
    "szTitle",
    "szAlbum",
    "szArtist",
    "szAlbumArtist",
    "szGenre",
    "szComposer",
    "szComment",
    "szMake",
    "szModel",
    "szExposure",
    "szAperture",
    "szTakenTime",
    "szDate",
    "szMDate",
    "duration",
    "audio_bitrate",
    "frame_bitrate",
    "video_bitrate",
    "frame_rate_num",
    "frame_rate_den",
    "frequency",
    "channel",
    "resolutionX",
    "resolutionY",
    "fileSize",
    "song_count",
    "blTitleUTF16",
    "blArtistUTF16",
    "blAlbumUTF16",
    "blGenreUTF16",
    "blComposerUTF16",
    "blCommentUTF16",
    "coverCount",
    "iso",
    "szVideoCodec",
    "szContainerType",
    "videoProfile",
    "videoLevel",
    "szAudioCodec",
    "szFsUUID",
};

// What one invocation asks for, from the command line.
struct Options {
  DaemonClient client;     // the media parser
  bool json = false;       // print JSON instead of the readable view
  bool raw = false;        // print "name: value" lines of the record's fields
  bool all = false;        // raw, and list fields that are 0 or empty too
  bool null_list = false;  // FILE "-": NUL-separated names on stdin
};

// As the library reads "width" and "height": a 32-bit integer (a real
// within range cut toward zero, true as 1), anything else 0.
int32_t ReadInt32(const Json::Value& reply, const char* key) {
  const Json::Value& value = reply[key];
  switch (value.type()) {
    case Json::intValue:
      return value.asInt64() >= INT32_MIN && value.asInt64() <= INT32_MAX
                 ? static_cast<int32_t>(value.asInt64())
                 : 0;
    case Json::uintValue:
      return value.asUInt64() <= INT32_MAX
                 ? static_cast<int32_t>(value.asUInt64())
                 : 0;
    case Json::realValue:
      return value.asDouble() >= INT32_MIN && value.asDouble() <= INT32_MAX
                 ? static_cast<int32_t>(value.asDouble())
                 : 0;
    case Json::booleanValue:
      return value.asBool() ? 1 : 0;
    default:
      return 0;
  }
}

// The media table the index files `file` in, by its name's extension.
const char* TableOf(const std::string& file) {
  std::string name = file.substr(file.rfind('/') + 1);  // npos + 1 == 0
  switch (GetMediaTableTypeFromExt(QUVAIndexExtGet(name.c_str()))) {
    case MEDIA_TABLE_MUSIC:
      return "music";
    case MEDIA_TABLE_VIDEO:
      return "video";
    case MEDIA_TABLE_PHOTO:
      return "photo";
    case MEDIA_TABLE_PLAYLIST:
      return "playlist";
    default:
      return "none";
  }
}

// Runs one request for `file` on the daemon. Returns kExitOk with the reply
// in *reply; kExitFalse (reason printed) when the daemon refused;
// kExitError (message printed) when the request could not be made or no
// reply came.
int Ask(const char* name, const Options& options, const char* command,
        const std::string& file, Json::Value* reply) {
  std::string path = file;
  if (path.empty() || path[0] != '/') {
    char cwd[PATH_MAX];
    if (getcwd(cwd, sizeof(cwd)) == nullptr) {
      PrintError(name, std::string("cannot read the current directory: ") +
                           strerror(errno));
      return kExitError;
    }
    path = std::string(cwd) + "/" + file;
  }
  Json::Value value(Json::objectValue);
  value["command"] = command;
  value["path"] = path;
  if (path.size() >= static_cast<size_t>(kMediaPathSize) ||
      Json::FastWriter().write(value).size() > kMaxSendBody) {
    PrintError(name, file + ": path too long for a request");
    return kExitError;
  }
  if (Exchange(name, options.client, &value) != kExitOk) return kExitError;
  if (!Succeeded(value)) {
    const Json::Value& reason = value.isObject() ? value["reason"] : value;
    PrintError(name, file + ": " +
                         (reason.isString() ? reason.asString()
                                            : "the media parser refused"));
    return kExitFalse;
  }
  reply->swap(value);
  return kExitOk;
}

void PrintRecord(const std::string& file, const Json::Value& media, bool all) {
  printf("%-17s%s\n", "table:", TableOf(file));
  for (const char* field : kFields) {
    const Json::Value& value = media[field];
    std::string text;
    if (value.isString()) {
      text = value.asString();
    } else if (value.type() == Json::realValue) {
      char buffer[64];
      snprintf(buffer, sizeof(buffer), "%g", value.asDouble());
      text = buffer;
    } else if (value.isUInt64()) {
      text = std::to_string(value.asUInt64());
    } else if (value.isInt64()) {
      text = std::to_string(value.asInt64());
    }
    if (!all && (text.empty() || text == "0")) continue;
    printf("%-17s%s\n", (std::string(field) + ":").c_str(), text.c_str());
  }
}

// The command line of `name` ("mediainfo" or "resolution"), whose options
// set *options.
quvaidx_tools::CommandLine MakeLine(const char* name, Options* options) {
  using namespace quvaidx_tools;
  const bool info = strcmp(name, "mediainfo") == 0;
  std::vector<Option> flags = {JsonOption(
      &options->json,
      info ? "print JSON: an array of {\"file\", \"table\", \"media\"}"
           : "print JSON")};
  if (info) {
    flags.push_back(Flag("raw", 'r', &options->raw,
                         "list the record's fields that are set, one\n\"name: "
                         "value\" line each, after the media\ntable of the "
                         "file's extension"));
    flags.push_back(Custom(
        "all", 0, nullptr,
        [options](const char*) {
          options->all = options->raw = true;
          return std::string();
        },
        "as --raw, with the fields that are 0 or\nempty"));
    flags.push_back(NullOption(&options->null_list));
  }
  options->client = IndexDaemonClient("mediad");
  for (Option& option : DaemonOptions(
           &options->client, std::string("the daemon's socket (default\n") +
                                 QUVAIDX_MEDIAD_SOCKET + ")")) {
    flags.push_back(std::move(option));
  }
  return Subcommand(
      name, {info ? "[OPTIONS] FILE...|-" : "[OPTIONS] FILE"},
      std::string(info ? "Asks the media-parser daemon for the media record "
                         "of each\nFILE and shows what it holds: title, "
                         "artist, duration,\ncodecs, camera and the like, one "
                         "labelled line each. With -,\nthe FILEs are read from "
                         "standard input, one per line.\n"
                       : "Asks the media-parser daemon for the pixel size of "
                         "FILE and\nprints it as WIDTHxHEIGHT (0x0 when the "
                         "daemon does not know\nit).\n") +
          "A relative FILE is sent as an absolute path, since the daemon has "
          "a\nworking directory of its own.\n",
      flags,
      "Exit status: 0 when the daemon answered for every FILE, 1 when it\n"
      "refused one (its reason is printed), 2 on a usage error or when no\n"
      "reply could be obtained (why is printed).\n");
}

// Parses the command line of `argv[0]` into *options and *files. Returns
// kContinue to go on, else the exit status.
int ParseOptions(int argc, char** argv, Options* options,
                 std::vector<std::string>* files) {
  const bool info = strcmp(argv[0], "mediainfo") == 0;
  OperandRule rule = {"FILE", 1, info ? -1 : 1,
                      info ? &options->null_list : nullptr};
  return ParseCommand(MakeLine(argv[0], options), rule, argc, argv, files);
}

}  // namespace

int RunMediaInfo(int argc, char** argv) {
  Options options;
  std::vector<std::string> files;
  if (int status = ParseOptions(argc, argv, &options, &files);
      status != kContinue) {
    return status;
  }
  int status = kExitOk;
  Json::Value records(Json::arrayValue);
  for (size_t i = 0; i < files.size(); ++i) {
    const std::string& file = files[i];
    Json::Value reply;
    int result = Ask(argv[0], options, "GET_MEDIA_INFO", file, &reply);
    if (result == kExitError) return kExitError;  // the next would wait too
    if (result != kExitOk) {
      status = result;
      continue;
    }
    __tag_QUVA_MEDIA_INFO record;
    MediaInfoJson2Object(reply["media"], record);
    Json::Value media;
    MediaInfoObject2Json(record, media);
    const Json::Value& kind = reply["media_type"];
    if (options.json) {
      Json::Value& entry = records.append(Json::Value(Json::objectValue));
      entry["file"] = file;
      entry["table"] = TableOf(file);
      if (kind.isString()) entry["media_type"] = kind;
      entry["media"].swap(media);
      continue;
    }
    if (i > 0) printf("\n");
    if (options.raw) {
      PrintRecord(file, media, options.all);
      continue;
    }
    MediaViewExtras extras;
    extras.kind = kind.isString() ? kind.asString() : "";
    extras.table = TableOf(file);
    if (extras.kind == "video") {
      Json::Value answer;
      if (Ask(argv[0], options, "GET_VIDEO_METADATA", file, &answer) ==
          kExitOk) {
        VideoMetadataJson2Object(answer["metadata"], extras.video);
        extras.has_video_metadata = true;
      }
    }
    printf("%s\n", file.c_str());
    for (const std::string& line : MediaViewLines(record, extras)) {
      printf("  %s\n", line.c_str());
    }
  }
  if (options.json) PrintJson(records, false);
  fflush(stdout);
  return status;
}

int RunResolution(int argc, char** argv) {
  Options options;
  std::vector<std::string> file;
  if (int status = ParseOptions(argc, argv, &options, &file);
      status != kContinue) {
    return status;
  }
  Json::Value reply;
  int status = Ask(argv[0], options, "GET_MEDIA_RESOLUTION", file[0], &reply);
  if (status != kExitOk) return status;
  int32_t width = ReadInt32(reply, "width");
  int32_t height = ReadInt32(reply, "height");
  if (options.json) {
    Json::Value out(Json::objectValue);
    out["width"] = width;
    out["height"] = height;
    PrintJson(out, false);
  } else {
    printf("%dx%d\n", width, height);
  }
  return kExitOk;
}

}  // namespace quvaidx_cli
