// quvaidx serve: a sample daemon on the library's event server.
//
// It answers HANDSHAKE, ECHO and STATS and refuses everything else, runs
// until SIGINT or SIGTERM, and removes its socket when it stops. Like every
// daemon on the library's server it cannot start on a path that holds
// anything but a stale socket (BuildServer refuses), so it deletes no other
// kind of file and never takes a socket away from a daemon that still
// answers on it.
//
// It goes through a daemon's whole life in the library's order: wait for
// the system to boot; with a pid file, refuse a second instance and, if
// asked, detach (before any event base exists, since detaching forks); the
// event base and the server; on stop, the socket and the pid file go.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <event2/event.h>
#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvahost/quvahost.h"
#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "quvaidx/lifecycle.h"
#include "quvaidx/log.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "serve";
constexpr char kLogModule[] = "quvaidx_serve";

// Set once the process has detached: its standard streams are on /dev/null
// from then on, so failures go to the system log as well.
bool g_detached = false;

// Reports a failure on stderr and, once detached, in the system log.
void Fail(const std::string& message) {
  PrintError(kName, message);
  if (g_detached) {
    AppLogError(3, "%s:%d [Error] %s", kLogModule, __LINE__, message.c_str());
  }
}

// The daemon's own state, reached through EventArgs.context.
struct ServeState {
  uint64_t requests = 0;  // requests received so far, the current included
};

// Which signal ended the loop, 0 while none did.
struct StopState {
  event_base* base;
  int signal_number;
};

struct Options {
  std::string socket, pid_file;
  bool detach = false;
};

