// A fixed load in separate processes, so that system calls can be counted
// for one side alone (scripts/bench.sh runs one side under `strace -f -c`).
//
//   quvaidx_bench_load serve library|raw PATH REQUESTS
//       Serves at PATH until REQUESTS requests have been answered and every
//       connection has closed (at most 60 s), then prints "served N".
//   quvaidx_bench_load drive PATH CLIENTS REQUESTS_PER_CLIENT handshake|media
//       CLIENTS threads, each on one connection, each sending its requests
//       one after the other with the raw client; prints the elapsed time.
//   quvaidx_bench_load exchange library|raw PATH COUNT
//       COUNT whole exchanges (connect, send, receive, close), with
//       AutoSendRecvPacketBySocketPath or with plain system calls.
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "bench_support.h"
#include "quvaidx/ipc.h"

namespace qb = quvaidx_bench;

namespace {

int Usage() {
  fprintf(stderr,
          "usage: quvaidx_bench_load serve library|raw PATH REQUESTS\n"
          "       quvaidx_bench_load drive PATH CLIENTS REQUESTS_PER_CLIENT "
          "handshake|media\n"
          "       quvaidx_bench_load exchange library|raw PATH COUNT\n");
  return 2;
}

bool ParseKind(const char* text, qb::ServerKind* kind) {
  if (strcmp(text, "library") == 0) {
    *kind = qb::ServerKind::kLibrary;
  } else if (strcmp(text, "raw") == 0) {
    *kind = qb::ServerKind::kRaw;
  } else {
    return false;
  }
  return true;
}

// Connects, retrying for up to five seconds while the server starts.
int ConnectWithRetry(const std::string& path) {
  for (int i = 0; i < 500; ++i) {
    int fd = qb::RawConnect(path);
    if (fd >= 0) return fd;
    usleep(10000);
  }
  return -1;
}

int Drive(const std::string& path, int clients, long per_client,
          const std::string& packet) {
  std::atomic<long> failures{0};
  auto start = std::chrono::steady_clock::now();
  std::vector<std::thread> threads;
  for (int c = 0; c < clients; ++c) {
    threads.emplace_back([&] {
      std::vector<char> buffer(4 + 65536);
      int fd = ConnectWithRetry(path);
      if (fd < 0) {
        failures += per_client;
        return;
      }
      for (long i = 0; i < per_client; ++i) {
        if (qb::RawRoundTrip(fd, packet, buffer.data()) < 0) {
          failures += per_client - i;
          break;
        }
      }
      close(fd);
    });
  }
  for (std::thread& t : threads) t.join();
  double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start)
          .count();
  printf("drove %ld requests on %d connections in %.3f s, %ld failed\n",
         clients * per_client, clients, seconds, failures.load());
  return failures.load() == 0 ? 0 : 1;
}

int Exchange(qb::ServerKind kind, const std::string& path, long count) {
  int fd = ConnectWithRetry(path);  // waits for the server to listen
  if (fd < 0) return 1;
  close(fd);
  const std::string packet = qb::EncodePacketBytes(qb::HandshakeRequest());
  std::vector<char> buffer(4 + 65536);
  long failures = 0;
  for (long i = 0; i < count; ++i) {
    if (kind == qb::ServerKind::kLibrary) {
      Json::Value value = qb::HandshakeRequest();
      if (AutoSendRecvPacketBySocketPath(path.c_str(), value, 1) != 0) {
        ++failures;
      }
    } else {
      fd = qb::RawConnect(path);
      if (fd < 0 || qb::RawRoundTrip(fd, packet, buffer.data()) < 0) {
        ++failures;
      }
      if (fd >= 0) close(fd);
    }
  }
  printf("%ld exchanges, %ld failed\n", count, failures);
  return failures == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  if (argc < 2) return Usage();
  std::string mode = argv[1];
  qb::ServerKind kind;
  if (mode == "serve" && argc == 5 && ParseKind(argv[2], &kind)) {
    long served = qb::ServeInThisThread(kind, argv[3],
                                        strtoull(argv[4], nullptr, 10), 60);
    printf("served %ld\n", served);
    return served >= 0 && served == atol(argv[4]) ? 0 : 1;
  }
  if (mode == "drive" && argc == 6) {
    std::string payload = argv[5];
    if (payload != "handshake" && payload != "media") return Usage();
    const std::string packet = qb::EncodePacketBytes(
        payload == "media" ? qb::MediaInfoRequest() : qb::HandshakeRequest());
    return Drive(argv[2], atoi(argv[3]), atol(argv[4]), packet);
  }
  if (mode == "exchange" && argc == 5 && ParseKind(argv[2], &kind)) {
    return Exchange(kind, argv[3], atol(argv[4]));
  }
  return Usage();
}
