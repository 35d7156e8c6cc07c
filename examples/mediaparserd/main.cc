// mediaparserd: a small media-parser daemon built on libquvaidx.
//
// It shows how an index daemon is put together, in the library's order:
// wait for the system to boot; take the pid file (refusing a second
// instance) and, with --daemon, detach; make the event base, watch SIGINT
// and SIGTERM, and listen with BuildServer; run the loop; then StopServer
// and DeletePidFile. Requests are answered from what a file's status, name
// and first bytes tell (see probe.h), so the library's media-parser calls
// (QUVAIDX_GetMediaInfo, QUVAIDX_GetMediaResolution,
// QUVAIDX_GetVideoMetadata) get real answers.
#include <errno.h>
#include <getopt.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include <event2/event.h>
#include <json/json.h>
#include <quvaidx/quvaidx.h>

#include "probe.h"

namespace {

constexpr char kDefaultPidFile[] = QUVAIDX_MEDIAD_PID_FILE;

const char kUsage[] =
    "Usage: mediaparserd [--socket PATH] [--pidfile FILE] [--daemon]\n"
    "\n"
    "Answers HANDSHAKE, GET_MEDIA_INFO, GET_MEDIA_RESOLUTION and\n"
    "GET_VIDEO_METADATA {\"path\": ABSOLUTE_PATH} on a Unix-domain socket\n"
    "until SIGINT or SIGTERM.\n"
    "\n"
    "  -s, --socket PATH   where to listen (default %s)\n"
    "  -p, --pidfile FILE  pid file (default %s)\n"
    "  -d, --daemon        detach into the background\n"
    "  -h, --help          show this help\n";

// GET_* requests name a file by its "path"; anything else in the request
// is ignored. Read through a const reference, so no member is added.
bool PathOf(const Json::Value& request, std::string* path) {
  if (!request["path"].isString()) return false;
  *path = request["path"].asString();
  return true;
}

int Handle(Json::Value& request, Json::Value& reply, EventArgs*) {
  const Json::Value& in = request;
  std::string command;
  if (in.isObject() && in["command"].isString()) {
    command = in["command"].asString();
  }
  if (command == "HANDSHAKE") {
    reply = MakeResponse(true, nullptr);
    return 0;
  }
  if (command != "GET_MEDIA_INFO" && command != "GET_MEDIA_RESOLUTION" &&
      command != "GET_VIDEO_METADATA") {
    reply = MakeResponse(false, "unknown command");
    return 0;
  }
  std::string path, reason;
  if (!PathOf(in, &path)) {
    reply = MakeResponse(false, "missing \"path\"");
    return 0;
  }
  // About 13 KB; the loop runs one handler at a time.
  static __tag_QUVA_MEDIA_INFO record;
  if (!mediaparserd::ProbeMediaFile(path, &record, &reason)) {
    reply = MakeResponse(false, reason.c_str());
    return 0;
  }
  reply = MakeResponse(true, nullptr);
  if (command == "GET_MEDIA_INFO") {
    MediaInfoObject2Json(record, reply["media"]);
  } else if (command == "GET_MEDIA_RESOLUTION") {
    reply["width"] = record.resolutionX;
    reply["height"] = record.resolutionY;
  } else {
    // Rotation and pixel aspect ratio need a decoder: reported unknown (0).
    _VIDEO_METADATA_ metadata = {0, 0, 0};
    VideoMetadataObject2Json(metadata, reply["metadata"]);
  }
  return 0;
}

void OnStopSignal(evutil_socket_t, short, void* base) {
  event_base_loopexit(static_cast<event_base*>(base), nullptr);
}

// Detaching moves the working directory to "/": relative paths are made
// absolute first. False when the current directory cannot be read.
bool MakeAbsolute(std::string* path) {
  if ((*path)[0] == '/') return true;
  char cwd[PATH_MAX];
  if (getcwd(cwd, sizeof(cwd)) == nullptr) return false;
  *path = std::string(cwd) + "/" + *path;
  return true;
}

// Listens on `socket` until a stop signal. Returns the exit status.
int Serve(const std::string& socket, bool detached) {
  event_base* base = event_base_new();
  if (base == nullptr) return 1;
  event* sigint = evsignal_new(base, SIGINT, OnStopSignal, base);
  event* sigterm = evsignal_new(base, SIGTERM, OnStopSignal, base);
  EventArgs args = {"mediaparserd", nullptr, Handle};
  int status = 1;
  if (sigint == nullptr || sigterm == nullptr ||
      evsignal_add(sigint, nullptr) != 0 ||
      evsignal_add(sigterm, nullptr) != 0) {
    fprintf(stderr, "mediaparserd: cannot watch SIGINT and SIGTERM\n");
  } else if (BuildServer(base, socket.c_str(), &args) != 0) {
    fprintf(stderr, "mediaparserd: cannot listen on %s\n", socket.c_str());
  } else {
    if (!detached) {
      printf("mediaparserd: listening on %s\n", socket.c_str());
      fflush(stdout);
    }
    event_base_dispatch(base);
    StopServer(socket.c_str());
    status = 0;
  }
  if (sigint != nullptr) event_free(sigint);
  if (sigterm != nullptr) event_free(sigterm);
  event_base_free(base);
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  static const struct option kOptions[] = {
      {"socket", required_argument, nullptr, 's'},
      {"pidfile", required_argument, nullptr, 'p'},
      {"daemon", no_argument, nullptr, 'd'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  std::string socket = DaemonInfo().get("mediad", "sock");
  std::string pid_file = kDefaultPidFile;
  bool detach = false;
  int c;
  while ((c = getopt_long(argc, argv, "s:p:dh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 's':
        socket = optarg;
        break;
      case 'p':
        pid_file = optarg;
        break;
      case 'd':
        detach = true;
        break;
      case 'h':
        printf(kUsage, DaemonInfo().get("mediad", "sock").c_str(),
               kDefaultPidFile);
        return 0;
      default:
        fprintf(stderr, "Try 'mediaparserd --help'.\n");
        return 2;
    }
  }
  if (optind < argc || socket.empty() || pid_file.empty()) {
    fprintf(stderr, "mediaparserd: bad arguments; try --help\n");
    return 2;
  }
  if (socket.size() > kMaxSocketPath) {
    fprintf(stderr, "mediaparserd: socket path longer than %zu bytes\n",
            kMaxSocketPath);
    return 2;
  }
  if (!MakeAbsolute(&socket) || !MakeAbsolute(&pid_file)) {
    fprintf(stderr, "mediaparserd: %s\n", strerror(errno));
    return 1;
  }
  // BuildServer removes whatever is at the socket path; only a socket may
  // be replaced, never a file that happens to be there.
  struct stat st;
  if (lstat(socket.c_str(), &st) == 0 && !S_ISSOCK(st.st_mode)) {
    fprintf(stderr, "mediaparserd: %s exists and is not a socket\n",
            socket.c_str());
    return 2;
  }
  WaitSystemReady();
  // Prints "Daemon alive. No need to start" itself when one runs already.
  int taken =
      detach ? BecomeDaemon(pid_file.c_str()) : BecomeProcess(pid_file.c_str());
  if (taken != 0) {
    fprintf(stderr, "mediaparserd: not started (pid file %s)\n",
            pid_file.c_str());
    return 1;
  }
  int status = Serve(socket, detach);
  DeletePidFile(pid_file.c_str());
  return status;
}