quvaidx_tools::CommandLine MakeLine(Options* o) {
  using namespace quvaidx_tools;
  return Subcommand(
      kName, {"--socket PATH [--pidfile FILE [--daemon]] [OPTIONS]"},
      "Runs a sample daemon on the Unix-domain socket PATH until SIGINT or\n"
      "SIGTERM, then removes the socket. Once it accepts connections it\n"
      "prints \"quvaidx serve: listening on PATH\". Like an index daemon it\n"
      "first waits until the system has finished booting.\n"
      "\n"
      "Requests it answers (by their \"command\" member):\n"
      "  HANDSHAKE  {\"success\": true}\n"
      "  ECHO       {\"success\": true, \"echo\": <the request>}\n"
      "  STATS      {\"success\": true, \"connections\": <open now>,\n"
      "              \"requests\": <received so far, this one included>}\n"
      "  others     {\"success\": false, \"reason\": \"unknown command\"}\n",
      {
          Text("socket", 's', "PATH", &o->socket,
               "where to listen (at most " + std::to_string(kMaxSocketPath) +
                   " bytes); a stale\nsocket there is replaced, any other "
                   "file is not\n(with --daemon, a refusal is told only to "
                   "the\nsystem log)",
               true),
          Text("pidfile", 'p', "FILE", &o->pid_file,
               "refuse to start while the process named in FILE\nis alive "
               "(printing \"Daemon alive. No need to\nstart\"); else write "
               "this process's id into\nFILE and remove FILE on exit"),
          quvaidx_tools::Flag(
              "daemon", 0, &o->detach,
              "with --pidfile: detach into the background\nafter the "
              "checks and print nothing more; wait\nfor FILE and the "
              "socket, stop it with\nkill -TERM \"$(cat FILE)\""),
      },
      "Exit status: 0 after a stop signal (with --daemon: once detached), 2\n"
      "when it cannot start or stops for another reason.\n");
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

// Why the server could not listen on `path`, in the user's words, from the
// errno BuildServer left.
std::string ListenFailure(const std::string& path, int error) {
  switch (error) {
    case EADDRINUSE:  // the library removes only a socket nobody answers on
      return "a daemon is already listening on " + path;
    case EEXIST:
      return path + " exists and is not a socket; not replacing it";
    default:
      return "cannot listen on " + path + ": " + strerror(error);
  }
}

// True when another process holds the lock of `pid_file`, as a daemon that
// is starting does before its pid is in the file.
bool PidFileLocked(const std::string& pid_file) {
  int fd =
      open(pid_file.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) return false;
  bool locked = flock(fd, LOCK_SH | LOCK_NB) != 0 && errno == EWOULDBLOCK;
  close(fd);
  return locked;
}

// Listens on `path` until a stop signal or an accept failure ends the loop.
int Serve(const std::string& path) {
  event_base* base = event_base_new();
  if (base == nullptr) {
    Fail("cannot create the event loop");
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
    Fail("cannot watch for SIGINT and SIGTERM");
  } else if (BuildServer(base, path.c_str(), &args) != 0) {
    Fail(ListenFailure(path, errno));
  } else {
    if (!g_detached) {
      printf("quvaidx serve: listening on %s\n", path.c_str());
      fflush(stdout);
    }
    event_base_dispatch(base);
    StopServer(path.c_str());
    // StopServer does not report whether the removal worked: look.
    struct stat info;
    bool removed = lstat(path.c_str(), &info) != 0 && errno == ENOENT;
    std::string outcome = (removed ? "removed " : "could not remove ") + path;
    if (stop.signal_number != 0) {
      if (!g_detached) {
        printf("quvaidx serve: stopped by %s; %s\n",
               stop.signal_number == SIGINT ? "SIGINT" : "SIGTERM",
               outcome.c_str());
        fflush(stdout);
      }
      status = kExitOk;
    } else {
      Fail("stopped accepting connections; " + outcome);
    }
  }
  if (sigint != nullptr) event_free(sigint);
  if (sigterm != nullptr) event_free(sigterm);
  // Connections still open belong to the base and end with the process.
  event_base_free(base);
  return status;
}

// Detaching moves the working directory to "/", so a relative path is made
// absolute first. Returns false (with one error line) when the current
// directory cannot be read.
bool MakeAbsolute(std::string* path) {
  if (path->empty() || (*path)[0] == '/') return true;
  char buffer[PATH_MAX];
  if (getcwd(buffer, sizeof(buffer)) == nullptr) {
    PrintError(kName, std::string("cannot read the current directory: ") +
                          strerror(errno));
    return false;
  }
  *path = std::string(buffer) + "/" + *path;
  return true;
}

// Once detached, the daemon can no longer report on the terminal, and the
// library writes the pid file only after detaching: so the directories of
// the pid file and the socket are checked beforehand. Prints one error line
// and returns false when `path`'s directory is not writable.
bool DirectoryWritable(const std::string& path, const char* what) {
  std::string directory = path.substr(0, path.rfind('/'));
  if (directory.empty()) directory = "/";
  if (access(directory.c_str(), W_OK | X_OK) != 0) {
    PrintError(kName, std::string("cannot create the ") + what + " " + path +
                          ": " + directory + ": " + strerror(errno));
    return false;
  }
  return true;
}

// Waits, as an index daemon does, until the host reports it has booted. On
// a machine without the host's boot state this returns at once; otherwise
// the wait is announced, since it may last up to a quarter of an hour.
void WaitForBoot() {
  int step = QUVASystemGetBootStep();
  if (step != QUVA_BOOT_STEP_READY) {
    printf(
        "quvaidx serve: waiting for the system to finish booting (boot "
        "step %d)\n",
        step);
    fflush(stdout);
  }
  WaitSystemReady();
}

// Takes the pid file: refuses a second instance, detaches with `detach`.
// Returns false when the daemon must not run; the library has printed
// "Daemon alive. No need to start" itself when another instance lives.
bool TakePidFile(const std::string& pid_file, bool detach) {
  int result =
      detach ? BecomeDaemon(pid_file.c_str()) : BecomeProcess(pid_file.c_str());
  // BecomeDaemon returns 0 only in the detached process; the original one
  // has ended with status 0 inside it.
  if (detach && result == 0) g_detached = true;
  if (result == 0) return true;
  if (QLIBCProcAliveByPidFile(pid_file.c_str()) != 1 &&
      !PidFileLocked(pid_file)) {
    Fail(std::string(detach ? "cannot detach or " : "cannot ") +
         "write the pid file " + pid_file +
         " (--verbose shows the library's report)");
  }
  return false;
}

}  // namespace

int RunServe(int argc, char** argv) {
  Options options;
  std::vector<std::string> none;
  if (int status = ParseCommand(MakeLine(&options), {"", 0, 0, nullptr}, argc,
                                argv, &none);
      status != kContinue) {
    return status;
  }
  std::string& path = options.socket;
  std::string& pid_file = options.pid_file;
  bool detach = options.detach;
  if (detach && pid_file.empty()) {
    return UsageError(kName, "--daemon needs --pidfile FILE");
  }
  if (detach && (!MakeAbsolute(&path) || !MakeAbsolute(&pid_file))) {
    return kExitError;
  }
  if (!CheckSocketPath(kName, path)) return kExitError;
  if (detach && (!DirectoryWritable(pid_file, "pid file") ||
                 !DirectoryWritable(path, "socket"))) {
    return kExitError;
  }
  WaitForBoot();
  if (pid_file.empty()) return Serve(path);
  if (!TakePidFile(pid_file, detach)) return kExitError;
  int status = Serve(path);
  DeletePidFile(pid_file.c_str());
  return status;
}

}  // namespace quvaidx_cli
