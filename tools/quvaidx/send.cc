// quvaidx send: one request, one reply, over a fresh connection.
//
// The request is parsed and checked before any connection is made, so a
// mistake on the command line never reaches a daemon. The exchange runs on
// one connection and is not repeated, so a request reaches the daemon at
// most once.
#include <getopt.h>
#include <stdio.h>

#include <string>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/ipc.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "send";
constexpr int kDefaultAttempts = 3;
constexpr int kMaxAttempts = 3600;

void PrintHelp() {
  printf(
      "Usage: quvaidx send --socket PATH [OPTIONS] JSON\n"
      "       quvaidx send --daemon NAME [OPTIONS] JSON\n"
      "\n"
      "Sends the JSON object JSON as one request to the daemon listening on\n"
      "the Unix-domain socket PATH, or on the socket of the index daemon\n"
      "NAME, and prints its reply.\n"
      "\n"
      "Options:\n"
      "  -s, --socket PATH   the daemon's socket (at most %zu bytes)\n"
      "  -d, --daemon NAME   the socket of the index daemon NAME, one of\n"
      "                      %s\n"
      "                      (see 'quvaidx daemons')\n"
      "      --handshake     have the daemon answer a HANDSHAKE request\n"
      "                      before the request is sent\n"
      "  -a, --attempts N    connection attempts, one second apart "
      "(default %d)\n"
      "  -c, --compact       print the reply on one line\n"
      "  -v, --verbose       also show the library's log lines on stderr\n"
      "  -h, --help          show this help\n"
      "\n"
      "The reply is awaited without a time limit.\n"
      "\n"
      "Exit status:\n"
      "  0  the reply holds \"success\": true\n"
      "  1  the reply holds \"success\": false, or no \"success\" at all\n"
      "  2  usage error, invalid request, or no reply could be obtained\n"
      "\n"
      "Example:\n"
      "  quvaidx send --socket /tmp/demo.sock '{\"command\":\"HANDSHAKE\"}'\n"
      "  quvaidx send --daemon scand --handshake '{\"command\":\"STATS\"}'\n",
      kMaxSocketPath, DaemonNameList().c_str(), kDefaultAttempts);
}

// Parses `text` into `request`. On failure prints one line and returns
// false.
bool ParseRequest(const std::string& text, Json::Value* request) {
  if (!ParseJsonObject(kName, text, "request", "{\"command\":\"HANDSHAKE\"}",
                       request)) {
    return false;
  }
  size_t size = Json::FastWriter().write(*request).size();
  if (size > kMaxSendBody) {
    PrintError(kName, "the request is " + std::to_string(size) +
                          " bytes long; a packet carries at most " +
                          std::to_string(kMaxSendBody));
    return false;
  }
  return true;
}

// Resolves --socket and --daemon into the socket path. On failure prints
// one line and returns false.
bool ChooseSocket(const std::string& socket_arg, const std::string& daemon_arg,
                  bool socket_given, bool daemon_given, std::string* path) {
  if (socket_given && daemon_given) {
    UsageError(kName, "give either --socket PATH or --daemon NAME, not both");
    return false;
  }
  if (!socket_given && !daemon_given) {
    UsageError(kName, "--socket PATH or --daemon NAME is required");
    return false;
  }
  if (daemon_given) {
    // Checked first: the directory's lookup answers an unknown name with
    // an empty path, which would read as a missing option.
    if (!IsDaemonName(daemon_arg)) {
      PrintError(kName, "unknown daemon '" + daemon_arg +
                            "'; known daemons: " + DaemonNameList());
      return false;
    }
    *path = DaemonInfo().get(daemon_arg, "sock");
  } else {
    *path = socket_arg;
  }
  return CheckSocketPath(kName, *path);
}

// The daemon's verdict: only a boolean true "success" counts as success.
bool ReplySucceeded(const Json::Value& reply) {
  if (!reply.isObject()) return false;
  const Json::Value& success = reply["success"];
  return success.isBool() && success.asBool();
}

}  // namespace

int RunSend(int argc, char** argv) {
  static const struct option kOptions[] = {
      {"socket", required_argument, nullptr, 's'},
      {"daemon", required_argument, nullptr, 'd'},
      {"handshake", no_argument, nullptr, 'H'},
      {"attempts", required_argument, nullptr, 'a'},
      {"compact", no_argument, nullptr, 'c'},
      {"verbose", no_argument, nullptr, 'v'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  std::string socket_arg, daemon_arg, path;
  bool socket_given = false, daemon_given = false;
  bool handshake = false;
  bool compact = false;
  int attempts = kDefaultAttempts;
  optind = 0;
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, ":s:d:a:cvh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 's':
        socket_arg = optarg;
        socket_given = true;
        break;
      case 'd':
        daemon_arg = optarg;
        daemon_given = true;
        break;
      case 'H':
        handshake = true;
        break;
      case 'a':
        if (!ParseInt(optarg, 1, kMaxAttempts, &attempts)) {
          return UsageError(kName, std::string("--attempts needs a whole "
                                               "number from 1 to ") +
                                       std::to_string(kMaxAttempts) +
                                       ", not '" + optarg + "'");
        }
        break;
      case 'c':
        compact = true;
        break;
      case 'v':
        EnableVerboseLogging();
        break;
      case 'h':
        PrintHelp();
        return kExitOk;
      default:
        return OptionError(kName, c, argv);
    }
  }
  if (optind >= argc) return UsageError(kName, "missing the JSON request");
  if (argc - optind > 1) {
    return UsageError(kName, std::string("expects one JSON request; "
                                         "unexpected argument '") +
                                 argv[optind + 1] + "'");
  }
  if (!ChooseSocket(socket_arg, daemon_arg, socket_given, daemon_given,
                    &path)) {
    return kExitError;
  }

  Json::Value value;
  if (!ParseRequest(argv[optind], &value)) return kExitError;

  int fd = ConnectPeer(path.c_str(), handshake, attempts);
  if (fd < 0) {
    PrintError(kName, std::string("no daemon answered") +
                          (handshake ? " the handshake" : "") + " on " + path +
                          " after " + std::to_string(attempts) +
                          (attempts == 1 ? " attempt" : " attempts"));
    return kExitError;
  }
  int result = AutoSendRecvPacketByFd(fd, value, 0);
  DisconnectPeer(fd);
  if (result != 0) {
    PrintError(kName,
               "the daemon on " + path +
                   (result == -2 ? " closed the connection before replying"
                                 : " gave no reply (the connection failed "
                                   "or ended early)"));
    return kExitError;
  }
  PrintJson(value, compact);
  return ReplySucceeded(value) ? kExitOk : kExitFalse;
}

}  // namespace quvaidx_cli
