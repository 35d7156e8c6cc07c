// quvaidx send: one request, one reply, over a fresh connection.
//
// The request is parsed and checked before any connection is made, so a
// mistake on the command line never reaches a daemon. The exchange runs on
// one connection and is not repeated, so a request reaches the daemon at
// most once.
#include <getopt.h>
#include <stdio.h>

#include <exception>
#include <memory>
#include <sstream>
#include <string>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/ipc.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "send";
constexpr int kDefaultAttempts = 3;
constexpr int kMaxAttempts = 3600;

void PrintHelp() {
  printf(
      "Usage: quvaidx send --socket PATH [OPTIONS] JSON\n"
      "\n"
      "Sends the JSON object JSON as one request to the daemon listening on\n"
      "the Unix-domain socket PATH and prints its reply.\n"
      "\n"
      "Options:\n"
      "  -s, --socket PATH   the daemon's socket (at most %zu bytes)\n"
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
      "  quvaidx send --socket /tmp/demo.sock '{\"command\":\"HANDSHAKE\"}'\n",
      kMaxSocketPath, kDefaultAttempts);
}

// Turns the reader's report ("* Line 1, Column 2\n  Message\n", possibly
// followed by more errors) into one line about the first error
// ("Line 1, Column 2: Message").
std::string FirstError(const std::string& report) {
  std::istringstream lines(report);
  std::string line, result;
  while (std::getline(lines, line)) {
    size_t start = line.find_first_not_of(" \t");
    if (start == std::string::npos) continue;
    line = line.substr(start);
    if (line.compare(0, 2, "* ") == 0) {
      if (!result.empty()) break;  // the next error starts
      line = line.substr(2);
    }
    if (!result.empty()) result += ": ";
    result += line;
  }
  return result.empty() ? "unknown error" : result;
}

// Parses `text` into `request`. On failure prints one line and returns
// false. The reader limits nesting depth and throws beyond it, so deep input
// is reported like any other syntax error.
bool ParseRequest(const std::string& text, Json::Value* request) {
  // Standard JSON only: no comments, trailing commas or duplicate keys, and
  // nothing after the value. Any value is read, so that a request that is
  // not an object gets its own message below.
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["strictRoot"] = false;
  std::string errors;
  bool ok = false;
  try {
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    ok =
        reader->parse(text.data(), text.data() + text.size(), request, &errors);
  } catch (const std::exception& e) {
    errors = e.what();
  }
  if (!ok) {
    PrintError(kName, "invalid JSON request: " + FirstError(errors));
    return false;
  }
  if (!request->isObject()) {
    PrintError(kName,
               "the request must be a JSON object, such as "
               "'{\"command\":\"HANDSHAKE\"}'");
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

void PrintReply(const Json::Value& reply, bool compact) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = compact ? "" : "  ";
  std::string text = Json::writeString(builder, reply);
  fprintf(stdout, "%s\n", text.c_str());
  fflush(stdout);
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
      {"handshake", no_argument, nullptr, 'H'},
      {"attempts", required_argument, nullptr, 'a'},
      {"compact", no_argument, nullptr, 'c'},
      {"verbose", no_argument, nullptr, 'v'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  std::string path;
  bool handshake = false;
  bool compact = false;
  int attempts = kDefaultAttempts;
  optind = 0;
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, ":s:a:cvh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 's':
        path = optarg;
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
  if (path.empty()) return UsageError(kName, "--socket PATH is required");
  if (!CheckSocketPath(kName, path)) return kExitError;

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
  PrintReply(value, compact);
  return ReplySucceeded(value) ? kExitOk : kExitFalse;
}

}  // namespace quvaidx_cli
