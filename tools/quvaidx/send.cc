// quvaidx send: one request, one reply, over a fresh connection.
//
// The request is parsed and checked before any connection is made, so a
// mistake on the command line never reaches a daemon. The exchange runs on
// one connection and is not repeated, so a request reaches the daemon at
// most once. The tool connects by itself (attempts one second apart, none
// after the last) so that it can say why a connection failed, and bounds
// the wait for the reply with --timeout.
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

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
// Longest request read from standard input; a packet carries far less.
constexpr size_t kMaxInput = 1 << 20;

struct Options {
  std::string socket, daemon, request;
  bool socket_given = false, daemon_given = false;
  bool handshake = false, compact = false;
  int attempts = kDefaultAttempts;
  double timeout = 0;  // 0: no limit
};

quvaidx_tools::CommandLine MakeLine(Options* o) {
  using namespace quvaidx_tools;
  return Subcommand(
      kName,
      {"--socket PATH [OPTIONS] [JSON|-]", "--daemon NAME [OPTIONS] [JSON|-]"},
      "Sends the JSON object JSON as one request to the daemon listening on\n"
      "the Unix-domain socket PATH, or on the socket of the index daemon\n"
      "NAME, and prints its reply. Without JSON, or with -, the request is\n"
      "read from standard input.\n",
      {
          Noted(Text("socket", 's', "PATH", &o->socket,
                     "the daemon's socket (at most " +
                         std::to_string(kMaxSocketPath) + " bytes)"),
                &o->socket_given),
          Noted(Text("daemon", 'd', "NAME", &o->daemon,
                     "the socket of the index daemon NAME (see\n'quvaidx "
                     "daemons'): " +
                         DaemonNameList()),
                &o->daemon_given),
          quvaidx_tools::Flag(
              "handshake", 0, &o->handshake,
              "have the daemon answer a HANDSHAKE request\nbefore the request "
              "is sent"),
          Number("attempts", 'a', "N", 1, kMaxAttempts, &o->attempts,
                 "connection attempts, one second apart\n(default " +
                     std::to_string(kDefaultAttempts) + ")"),
          Seconds("timeout", 't', 86400, &o->timeout,
                  "give up when no reply has come SECONDS\nafter connecting "
                  "(default: wait as long as\nit takes)"),
          quvaidx_tools::Flag("compact", 'c', &o->compact,
                              "print the reply on one line"),
      },
      "The reply is printed as UTF-8, numbers in their shortest exact form.\n"
      "\n"
      "Exit status:\n"
      "  0  the reply holds \"success\": true\n"
      "  1  the reply holds \"success\": false, or no \"success\" at all\n"
      "  2  usage error, invalid request, or no reply could be obtained\n"
      "\n"
      "Examples:\n"
      "  quvaidx send --socket /tmp/demo.sock '{\"command\":\"HANDSHAKE\"}'\n"
      "  echo '{\"command\":\"STATS\"}' | quvaidx send --daemon scand "
      "--timeout 5\n");
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

// Reads all of standard input into *text. On failure prints one line.
bool ReadStandardInput(std::string* text) {
  char buffer[8192];
  for (;;) {
    size_t n = fread(buffer, 1, sizeof(buffer), stdin);
    text->append(buffer, n);
    if (text->size() > kMaxInput) {
      PrintError(kName, "the request on standard input is longer than " +
                            std::to_string(kMaxInput) + " bytes");
      return false;
    }
    if (n < sizeof(buffer)) break;
  }
  if (ferror(stdin)) {
    PrintError(kName,
               std::string("cannot read standard input: ") + strerror(errno));
    return false;
  }
  return true;
}

// Resolves --socket and --daemon into the socket path. On failure prints
// one line and returns false.
bool ChooseSocket(const Options& o, std::string* path) {
  if (o.socket_given && o.daemon_given) {
    UsageError(kName, "give either --socket PATH or --daemon NAME, not both");
    return false;
  }
  if (!o.socket_given && !o.daemon_given) {
    UsageError(kName, "--socket PATH or --daemon NAME is required");
    return false;
  }
  if (o.daemon_given) {
    // Checked first: the directory's lookup answers an unknown name with
    // an empty path, which would read as a missing option.
    if (!IsDaemonName(o.daemon)) {
      PrintError(kName, "unknown daemon '" + o.daemon +
                            "'; known daemons: " + DaemonNameList());
      return false;
    }
    *path = DaemonInfo().get(o.daemon, "sock");
  } else {
    *path = o.socket;
  }
  return CheckSocketPath(kName, *path);
}

// Connects to `path` once, waiting at most kConnectTimeoutMs for a daemon
// whose listen backlog is full. Returns the descriptor, or -1 with errno set
// (ETIMEDOUT when the wait ran out). A Unix-domain connect cannot complete
// later, so the wait is bounded by the socket's send time-out, as the
// library's own attempts are.
int ConnectOnce(const std::string& path) {
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path.data(), path.size());
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  struct timeval limit = {kConnectTimeoutMs / 1000,
                          (kConnectTimeoutMs % 1000) * 1000};
  setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof(limit));
  int result = connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                       sizeof(address));
  if (result != 0) {
    int saved = errno == EAGAIN || errno == EINPROGRESS ? ETIMEDOUT : errno;
    close(fd);
    errno = saved;
    return -1;
  }
  struct timeval none = {0, 0};  // the exchange itself has --timeout
  setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &none, sizeof(none));
  return fd;
}

