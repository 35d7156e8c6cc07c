// quvaidx sizemap and quvaidx plugins: the plug-in daemon's answers about
// previews, as the library's callers receive them.
//
// Both send exactly the requests of QUVAIDX_GetThumbSizeMap (for a file),
// QUVAIDX_GetDirThumbSizeMap (for a directory) and QUVAIDX_GetAllPluginName
// (one exchange with AutoSendRecvPacket, descriptor -1, no handshake, type 1
// for photo thumbnails) and read the replies the same way; `plugins` first
// asks IsQuvaindexAlive, as QUVAIDX_GetAllPluginName does. Only the number
// of connection attempts differs: the library's calls wait up to half an
// hour for the daemon, the tool --attempts (default 3) seconds.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "options.h"
#include "preview_names.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/ipc.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr int kDefaultAttempts = 3;

// What both commands take from the command line.
struct Options {
  std::string socket = DaemonInfo().get("plugind", "sock");
  int attempts = kDefaultAttempts;
  bool json = false;
  bool verbose = false;
};

void AddCommonOptions(quvaidx_tools::CommandLine* line, Options* options) {
  line->options = {
      quvaidx_tools::Flag("json", 'j', &options->json, "print JSON"),
      quvaidx_tools::Text(
          "socket", 's', "PATH", &options->socket,
          "the plug-in daemon's socket\n(default " + options->socket + ")"),
      quvaidx_tools::Number("attempts", 'a', "N", 1, 3600, &options->attempts,
                            "connection attempts, one second apart\n"
                            "(default 3)"),
      quvaidx_tools::Flag("verbose", 'v', &options->verbose,
                          "also show the library's log lines on stderr"),
  };
}

// One exchange with the daemon. Returns kExitOk with the reply in *value,
// kExitFalse (reason printed) when it answered without success, kExitError
// when it did not answer.
int Exchange(const char* name, const Options& options, Json::Value* value) {
  if (!CheckSocketPath(name, options.socket)) return kExitError;
  if (AutoSendRecvPacket(options.socket.c_str(), -1, *value,
                         options.attempts) != 0) {
    PrintError(name, "no answer from the plug-in daemon on " + options.socket);
    return kExitError;
  }
  const Json::Value& reply = *value;
  if (!reply.isObject() ||
      !reply["success"].isConvertibleTo(Json::booleanValue) ||
      !reply["success"].asBool()) {
    std::string reason = reply.isObject() && reply["reason"].isString()
                             ? reply["reason"].asString()
                             : "no reason given";
    PrintError(name, "the plug-in daemon refused: " + reason);
    return kExitFalse;
  }
  return kExitOk;
}

// "XL,B,M,S" for the bits of `map`, "-" for none.
std::string SizeNames(int map) {
  std::string names;
  for (const quvaidx_daemons::ThumbSize& size : quvaidx_daemons::kThumbSizes) {
    if ((map & size.bit) == 0) continue;
    if (!names.empty()) names += ",";
    names += size.label;
  }
  return names.empty() ? "-" : names;
}

}  // namespace

