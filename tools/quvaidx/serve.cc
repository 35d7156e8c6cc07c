// quvaidx serve: a sample daemon on the library's event server.
//
// It answers HANDSHAKE, ECHO and STATS and refuses everything else, runs in
// the foreground until SIGINT or SIGTERM, and removes its socket when it
// stops. It refuses to start on a path that holds anything but a stale
// socket, so it deletes no other kind of file and never takes a socket away
// from a daemon that still answers on it.
#include <errno.h>
#include <getopt.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>

#include <event2/event.h>
#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "serve";

// The daemon's own state, reached through EventArgs.context.
struct ServeState {
  uint64_t requests = 0;  // requests received so far, the current included
};

// Which signal ended the loop, 0 while none did.
struct StopState {
  event_base* base;
  int signal_number;
};

void PrintHelp() {
  printf(
      "Usage: quvaidx serve --socket PATH [OPTIONS]\n"
      "\n"
      "Runs a sample daemon in the foreground on the Unix-domain socket PATH\n"
      "until SIGINT or SIGTERM, then removes the socket. Once it accepts\n"
      "connections it prints \"quvaidx serve: listening on PATH\".\n"
      "\n"
      "Requests it answers (by their \"command\" member):\n"
      "  HANDSHAKE  {\"success\": true}\n"
      "  ECHO       {\"success\": true, \"echo\": <the request>}\n"
      "  STATS      {\"success\": true, \"connections\": <open now>,\n"
      "              \"requests\": <received so far, this one included>}\n"
      "  others     {\"success\": false, \"reason\": \"unknown command\"}\n"
      "\n"
      "Options:\n"
      "  -s, --socket PATH  where to listen (at most %zu bytes); a stale\n"
      "                     socket there is replaced, any other file is not\n"
      "  -v, --verbose      also show the library's log lines on stderr\n"
      "  -h, --help         show this help\n"
      "\n"
      "Exit status: 0 after a stop signal, 2 when it cannot start or stops\n"
      "for another reason.\n",
      kMaxSocketPath);
}

int Handle(Json::Value& request, Json::Value& reply, EventArgs* args) {
  ServeState* state = static_cast<ServeState*>(args->context);
  ++state->requests;
  // Only an object has members; anything else counts as an unknown command.
  // Read through a const reference, so that a missing member is not added
  // to the request (which ECHO sends back).
  const Json::Value& const_request = request;
  std::string command;
  if (const_request.isObject() && const_request["command"].isString()) {
    command = const_request["command"].asString();
  }
  if (command == "HANDSHAKE") {
    reply = MakeResponse(true, nullptr);
  } else if (command == "ECHO") {
    reply = MakeResponse(true, nullptr);
    reply["echo"] = request;
  } else if (command == "STATS") {
    reply = MakeResponse(true, nullptr);
    reply["connections"] = GetCurrentConnCount();
    reply["requests"] = static_cast<Json::UInt64>(state->requests);
  } else {
    reply = MakeResponse(false, "unknown command");
  }
  return 0;
}

void OnStopSignal(evutil_socket_t signal_number, short, void* arg) {
  StopState* stop = static_cast<StopState*>(arg);
  stop->signal_number = static_cast<int>(signal_number);
  event_base_loopexit(stop->base, nullptr);
}

// True when something answers a connection on `path` right now.
bool SomeoneListens(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, path.data(), path.size());
  bool connected = connect(fd, reinterpret_cast<struct sockaddr*>(&address),
                           sizeof(address)) == 0;
  close(fd);
  return connected;
}

// Refuses paths whose file BuildServer would remove but must not: a file
// that is not a socket, or a socket a live daemon still listens on.
bool PathIsFree(const std::string& path) {
  struct stat info;
  if (lstat(path.c_str(), &info) != 0) {
    if (errno == ENOENT) return true;
    PrintError(kName, "cannot examine " + path + ": " + strerror(errno));
    return false;
  }
  if (!S_ISSOCK(info.st_mode)) {
    PrintError(kName, path + " exists and is not a socket; not replacing it");
    return false;
  }
  if (SomeoneListens(path)) {
    PrintError(kName, "a daemon is already listening on " + path);
    return false;
  }
  return true;
}

// Listens on `path` until a stop signal or an accept failure ends the loop.
int Serve(const std::string& path) {
  event_base* base = event_base_new();
  if (base == nullptr) {
    PrintError(kName, "cannot create the event loop");
    return kExitError;
  }
  StopState stop = {base, 0};
  event* sigint = evsignal_new(base, SIGINT, OnStopSignal, &stop);
  event* sigterm = evsignal_new(base, SIGTERM, OnStopSignal, &stop);
  ServeState state;
  EventArgs args = {"quvaidx-serve", &state, Handle};
  int status = kExitError;
  if (sigint == nullptr || sigterm == nullptr ||
      evsignal_add(sigint, nullptr) || evsignal_add(sigterm, nullptr)) {
    PrintError(kName, "cannot watch for SIGINT and SIGTERM");
  } else if (BuildServer(base, path.c_str(), &args) != 0) {
    PrintError(kName, "cannot listen on " + path +
                          " (is its directory there and writable? "
                          "--verbose shows the library's report)");
  } else {
    printf("quvaidx serve: listening on %s\n", path.c_str());
    fflush(stdout);
    event_base_dispatch(base);
    StopServer(path.c_str());
    // StopServer does not report whether the removal worked: look.
    struct stat info;
    bool removed = lstat(path.c_str(), &info) != 0 && errno == ENOENT;
    std::string outcome = (removed ? "removed " : "could not remove ") + path;
    if (stop.signal_number != 0) {
      printf("quvaidx serve: stopped by %s; %s\n",
             stop.signal_number == SIGINT ? "SIGINT" : "SIGTERM",
             outcome.c_str());
      fflush(stdout);
      status = kExitOk;
    } else {
      PrintError(kName, "stopped accepting connections; " + outcome);
    }
  }
  if (sigint != nullptr) event_free(sigint);
  if (sigterm != nullptr) event_free(sigterm);
  // Connections still open belong to the base and end with the process.
  event_base_free(base);
  return status;
}

}  // namespace

int RunServe(int argc, char** argv) {
  static const struct option kOptions[] = {
      {"socket", required_argument, nullptr, 's'},
      {"verbose", no_argument, nullptr, 'v'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  std::string path;
  optind = 0;
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, ":s:vh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 's':
        path = optarg;
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
  if (optind < argc) {
    return UsageError(
        kName, std::string("unexpected argument '") + argv[optind] + "'");
  }
  if (!CheckSocketPath(kName, path)) return kExitError;
  if (!PathIsFree(path)) return kExitError;
  return Serve(path);
}

}  // namespace quvaidx_cli