// Why connecting to `path` failed with `error`, in a few words.
std::string ConnectFailure(const std::string& path, int error) {
  struct stat status;
  if (lstat(path.c_str(), &status) != 0) {
    return errno == ENOENT ? "no such socket" : strerror(errno);
  }
  if (!S_ISSOCK(status.st_mode)) return "not a socket";
  switch (error) {
    case EACCES:
    case EPERM:
      return "permission denied";
    case ECONNREFUSED:
      return "connection refused (no daemon listens there)";
    case ETIMEDOUT:
      return "the daemon did not accept the connection within " +
             std::to_string(kConnectTimeoutMs / 1000) + " seconds";
    default:
      return strerror(error);
  }
}

// The reply time limit: when it runs out, the connection is shut down,
// which ends the library's blocking read with a failure.
volatile sig_atomic_t g_watched_fd = -1;
volatile sig_atomic_t g_timed_out = 0;

void OnTimeout(int) {
  if (g_watched_fd >= 0) shutdown(g_watched_fd, SHUT_RDWR);
  g_timed_out = 1;
}

// Arms (seconds > 0) or disarms (0) the reply time limit for `fd`.
void WatchReply(int fd, double seconds) {
  struct itimerval timer = {};
  if (seconds > 0) {
    struct sigaction action = {};
    action.sa_handler = OnTimeout;
    sigemptyset(&action.sa_mask);
    sigaction(SIGALRM, &action, nullptr);
    g_watched_fd = fd;
    timer.it_value.tv_sec = static_cast<time_t>(seconds);
    timer.it_value.tv_usec = static_cast<suseconds_t>(
        (seconds - static_cast<double>(timer.it_value.tv_sec)) * 1e6);
    if (timer.it_value.tv_sec == 0 && timer.it_value.tv_usec == 0) {
      timer.it_value.tv_usec = 1;
    }
  } else {
    g_watched_fd = -1;
  }
  setitimer(ITIMER_REAL, &timer, nullptr);
}

// The daemon's verdict: only a boolean true "success" counts as success.
bool ReplySucceeded(const Json::Value& reply) {
  if (!reply.isObject()) return false;
  const Json::Value& success = reply["success"];
  return success.isBool() && success.asBool();
}

std::string Attempts(int n) {
  return std::to_string(n) + (n == 1 ? " attempt" : " attempts");
}

}  // namespace

int RunSend(int argc, char** argv) {
  Options o;
  int first = 0;
  int status = ParseArguments(MakeLine(&o), argc, argv, &first);
  if (status != kContinue) return status;
  if (argc - first > 1) {
    return UsageError(kName, std::string("expects one JSON request; "
                                         "unexpected argument '") +
                                 argv[first + 1] + "'");
  }
  std::string path;
  if (!ChooseSocket(o, &path)) return kExitError;
  std::string text;
  if (first < argc && strcmp(argv[first], "-") != 0) {
    text = argv[first];
  } else if (!ReadStandardInput(&text)) {
    return kExitError;
  }
  Json::Value value;
  if (!ParseRequest(text, &value)) return kExitError;

  int fd = -1;
  std::string failure;
  for (int attempt = 0; attempt < o.attempts && fd < 0; ++attempt) {
    if (attempt > 0) sleep(1);  // never after the last attempt
    fd = ConnectOnce(path);
    if (fd < 0) {
      failure = ConnectFailure(path, errno);
      continue;
    }
    if (!o.handshake) break;
    WatchReply(fd, o.timeout);
    bool answered = Handshake(fd) == 0;
    WatchReply(-1, 0);
    if (!answered) {
      failure = g_timed_out ? "no answer to the handshake in time"
                            : "the daemon did not answer the handshake";
      g_timed_out = 0;
      close(fd);
      fd = -1;
    }
  }
  if (fd < 0) {
    PrintError(kName, std::string("no daemon answered") +
                          (o.handshake ? " the handshake" : "") + " on " +
                          path + " after " + Attempts(o.attempts) + ": " +
                          failure);
    return kExitError;
  }
  WatchReply(fd, o.timeout);
  int result = AutoSendRecvPacketByFd(fd, value, 0);
  WatchReply(-1, 0);
  DisconnectPeer(fd);
  if (result != 0) {
    std::string why;
    if (g_timed_out) {
      char limit[32];
      snprintf(limit, sizeof(limit), "%g", o.timeout);
      why = " sent no reply within " + std::string(limit) + " s";
    } else if (result == -2) {
      why = " closed the connection before replying";
    } else {
      why = " gave no reply (the connection failed or ended early)";
    }
    PrintError(kName, "the daemon on " + path + why);
    return kExitError;
  }
  PrintJson(value, o.compact);
  return ReplySucceeded(value) ? kExitOk : kExitFalse;
}

}  // namespace quvaidx_cli
