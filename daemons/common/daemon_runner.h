// The life of a reference daemon, in one place for all of them.
//
// A daemon describes itself in a DaemonSpec (name, help, default socket and
// pid file, request handler, options and hooks of its own) and hands main's
// arguments to RunDaemon, which does the rest in the order the library's
// lifecycle functions are built for:
//
//   1. parse the command line (the options below plus the daemon's own);
//   2. open the system log under the program's name (with --stderr, every
//      line is copied to standard error as well) and set the log level;
//   3. WaitSystemReady;
//   4. BecomeDaemon (detach; the default) or, with --foreground,
//      BecomeProcess: the pid file, refusing a second instance;
//   5. make the event base; SIGTERM and SIGINT end the loop;
//   6. the socket (when the daemon has one): the listening socket a service
//      manager handed over (LISTEN_PID names this process and LISTEN_FDS
//      counts one or more: descriptor 3, which must be bound to the
//      --socket path; its file stays the manager's), else BuildServer with
//      the socket's mode and group when asked for;
//   7. the daemon's start hook; in the foreground, "PROGRAM: listening on
//      SOCKET" (or "PROGRAM: running") on standard output;
//   8. the loop, until a stop signal;
//   9. the stop hook, StopServer, DeletePidFile.
//
// Common options: -s/--socket PATH, -p/--pidfile FILE, -f/--foreground,
// --stderr, -l/--loglevel N, --socket-mode MODE, --socket-group GROUP,
// -V/--version, -h/--help. Relative paths are made absolute before the
// process detaches (which moves it to "/").
#ifndef QUVAIDX_DAEMONS_COMMON_DAEMON_RUNNER_H_
#define QUVAIDX_DAEMONS_COMMON_DAEMON_RUNNER_H_

#include <string>
#include <vector>

#include <quvaidx/daemon.h>

#include "options.h"

struct event_base;

namespace quvaidx_daemons {

struct DaemonSpec {
  const char* program;          // executable name: "quvamediaparserd"
  const char* summary;          // one line: what it is (man page NAME)
  std::string description;      // paragraphs for --help (and the man page)
  const char* default_socket;   // null: the daemon listens on no socket
  const char* default_pidfile;  // its pid file
  EventHandler handler;         // requests on the socket; null without one
  void* context;                // passed to the hooks and as EventArgs.context
  std::vector<quvaidx_tools::Option> options;  // the daemon's own options
  std::string epilog;  // text after the options in --help
  // After the pid file is taken, the process detached and the socket built,
  // before the loop: may add events to `base`. A non-zero result ends the
  // start with that exit status (the pid file and socket are taken down).
  int (*start)(struct event_base* base, void* context);
  // After the loop has ended, before the socket and pid file go.
  void (*stop)(void* context);
};

// Runs the daemon described by `spec` with main's arguments. Returns the
// process's exit status: 0 after a stop signal, 1 when the daemon could not
// start (another instance runs, the socket is taken, a hook refused), with
// one line on standard error that says why in the system's words
// ("PROGRAM: cannot listen on PATH: Address already in use (another process
// answers there)"), 2 for a usage error; after --help or --version, 0.
int RunDaemon(const DaemonSpec& spec, int argc, char** argv);

// A daemon option whose value is a path: stored in *out made absolute (from
// the working directory at parsing), since a detached daemon works from "/".
quvaidx_tools::Option PathOption(const char* name, char letter,
                                 const char* value_name, std::string* out,
                                 std::string help);

// "PROGRAM VERSION" for --version: the library's version.
std::string VersionLine(const char* program);

}  // namespace quvaidx_daemons

#endif  // QUVAIDX_DAEMONS_COMMON_DAEMON_RUNNER_H_
