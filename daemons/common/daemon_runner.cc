#include "daemon_runner.h"

#include <ctype.h>
#include <errno.h>
#include <grp.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <utility>

#include <event2/event.h>
#include <quvaidx/ipc.h>
#include <quvaidx/lifecycle.h>
#include <quvaidx/log.h>
#include <quvaidx/system.h>
#include <quvaidx/version.h>

namespace quvaidx_daemons {
namespace {

using quvaidx_tools::kContinue;

// What the common options set.
struct Settings {
  std::string socket;
  std::string pid_file;
  bool foreground = false;
  bool to_stderr = false;
  int log_level = -1;    // -1: leave g_log_level alone
  int socket_mode = -1;  // -1: the file-creation mask decides
  gid_t socket_group = static_cast<gid_t>(-1);  // -1: unchanged
};

std::string ParseMode(const char* text, int* mode) {
  char* end = nullptr;
  errno = 0;
  long value = strtol(text, &end, 8);
  if (*text == '\0' || *end != '\0' || errno != 0 || value < 0 ||
      value > 0777) {
    return "an octal mode from 0 to 0777, such as 0660";
  }
  *mode = static_cast<int>(value);
  return "";
}

std::string ParseGroup(const char* text, gid_t* gid) {
  if (struct group* entry = getgrnam(text)) {
    *gid = entry->gr_gid;
    return "";
  }
  int number;
  if (quvaidx_tools::ParseInt(text, 0, INT_MAX, &number)) {
    *gid = static_cast<gid_t>(number);
    return "";
  }
  return "no such group";
}

quvaidx_tools::CommandLine MakeCommandLine(const DaemonSpec& spec,
                                           Settings* settings) {
  using namespace quvaidx_tools;
  CommandLine line;
  line.program = spec.program;
  line.usage = {"[OPTIONS]"};
  // The summary opens the help, as the man page's NAME line is made from it.
  std::string summary = spec.summary;
  if (!summary.empty()) summary[0] = static_cast<char>(toupper(summary[0]));
  line.description = summary + ".\n\n" + spec.description;
  line.version = VersionLine(spec.program);
  line.epilog = spec.epilog;
  if (spec.default_socket != nullptr) {
    line.options.push_back(
        Text("socket", 's', "PATH", &settings->socket,
             std::string("listen on the Unix-domain socket PATH\n(default ") +
                 spec.default_socket + ")"));
  }
  line.options.push_back(
      Text("pidfile", 'p', "FILE", &settings->pid_file,
           std::string("the pid file, locked while the daemon runs\n"
                       "(default ") +
               spec.default_pidfile + ")"));
  line.options.push_back(
      Flag("foreground", 'f', &settings->foreground,
           "stay in the foreground instead of detaching\n(for a service "
           "manager, or to watch it)"));
  line.options.push_back(Flag("stderr", 0, &settings->to_stderr,
                              "copy every log line to standard error as well"));
  line.options.push_back(Number("loglevel", 'l', "N", 0, 7,
                                &settings->log_level,
                                "log lines up to level N: 3 errors (the\n"
                                "default), 6 progress, 7 debug"));
  if (spec.default_socket != nullptr) {
    line.options.push_back(Custom(
        "socket-mode", 0, "MODE",
        [settings](const char* text) {
          return ParseMode(text, &settings->socket_mode);
        },
        "access mode of the socket, in octal (default:\nthe "
        "file-creation mask decides)"));
    line.options.push_back(Custom(
        "socket-group", 0, "GROUP",
        [settings](const char* text) {
          return ParseGroup(text, &settings->socket_group);
        },
        "group of the socket, by name or number"));
  }
  for (const Option& option : spec.options) line.options.push_back(option);
  return line;
}

// Detaching moves the working directory to "/": relative paths are made
// absolute first. False when the current directory cannot be read.
bool MakeAbsolute(std::string* path) {
  if (path->empty() || (*path)[0] == '/') return true;
  char cwd[PATH_MAX];
  if (getcwd(cwd, sizeof(cwd)) == nullptr) return false;
  *path = std::string(cwd) + "/" + *path;
  return true;
}

void OnStopSignal(evutil_socket_t, short, void* base) {
  event_base_loopexit(static_cast<event_base*>(base), nullptr);
}

// Listens on the socket, with the mode and group asked for (the socket is
// never open to others meanwhile). Without either, the file-creation mask
// decides, as for any daemon.
int Listen(event_base* base, const Settings& settings, EventArgs* args) {
  const char* path = settings.socket.c_str();
  if (settings.socket_mode < 0 &&
      settings.socket_group == static_cast<gid_t>(-1)) {
    return BuildServer(base, path, args);
  }
  ServerSocketAccess access;
  if (settings.socket_mode >= 0) {
    access.mode = static_cast<mode_t>(settings.socket_mode);
  } else {
    mode_t mask = umask(0);  // read it: umask has no query of its own
    umask(mask);
    access.mode = 0777 & ~mask;
  }
  access.group = settings.socket_group;
  return BuildServerWithAccess(base, path, args, &access);
}

// Runs the event loop part of the daemon's life (steps 5 to 9 but the pid
// file). Returns the exit status.
int Serve(const DaemonSpec& spec, const Settings& settings) {
  event_base* base = event_base_new();
  if (base == nullptr) return 1;
  event* sigint = evsignal_new(base, SIGINT, OnStopSignal, base);
  event* sigterm = evsignal_new(base, SIGTERM, OnStopSignal, base);
  EventArgs args = {spec.program, spec.context, spec.handler};
  bool listening = false;
  int status = 1;
  if (sigint == nullptr || sigterm == nullptr ||
      evsignal_add(sigint, nullptr) != 0 ||
      evsignal_add(sigterm, nullptr) != 0) {
    syslog(LOG_ERR, "%s: cannot watch SIGINT and SIGTERM", spec.program);
    goto done;
  }
  if (!settings.socket.empty()) {
    if (Listen(base, settings, &args) != 0) {
      fprintf(stderr, "%s: cannot listen on %s (see the system log)\n",
              spec.program, settings.socket.c_str());
      goto done;
    }
    listening = true;
  }
  // A start hook that refuses has said why.
  if (spec.start != nullptr && (status = spec.start(base, spec.context)) != 0) {
    goto done;
  }
  if (settings.foreground) {
    if (listening) {
      printf("%s: listening on %s\n", spec.program, settings.socket.c_str());
    } else {
      printf("%s: running\n", spec.program);
    }
    fflush(stdout);
  }
  event_base_dispatch(base);
  if (spec.stop != nullptr) spec.stop(spec.context);
  status = 0;
done:
  if (listening) StopServer(settings.socket.c_str());
  if (sigint != nullptr) event_free(sigint);
  if (sigterm != nullptr) event_free(sigterm);
  event_base_free(base);
  return status;
}

}  // namespace

quvaidx_tools::Option PathOption(const char* name, char letter,
                                 const char* value_name, std::string* out,
                                 std::string help) {
  return quvaidx_tools::Custom(
      name, letter, value_name,
      [out](const char* value) {
        std::string path = value;
        if (path.empty()) return std::string("empty");
        if (!MakeAbsolute(&path)) return std::string(strerror(errno));
        *out = path;
        return std::string();
      },
      std::move(help));
}

std::string VersionLine(const char* program) {
  return std::string(program) + " " + QuvaidxVersion();
}

int RunDaemon(const DaemonSpec& spec, int argc, char** argv) {
  Settings settings;
  if (spec.default_socket != nullptr) settings.socket = spec.default_socket;
  settings.pid_file = spec.default_pidfile;
  quvaidx_tools::CommandLine line = MakeCommandLine(spec, &settings);
  int first_operand = 0;
  int parsed =
      quvaidx_tools::ParseCommandLine(line, argc, argv, &first_operand);
  if (parsed != kContinue) return parsed;
  if (first_operand < argc) {
    return quvaidx_tools::UsageError(
        spec.program,
        std::string("unexpected argument '") + argv[first_operand] + "'");
  }
  if (settings.socket.size() > kMaxSocketPath) {
    return quvaidx_tools::UsageError(
        spec.program,
        "socket path longer than " + std::to_string(kMaxSocketPath) + " bytes");
  }
  if (!MakeAbsolute(&settings.socket) || !MakeAbsolute(&settings.pid_file)) {
    fprintf(stderr, "%s: %s\n", spec.program, strerror(errno));
    return 1;
  }
  openlog(spec.program, LOG_PID | (settings.to_stderr ? LOG_PERROR : 0),
          LOG_DAEMON);
  if (settings.log_level >= 0) ChageLogLevel(settings.log_level);
  WaitSystemReady();
  // Prints "Daemon alive. No need to start" itself when one runs already.
  int taken = settings.foreground ? BecomeProcess(settings.pid_file.c_str())
                                  : BecomeDaemon(settings.pid_file.c_str());
  if (taken != 0) {
    fprintf(stderr, "%s: not started (pid file %s)\n", spec.program,
            settings.pid_file.c_str());
    return 1;
  }
  int status = Serve(spec, settings);
  DeletePidFile(settings.pid_file.c_str());
  return status;
}

}  // namespace quvaidx_daemons
