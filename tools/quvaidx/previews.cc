// quvaidx sizemap and quvaidx plugins: the plug-in daemon's answers about
// previews, as the library's callers receive them.
//
// Both send exactly the requests of QUVAIDX_GetThumbSizeMap (for a file),
// QUVAIDX_GetDirThumbSizeMap (for a directory) and QUVAIDX_GetAllPluginName
// (type 1 for photo thumbnails) and read the replies the same way;
// `plugins` first asks IsQuvaindexAlive, as QUVAIDX_GetAllPluginName does.
// Only the waiting differs: the library's calls wait up to half an hour for
// the daemon, the tool's exchange (daemon_client.h) --attempts (default 3)
// seconds and --timeout in all.
#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "daemon_client.h"
#include "preview_names.h"
#include "quvaidx/index_requests.h"
#include "quvaidx/paths.h"

namespace quvaidx_cli {
namespace {

// What both commands take from the command line.
struct Options {
  DaemonClient client;
  bool json = false;
  bool null_list = false;  // PATH "-": NUL-separated names on stdin
};

// What the --help of each command says.
struct PreviewCommand {
  const char* name;
  const char* usage;
  const char* description;
  const char* epilog;
};

constexpr PreviewCommand kSizeMap = {
    "sizemap", "[OPTIONS] PATH...|-",
    "Asks the plug-in daemon which thumbnails each PATH has: for a file,\n"
    "GET_THUMB_SIZE_MAP; for a directory, GET_DIR_THUMB_SIZE_MAP, which\n"
    "answers for the directory's first photo by name. Prints one line per\n"
    "PATH: the size map in hex, the sizes present and the path (and the\n"
    "photo that stood for a directory). A relative PATH is sent as an\n"
    "absolute path. With -, the PATHs are read from standard input,\n"
    "one per line.\n",
    "Size map bits: XL (1280 pixels) 0x8, B (640) 0x4, M (320) 0x2,\n"
    "S (120) 0x1.\n\n"
    "Exit status: 0 when the daemon answered for every PATH, 1 when it\n"
    "refused one (its reason is printed), 2 on a usage error, a missing\n"
    "PATH or no answer.\n"};

constexpr PreviewCommand kPlugins = {
    "plugins", "[OPTIONS]",
    "Asks the plug-in daemon which preview plug-ins run\n"
    "(GET_ALL_PLUGIN_NAME) and prints one name per line. As\n"
    "QUVAIDX_GetAllPluginName does, it asks only while the index daemon\n"
    "is alive by its pid file (" QUVAIDX_INDEX_PID_FILE ").\n",
    "Exit status: 0 when the daemon answered, 1 when it refused, 2 on a\n"
    "usage error, when the index daemon is not running or on no answer.\n"};

// The command line of `command` with the options both commands share.
quvaidx_tools::CommandLine MakeLine(const PreviewCommand& command,
                                    Options* options) {
  options->client = IndexDaemonClient("plugind");
  std::vector<quvaidx_tools::Option> flags = {
      JsonOption(&options->json, "print JSON")};
  if (&command == &kSizeMap) flags.push_back(NullOption(&options->null_list));
  for (quvaidx_tools::Option& option :
       DaemonOptions(&options->client,
                     "the plug-in daemon's socket\n"
                     "(default " +
                         options->client.socket + ")")) {
    flags.push_back(std::move(option));
  }
  return Subcommand(command.name, {command.usage}, command.description,
                    std::move(flags), command.epilog);
}

// One exchange with the daemon. Returns kExitOk with the reply in *value,
// kExitFalse (reason printed) when it answered without success, kExitError
// when it did not answer (why printed).
int Ask(const char* name, const Options& options, Json::Value* value) {
  if (Exchange(name, options.client, value) != kExitOk) return kExitError;
  if (!Succeeded(*value)) {
    const Json::Value& reply = *value;
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
  std::vector<std::string> paths;
  if (int status =
          ParseCommand(MakeLine(kSizeMap, &options),
                       {"PATH", 1, -1, &options.null_list}, argc, argv, &paths);
      status != kContinue) {
    return status;
  }
  Json::Value all(Json::arrayValue);
  int result = kExitOk;
  for (const std::string& given : paths) {
    std::string path;
    struct stat st;
    if (!ResolvePath("sizemap", given, &path) || stat(path.c_str(), &st) != 0) {
      return kExitError;
    }
    Json::Value value(Json::objectValue);
    value["command"] =
        S_ISDIR(st.st_mode) ? "GET_DIR_THUMB_SIZE_MAP" : "GET_THUMB_SIZE_MAP";
    value["path"] = path;
    value["type"] = static_cast<int>(THUMB_TYPE_PHOTO);
    int exchanged = Ask("sizemap", options, &value);
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
  std::vector<std::string> none;
  if (int status = ParseCommand(MakeLine(kPlugins, &options),
                                {"", 0, 0, nullptr}, argc, argv, &none);
      status != kContinue) {
    return status;
  }
  if (IsQuvaindexAlive() != 1) {
    PrintError("plugins", "the index daemon is not running (" +
                              std::string(QUVAIDX_INDEX_PID_FILE) +
                              " names no live process): nothing was asked");
    return kExitError;
  }
  Json::Value value(Json::objectValue);
  value["command"] = "GET_ALL_PLUGIN_NAME";
  int exchanged = Ask("plugins", options, &value);
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
