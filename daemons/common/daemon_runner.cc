#include "daemon_runner.h"

#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <grp.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
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
  int handed_socket = -1;  // the listening socket a service manager passed
};

// The first descriptor a service manager passes (systemd's
// SD_LISTEN_FDS_START).
constexpr int kFirstHandedDescriptor = 3;

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
  if (!line.epilog.empty()) line.epilog += "\n";
  if (spec.default_socket != nullptr) {
    line.epilog +=
        "Started by a service manager that hands over a listening socket\n"
        "(LISTEN_PID naming this process, LISTEN_FDS: descriptor 3, bound "
        "to\nthe --socket path), the daemon serves that socket and leaves its "
        "file\nto the manager.\n\n";
  }
  line.epilog +=
      "Exit status: 0 after SIGTERM or SIGINT, 1 when the daemon cannot "
      "start\n(why is printed on stderr), 2 on a usage error.\n";
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

// The listening socket a service manager handed to this process
// (LISTEN_PID names it and LISTEN_FDS counts at least one), or -1. The
// variables are removed either way, so that no child takes them for its
// own. Read before detaching, which changes the process id.
int TakeHandedSocket() {
  const char* pid_text = getenv("LISTEN_PID");
  const char* count_text = getenv("LISTEN_FDS");
  int pid = 0, count = 0;
  bool ours = pid_text != nullptr && count_text != nullptr &&
              quvaidx_tools::ParseInt(pid_text, 1, INT_MAX, &pid) &&
              pid == static_cast<int>(getpid()) &&
              quvaidx_tools::ParseInt(count_text, 1, INT_MAX, &count);
  unsetenv("LISTEN_PID");
  unsetenv("LISTEN_FDS");
  unsetenv("LISTEN_FDNAMES");
  return ours ? kFirstHandedDescriptor : -1;
}

// Why a server could not be built, after BuildServer* set errno: the
// system's words and what they mean here.
std::string ListenFailure(int err) {
  std::string reason = strerror(err);
  switch (err) {
    case EADDRINUSE:
      return reason + " (another process answers there)";
    case EEXIST:
      return reason + " (not a socket; it was left alone)";
    case EADDRNOTAVAIL:
      return reason + " (the socket handed over is bound elsewhere)";
    default:
      return reason;
  }
}

// Listens on the socket: the one handed over by a service manager, whose
// mode and group are the manager's, or one made here with the mode and
// group asked for (never open to others meanwhile). Without either, the
// file-creation mask decides, as for any daemon. Prints why on failure.
int Listen(event_base* base, const DaemonSpec& spec, const Settings& settings,
           EventArgs* args) {
  const char* path = settings.socket.c_str();
  int result;
  if (settings.handed_socket >= 0) {
    result = BuildServerOnSocket(base, settings.handed_socket, path, args);
  } else if (settings.socket_mode < 0 &&
             settings.socket_group == static_cast<gid_t>(-1)) {
    result = BuildServer(base, path, args);
  } else {
    ServerSocketAccess access;
    if (settings.socket_mode >= 0) {
      access.mode = static_cast<mode_t>(settings.socket_mode);
    } else {
      mode_t mask = umask(0);  // read it: umask has no query of its own
      umask(mask);
      access.mode = 0777 & ~mask;
    }
    access.group = settings.socket_group;
    result = BuildServerWithAccess(base, path, args, &access);
  }
  if (result != 0) {
    std::string reason = ListenFailure(errno);
    if (settings.handed_socket >= 0) {
      fprintf(stderr,
              "%s: cannot serve the socket handed over (fd %d) for %s: %s\n",
              spec.program, settings.handed_socket, path, reason.c_str());
    } else {
      fprintf(stderr, "%s: cannot listen on %s: %s\n", spec.program, path,
              reason.c_str());
    }
  }
  return result;
}

// Why the pid file at `path` could not be taken, as far as can be seen from
// here (the library has logged its own reason). A live instance holds the
// file's lock for its whole life.
std::string PidFileProblem(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd >= 0) {
    bool locked = flock(fd, LOCK_SH | LOCK_NB) != 0 && errno == EWOULDBLOCK;
    close(fd);
    if (locked) return "another instance runs";
  }
  struct stat st;
  if (lstat(path.c_str(), &st) == 0) {
    if (!S_ISREG(st.st_mode)) return "not a regular file";
    if (st.st_nlink > 1) return "a file of more than one name";
    if (access(path.c_str(), W_OK) != 0) return strerror(errno);
  } else if (errno != ENOENT) {
    return strerror(errno);
  }
  size_t slash = path.rfind('/');
  std::string directory = slash == 0 ? "/" : path.substr(0, slash);
  if (access(directory.c_str(), W_OK | X_OK) != 0) {
    return directory + ": " + strerror(errno);
  }
  return "see the system log";
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
    if (Listen(base, spec, settings, &args) != 0) goto done;
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
  if (spec.default_socket != nullptr) {
    settings.handed_socket = TakeHandedSocket();
  }
  openlog(spec.program, LOG_PID | (settings.to_stderr ? LOG_PERROR : 0),
          LOG_DAEMON);
  if (settings.log_level >= 0) ChageLogLevel(settings.log_level);
  WaitSystemReady();
  // Prints "Daemon alive. No need to start" itself when one runs already.
  int taken = settings.foreground ? BecomeProcess(settings.pid_file.c_str())
                                  : BecomeDaemon(settings.pid_file.c_str());
  if (taken != 0) {
    fprintf(stderr, "%s: not started: pid file %s: %s\n", spec.program,
            settings.pid_file.c_str(),
            PidFileProblem(settings.pid_file).c_str());
    return 1;
  }
  int status = Serve(spec, settings);
  DeletePidFile(settings.pid_file.c_str());
  return status;
}

}  // namespace quvaidx_daemons
