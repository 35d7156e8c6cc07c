// quvaidx send: one request, one reply, over a fresh connection.
//
// The request is parsed and checked before any connection is made, so a
// mistake on the command line never reaches a daemon. The exchange is the
// tool's common one (daemon_client.h): bounded by --timeout, never
// repeated, and refused when someone other than root or this user answers.
#include <string.h>

#include <string>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "daemon_client.h"
#include "quvaidx/ipc.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "send";

struct Options {
  DaemonClient client;
  std::string daemon;  // --daemon NAME
  bool socket_given = false, daemon_given = false;
  bool compact = false;
};

quvaidx_tools::CommandLine MakeLine(Options* o) {
  using namespace quvaidx_tools;
  std::vector<Option> options =
      DaemonOptions(&o->client, "the daemon's socket (at most " +
                                    std::to_string(kMaxSocketPath) + " bytes)");
  options[0] = Noted(options[0], &o->socket_given);
  options.insert(
      options.begin() + 1,
      Noted(Text("daemon", 'd', "NAME", &o->daemon,
                 "the socket of the index daemon NAME (see\n'quvaidx "
                 "daemons'): " +
                     DaemonNameList()),
            &o->daemon_given));
  options.push_back(Flag("handshake", 0, &o->client.handshake,
                         "have the daemon answer a HANDSHAKE request\nbefore "
                         "the request is sent"));
  options.push_back(
      Flag("compact", 'c', &o->compact, "print the reply on one line"));
  return Subcommand(
      kName,
      {"--socket PATH [OPTIONS] [JSON|-]", "--daemon NAME [OPTIONS] [JSON|-]"},
      "Sends the JSON object JSON as one request to the daemon listening on\n"
      "the Unix-domain socket PATH, or on the socket of the index daemon\n"
      "NAME, and prints its reply. Without JSON, or with -, the request is\n"
      "read from standard input. A socket answered by anyone but root or\n"
      "you is refused before anything is sent.\n",
      options,
      "The reply is printed as UTF-8, numbers in their shortest exact form.\n"
      "\n"
      "Exit status:\n"
      "  0  the reply holds \"success\": true\n"
      "  1  the reply holds \"success\": false, or no \"success\" at all\n"
      "  2  usage error, invalid request, or no reply could be obtained\n"
      "\n"
      "Examples:\n"
      "  $ quvaidx send --socket /tmp/demo.sock '{\"command\":\"HANDSHAKE\"}'\n"
      "  $ echo '{\"command\":\"STATS\"}' | quvaidx send --daemon scand -t "
      "5\n");
}

// Resolves --socket and --daemon into the client's socket and name. On
// failure prints one line and returns false.
bool ChooseSocket(Options* o) {
  if (o->socket_given == o->daemon_given) {
    UsageError(kName, o->socket_given
                          ? "give either --socket PATH or --daemon NAME, not "
                            "both"
                          : "--socket PATH or --daemon NAME is required");
    return false;
  }
  o->client.daemon = "the daemon";
  if (o->daemon_given) {
    // Checked first: the directory's lookup answers an unknown name with
    // an empty path, which would read as a missing option.
    if (!IsDaemonName(o->daemon)) {
      PrintError(kName, "unknown daemon '" + o->daemon +
                            "'; known daemons: " + DaemonNameList());
      return false;
    }
    const DaemonClient known = IndexDaemonClient(o->daemon);
    o->client.socket = known.socket;
    o->client.daemon = known.daemon;
  }
  return CheckSocketPath(kName, o->client.socket);
}

}  // namespace

int RunSend(int argc, char** argv) {
  Options o;
  std::vector<std::string> request;
  if (int status = ParseCommand(MakeLine(&o), {"JSON", 0, 1, nullptr}, argc,
                                argv, &request);
      status != kContinue) {
    return status;
  }
  if (!ChooseSocket(&o)) return kExitError;
  Json::Value value;
  const JsonInput input = {"request", "{\"command\":\"HANDSHAKE\"}",
                           kMaxSendBody, "a packet"};
  if (!ReadJsonObject(kName, request.empty() ? "-" : request[0], input,
                      &value) ||
      Exchange(kName, o.client, &value) != kExitOk) {
    return kExitError;
  }
  PrintJson(value, o.compact);
  // Only a boolean true counts: a script asks the daemon's own verdict.
  const Json::Value& reply = value;
  const Json::Value& success = reply.isObject() ? reply["success"] : reply;
  return success.isBool() && success.asBool() ? kExitOk : kExitFalse;
}

}  // namespace quvaidx_cli
