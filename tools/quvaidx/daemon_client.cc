#include "daemon_client.h"

#include <errno.h>
#include <pwd.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include "cli.h"
#include "quvaidx/daemon_info.h"
#include "quvaidx/ipc.h"

namespace quvaidx_cli {
namespace {

double Now() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

std::string SecondsText(double seconds) {
  char text[32];
  snprintf(text, sizeof(text), "%g s", seconds);
  return text;
}

// Who answers on `path`, by name (or number): asked on a connection of its
// own on which nothing is sent. "another user" when it cannot be told.
std::string WhoAnswers(const std::string& path) {
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path.data(), path.size());
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  struct ucred peer = {};
  socklen_t length = sizeof(peer);
  bool known = fd >= 0 &&
               connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                       sizeof(address)) == 0 &&
               getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) == 0;
  if (fd >= 0) close(fd);
  if (!known) return "another user";
  struct passwd* entry = getpwuid(peer.uid);
  return "user " + (entry != nullptr ? std::string(entry->pw_name)
                                     : std::to_string(peer.uid));
}

// Why ConnectDaemon failed with `error`, in a few words; sets *final when
// another attempt cannot help.
std::string ConnectFailure(const DaemonClient& client, int error, double waited,
                           bool* final) {
  *final = true;
  switch (error) {
    case ENOENT:
      *final = false;
      return "no such socket";
    case ECONNREFUSED:
      *final = false;
      return "connection refused (nobody listens there)";
    case ETIMEDOUT:
      *final = false;
      return "the connection was not accepted within " + SecondsText(waited);
    case EACCES:
      return "permission denied";
    case ENOTSOCK:
      return "not a socket";
    case EPERM:
      return "answered by " + WhoAnswers(client.socket) +
             ", not root or you; nothing was sent";
    default:
      return strerror(error);
  }
}

// The time limit of the exchange after connecting: when it runs out, the
// connection is shut down, which ends the library's blocking read or write
// with a failure.
volatile sig_atomic_t g_watched_fd = -1;
volatile sig_atomic_t g_timed_out = 0;

void OnTimeout(int) {
  if (g_watched_fd >= 0) shutdown(g_watched_fd, SHUT_RDWR);
  g_timed_out = 1;
}

// Arms the limit for `fd`, `seconds` from now (at least a microsecond), or
// disarms it when fd < 0.
void WatchExchange(int fd, double seconds) {
  struct itimerval timer = {};
  g_timed_out = 0;
  if (fd >= 0) {
    struct sigaction action = {};
    action.sa_handler = OnTimeout;
    sigemptyset(&action.sa_mask);
    sigaction(SIGALRM, &action, nullptr);
    if (seconds < 1e-6) seconds = 1e-6;
    timer.it_value.tv_sec = static_cast<time_t>(seconds);
    timer.it_value.tv_usec = static_cast<suseconds_t>(
        (seconds - static_cast<double>(timer.it_value.tv_sec)) * 1e6);
    if (timer.it_value.tv_sec == 0 && timer.it_value.tv_usec == 0) {
      timer.it_value.tv_usec = 1;
    }
  }
  g_watched_fd = fd;
  setitimer(ITIMER_REAL, &timer, nullptr);
}

std::string Attempts(int n) {
  return std::to_string(n) + (n == 1 ? " attempt" : " attempts");
}

// Connects within `deadline` (a Now() time). Returns the descriptor, or -1
// after printing why.
int Connect(const char* command, const DaemonClient& client, double start,
            double deadline) {
  std::string failure;
  int made = 0;
  for (int attempt = 0; attempt < client.attempts; ++attempt) {
    if (attempt > 0) {
      if (Now() + 1 >= deadline) break;  // no time for another attempt
      sleep(1);
    }
    double left = deadline - Now();
    int fd =
        ConnectDaemon(client.socket.c_str(), static_cast<int>(left * 1000) + 1);
    ++made;
    if (fd >= 0) return fd;
    bool final = false;
    failure = ConnectFailure(client, errno, Now() - start, &final);
    if (final) break;
  }
  PrintError(command, "cannot reach " + client.daemon + " on " + client.socket +
                          ": " + failure + " (" + Attempts(made) + ")");
  return -1;
}

}  // namespace

DaemonClient IndexDaemonClient(const std::string& name) {
  DaemonInfo info;
  DaemonClient client;
  client.daemon = info.get(name, "bin");
  client.daemon.erase(0, client.daemon.rfind('/') + 1);  // npos + 1 == 0
  client.socket = info.get(name, "sock");
  return client;
}

std::vector<quvaidx_tools::Option> DaemonOptions(DaemonClient* client,
                                                 std::string socket_help) {
  using namespace quvaidx_tools;
  char timeout[16];
  snprintf(timeout, sizeof(timeout), "%g", kDefaultTimeoutSeconds);
  return {
      Text("socket", 's', "PATH", &client->socket, std::move(socket_help)),
      Number("attempts", 'a', "N", 1, kMaxAttempts, &client->attempts,
             "connection attempts, one second apart\n(default " +
                 std::to_string(kDefaultAttempts) + ")"),
      Seconds("timeout", 't', kMaxTimeoutSeconds, &client->timeout,
              std::string("give up on a request after SECONDS, the\n"
                          "connection attempts included (default ") +
                  timeout + ")"),
  };
}

int Exchange(const char* command, const DaemonClient& client,
             Json::Value* value) {
  if (!CheckSocketPath(command, client.socket)) return kExitError;
  const double start = Now();
  const double deadline = start + client.timeout;
  int fd = Connect(command, client, start, deadline);
  if (fd < 0) return kExitError;
  WatchExchange(fd, deadline - Now());
  int result = client.handshake && Handshake(fd) != 0 ? -1 : 0;
  const char* stage = "the handshake";
  if (result == 0) {
    stage = "the request";
    result = AutoSendRecvPacketByFd(fd, *value, 0);
  }
  bool timed_out = g_timed_out != 0;
  WatchExchange(-1, 0);
  DisconnectPeer(fd);
  if (result == 0) return kExitOk;
  std::string why;
  if (timed_out) {
    why = " sent no reply to " + std::string(stage) + " within " +
          SecondsText(client.timeout);
  } else if (result == -2) {
    why = " closed the connection before replying to " + std::string(stage);
  } else {
    why = " gave no reply to " + std::string(stage) +
          " (the connection failed or ended early)";
  }
  PrintError(command, client.daemon + " on " + client.socket + why);
  return kExitError;
}

bool Succeeded(const Json::Value& reply) {
  if (!reply.isObject() || !reply.isMember("success")) return false;
  const Json::Value& success = reply["success"];
  switch (success.type()) {
    case Json::booleanValue:
      return success.asBool();
    case Json::intValue:
    case Json::uintValue:
    case Json::realValue:
      return success.asDouble() != 0.0;
    default:
      return false;
  }
}

}  // namespace quvaidx_cli
