// Talking to a daemon, for every command of the tool that asks one: one
// request and one reply per exchange, bounded in time, with errors that say
// why and name the daemon and its socket.
//
// A connection is made with the library's ConnectDaemon, which refuses a
// socket answered by anyone but root or this user (someone may have taken
// the path while the daemon was down): nothing is sent to such a peer.
// Attempts are one second apart, none after the last, and stop early when
// waiting again cannot help (permission denied, not a socket, a stranger
// answers) or the time is up. The time limit covers the whole exchange of
// one request, the attempts included: a daemon that accepts and never
// answers costs at most that long. The exchange is not repeated after the
// request was sent, so it reaches the daemon at most once.
//
// Uses SIGALRM and the real-time interval timer while an exchange runs.
#ifndef QUVAIDX_TOOLS_DAEMON_CLIENT_H_
#define QUVAIDX_TOOLS_DAEMON_CLIENT_H_

#include <string>
#include <vector>

#include <json/json.h>

#include "options.h"

namespace quvaidx_cli {

constexpr int kDefaultAttempts = 3;
constexpr int kMaxAttempts = 3600;
constexpr double kDefaultTimeoutSeconds = 30;
constexpr double kMaxTimeoutSeconds = 86400;

// Which daemon to ask, and how long to try.
struct DaemonClient {
  std::string daemon;  // how messages name it: "quvamediaparserd"
  std::string socket;  // its socket
  int attempts = kDefaultAttempts;
  double timeout = kDefaultTimeoutSeconds;  // seconds per request
  bool handshake = false;  // a HANDSHAKE must be answered before the request
};

// The client of the index daemon `name` (quvaidx/paths.h: "mediad"): its
// socket from the daemon directory, named in messages by its program
// ("quvamediaparserd").
DaemonClient IndexDaemonClient(const std::string& name);

// -s/--socket PATH (described as `socket_help`), -a/--attempts N and
// -t/--timeout SECONDS, setting *client.
std::vector<quvaidx_tools::Option> DaemonOptions(DaemonClient* client,
                                                 std::string socket_help);

// Sends `value` to the daemon of `client` and replaces it with the reply.
// Returns kExitOk; or, after one line on stderr ("quvaidx COMMAND: cannot
// reach DAEMON on SOCKET: permission denied (1 attempt)", "quvaidx COMMAND:
// DAEMON on SOCKET sent no reply within 30 s"), kExitError with `value`
// unspecified.
int Exchange(const char* command, const DaemonClient& client,
             Json::Value* value);

// The daemon's verdict as the library's typed requests read it: "success"
// is a boolean true or a nonzero number.
bool Succeeded(const Json::Value& reply);

}  // namespace quvaidx_cli

#endif  // QUVAIDX_TOOLS_DAEMON_CLIENT_H_
