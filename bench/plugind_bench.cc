// How long a HANDSHAKE waits at the plug-in daemon while other requests
// wait on a media parser that never answers, against the serial daemon the
// plug-in daemon used to be, in one run:
//
//   idle      quvaindexplugind with nothing else to do: 200 whole exchanges
//             (connect, send, receive, close) of HANDSHAKE;
//   waiting   the same daemon while 10 IS_VIDEO_NEED_CONVERT requests, each
//             on a connection of its own, wait on the media parser: 1000
//             exchanges;
//   serial    a daemon that answers every request in its handler, one at a
//             time, as the plug-in daemon did (the same answers, from the
//             plugind_requests library, on the event server without
//             deferred replies), with the same 10 requests before each
//             HANDSHAKE: 2 exchanges (each waits for all 10 to time out, so
//             its media-parser timeout is 1 s here instead of 5).
//
// The media parser is a stand-in: a socket that nobody accepts on, as a
// stopped daemon's; connections to it wait in its backlog. Everything lives
// in a private temporary directory removed at exit. Prints p50 and p99 of
// each, in milliseconds, and the goal: p99 at most 10 ms while 10 requests
// wait.
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include <event2/event.h>
#include <json/json.h>
#include <quvaidx/daemon.h>
#include <quvaidx/ipc.h>

#include "bench_process.h"
#include "bench_report.h"
#include "plugin_requests.h"

namespace qb = quvaidx_bench;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int kWaiting = 10;

// A socket bound to `path` that nobody accepts on; -1 on failure.
int ListenNeverAccepting(const std::string& path) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) return -1;
  memcpy(address.sun_path, path.c_str(), path.size() + 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0 ||
      bind(fd, reinterpret_cast<struct sockaddr*>(&address), sizeof(address)) !=
          0 ||
      listen(fd, 128) != 0) {
    if (fd >= 0) close(fd);
    return -1;
  }
  return fd;
}

// One whole exchange of `request` with the daemon at `socket`: the
// milliseconds it took, or -1 when it failed.
double ExchangeMs(const std::string& socket, const Json::Value& request) {
  const auto start = Clock::now();
  Json::Value value = request;
  if (AutoSendRecvPacketBySocketPath(socket.c_str(), value, 1) != 0) return -1;
  return std::chrono::duration<double, std::milli>(Clock::now() - start)
      .count();
}

// Opens `count` connections to `socket`, each with `request` sent on it and
// its reply not read.
std::vector<int> SendAndWait(const std::string& socket,
                             const Json::Value& request, int count) {
  std::vector<int> fds;
  for (int i = 0; i < count; ++i) {
    int fd = ConnectPeer(socket.c_str(), false, 1);
    Json::Value value = request;
    if (fd >= 0 && SendPacket(fd, value) == 0) fds.push_back(fd);
  }
  return fds;
}

void CloseAll(std::vector<int>* fds) {
  for (int fd : *fds) close(fd);
  fds->clear();
}

double Percentile(std::vector<double> samples, double p) {
  if (samples.empty()) return -1;
  std::sort(samples.begin(), samples.end());
  size_t at = static_cast<size_t>(p * static_cast<double>(samples.size() - 1));
  return samples[at];
}

// Waits until a HANDSHAKE is answered at `socket` (5 s at most).
bool WaitAnswering(const std::string& socket, const Json::Value& handshake) {
  for (int i = 0; i < 500; ++i) {
    if (ExchangeMs(socket, handshake) >= 0) return true;
    usleep(10 * 1000);
  }
  return false;
}

// The serial daemon: every request answered in the handler, the loop held
// meanwhile. Runs in a child process until killed.
plugind::PluginConfig g_serial_config;
int SerialHandle(Json::Value& request, Json::Value& reply, EventArgs*) {
  return plugind::HandlePluginRequest(
      g_serial_config, quvaidx_daemons::FsUser(), request, &reply);
}