int RunSizeMap(int argc, char** argv) {
  Options options;
  quvaidx_tools::CommandLine line;
  line.program = "quvaidx sizemap";
  line.usage = {"[OPTIONS] PATH..."};
  line.description =
      "Asks the plug-in daemon which thumbnails each PATH has: for a file,\n"
      "GET_THUMB_SIZE_MAP; for a directory, GET_DIR_THUMB_SIZE_MAP, which\n"
      "answers for the directory's first photo by name. Prints one line per\n"
      "PATH: the size map in hex, the sizes present and the path (and the\n"
      "photo that stood for a directory). A relative PATH is sent as an\n"
      "absolute path.\n";
  AddCommonOptions(&line, &options);
  line.epilog =
      "Size map bits: XL (1280 pixels) 0x8, B (640) 0x4, M (320) 0x2,\n"
      "S (120) 0x1.\n"
      "\n"
      "Exit status: 0 when the daemon answered for every PATH, 1 when it\n"
      "refused one (its reason is printed), 2 on a usage error, a missing\n"
      "PATH or no answer.\n";
  int first = 0;
  int status = quvaidx_tools::ParseCommandLine(line, argc, argv, &first);
  if (status != quvaidx_tools::kContinue) return status;
  if (options.verbose) EnableVerboseLogging();
  if (first >= argc) return UsageError("sizemap", "missing PATH");
  Json::Value all(Json::arrayValue);
  int result = kExitOk;
  for (int i = first; i < argc; ++i) {
    struct stat st;
    if (stat(argv[i], &st) != 0) {
      PrintError("sizemap", std::string(argv[i]) + ": " + strerror(errno));
      return kExitError;
    }
    char* real = GetRealPath(argv[i]);
    if (real == nullptr) return kExitError;
    const std::string path = real;
    free(real);
    const bool folder = S_ISDIR(st.st_mode);
    Json::Value value(Json::objectValue);
    value["command"] = folder ? "GET_DIR_THUMB_SIZE_MAP" : "GET_THUMB_SIZE_MAP";
    value["path"] = path;
    value["type"] = static_cast<int>(THUMB_TYPE_PHOTO);
    int exchanged = Exchange("sizemap", options, &value);
    if (exchanged == kExitError) return kExitError;
    if (exchanged == kExitFalse) {
      result = kExitFalse;
      continue;
    }
    const int map = value["size_map"].isInt() ? value["size_map"].asInt() : 0;
    const std::string photo =
        value["photo"].isString() ? value["photo"].asString() : "";
    if (options.json) {
      Json::Value item(Json::objectValue);
      item["path"] = path;
      item["size_map"] = map;
      item["sizes"] = Json::Value(Json::arrayValue);
      for (const auto& size : quvaidx_daemons::kThumbSizes) {
        if (map & size.bit) item["sizes"].append(size.label);
      }
      if (!photo.empty()) item["photo"] = photo;
      all.append(item);
    } else {
      printf("0x%x\t%s\t%s%s\n", map, SizeNames(map).c_str(), path.c_str(),
             photo.empty() ? "" : (" (photo " + photo + ")").c_str());
    }
  }
  if (options.json) PrintJson(all, false);
  fflush(stdout);
  return result;
}

int RunPlugins(int argc, char** argv) {
  Options options;
  quvaidx_tools::CommandLine line;
  line.program = "quvaidx plugins";
  line.usage = {"[OPTIONS]"};
  line.description =
      "Asks the plug-in daemon which preview plug-ins run\n"
      "(GET_ALL_PLUGIN_NAME) and prints one name per line. As\n"
      "QUVAIDX_GetAllPluginName does, it asks only while the index daemon\n"
      "is alive by its pid file (" QUVAIDX_INDEX_PID_FILE ").\n";
  AddCommonOptions(&line, &options);
  line.epilog =
      "Exit status: 0 when the daemon answered, 1 when it refused, 2 on a\n"
      "usage error, when the index daemon is not running or on no answer.\n";
  int first = 0;
  int status = quvaidx_tools::ParseCommandLine(line, argc, argv, &first);
  if (status != quvaidx_tools::kContinue) return status;
  if (options.verbose) EnableVerboseLogging();
  if (first < argc) {
    return UsageError("plugins",
                      std::string("unexpected argument '") + argv[first] + "'");
  }
  if (IsQuvaindexAlive() != 1) {
    PrintError("plugins", "the index daemon is not running (" +
                              std::string(QUVAIDX_INDEX_PID_FILE) +
                              " names no live process): nothing was asked");
    return kExitError;
  }
  Json::Value value(Json::objectValue);
  value["command"] = "GET_ALL_PLUGIN_NAME";
  int exchanged = Exchange("plugins", options, &value);
  if (exchanged != kExitOk) return exchanged;
  const Json::Value& names = value["plugin_names"];
  if (options.json) {
    PrintJson(names, false);
  } else if (names.isArray()) {
    for (const Json::Value& name : names) {
      printf("%s\n", name.isString() ? name.asCString()
                                     : name.toStyledString().c_str());
    }
  } else {
    PrintJson(names, true);
  }
  fflush(stdout);
  return kExitOk;
}

}  // namespace quvaidx_cli