pid_t StartSerialDaemon(const std::string& socket,
                        const std::string& media_parser) {
  pid_t pid = fork();
  if (pid != 0) return pid;
  g_serial_config.media_parser_socket = media_parser;
  g_serial_config.media_parser_timeout_s = 1;
  static EventArgs args = {"serial", nullptr, SerialHandle};
  struct event_base* base = event_base_new();
  if (base == nullptr || BuildServer(base, socket.c_str(), &args) != 0) {
    _exit(1);
  }
  event_base_dispatch(base);
  _exit(0);
}

void Stop(pid_t pid) {
  if (pid <= 0) return;
  kill(pid, SIGKILL);
  qb::WaitExit(pid);
}

}  // namespace

int main() {
  char dir_template[] = "/tmp/quvaidx-plugind-bench-XXXXXX";
  if (mkdtemp(dir_template) == nullptr) return 1;
  const std::string dir = dir_template;
  const std::string media = dir + "/mediaparser.sock";
  const std::string fresh = dir + "/plugind.sock";
  const std::string serial = dir + "/serial.sock";
  const std::string video = dir + "/clip.mkv";
  FILE* file = fopen(video.c_str(), "w");
  if (file != nullptr) fclose(file);

  Json::Value handshake(Json::objectValue);
  handshake["command"] = "HANDSHAKE";
  Json::Value convert(Json::objectValue);
  convert["command"] = "IS_VIDEO_NEED_CONVERT";
  convert["path"] = video;

  int stopped_parser = ListenNeverAccepting(media);
  pid_t old_daemon = StartSerialDaemon(serial, media);
  pid_t daemon = qb::SpawnQuiet(
      {QUVAIDX_PLUGIND, "--foreground", "--socket", fresh, "--pidfile",
       dir + "/plugind.pid", "--media-parser", media, "--media-parser-timeout",
       "600", "--max-requests", "64"});
  int status = 1;
  if (stopped_parser >= 0 && old_daemon > 0 && daemon > 0 &&
      WaitAnswering(fresh, handshake) && WaitAnswering(serial, handshake)) {
    std::vector<double> idle, waiting, old;
    for (int i = 0; i < 200; ++i) idle.push_back(ExchangeMs(fresh, handshake));
    std::vector<int> held = SendAndWait(fresh, convert, kWaiting);
    usleep(100 * 1000);  // all taken by the daemon's workers
    for (int i = 0; i < 1000; ++i) {
      waiting.push_back(ExchangeMs(fresh, handshake));
    }
    CloseAll(&held);
    for (int round = 0; round < 2; ++round) {
      held = SendAndWait(serial, convert, kWaiting);
      usleep(100 * 1000);
      old.push_back(ExchangeMs(serial, handshake));
      CloseAll(&held);
    }
    const bool complete =
        std::count(waiting.begin(), waiting.end(), -1.0) == 0 &&
        std::count(old.begin(), old.end(), -1.0) == 0 &&
        std::count(idle.begin(), idle.end(), -1.0) == 0;
    printf("\nHANDSHAKE, whole exchanges, milliseconds:\n");
    qb::PrintRatio("plugind idle: p50", Percentile(idle, 0.5), "ms");
    qb::PrintRatio("plugind idle: p99", Percentile(idle, 0.99), "ms");
    qb::PrintRatio("plugind, 10 requests waiting: p50",
                   Percentile(waiting, 0.5), "ms");
    qb::PrintRatio("plugind, 10 requests waiting: p99",
                   Percentile(waiting, 0.99), "ms");
    qb::PrintRatio("serial daemon (1 s timeout), 10 waiting: p50",
                   Percentile(old, 0.5), "ms");
    qb::PrintGoal("plugind: HANDSHAKE p99 with 10 requests waiting (ms)",
                  Percentile(waiting, 0.99), 10, true);
    if (!complete) printf("some exchanges failed\n");
    status = complete ? 0 : 1;
  } else {
    fprintf(stderr, "plugind_bench: the daemons did not start\n");
  }
  Stop(daemon);
  Stop(old_daemon);
  if (stopped_parser >= 0) close(stopped_parser);
  std::error_code ignored;
  std::filesystem::remove_all(dir, ignored);
  return status;
}
