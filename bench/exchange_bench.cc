// One whole client exchange per iteration: connect, send the handshake
// request, receive the reply, close.
//
//   exchange/library: AutoSendRecvPacketBySocketPath(path, value, 1) against
//                     the library's event server;
//   exchange/raw:     socket, connect, write, read, read, close of the same
//                     bytes against the minimal bufferevent server;
//   exchange/raw-client+library-server: the raw client against the library
//                     server, to tell the client's share from the server's.
#include <math.h>
#include <signal.h>
#include <stdio.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "bench_support.h"
#include "quvaidx/ipc.h"

namespace qb = quvaidx_bench;

namespace {

qb::ServerThread g_library_server;
qb::ServerThread g_raw_server;
std::string g_request_packet;

void BM_LibraryExchange(benchmark::State& state) {
  const Json::Value& request = qb::HandshakeRequest();
  const std::string& path = g_library_server.path();
  Json::Value value;
  for (auto _ : state) {
    value = request;  // the exchange replaces it with the reply
    if (AutoSendRecvPacketBySocketPath(path.c_str(), value, 1) != 0) {
      state.SkipWithError("exchange failed");
      break;
    }
  }
  if (!value.isObject() || !value["success"].asBool()) {
    state.SkipWithError("unexpected reply");
  }
  state.SetItemsProcessed(state.iterations());
}

// Copying the request value, which BM_LibraryExchange does per iteration.
void BM_RequestCopy(benchmark::State& state) {
  const Json::Value& request = qb::HandshakeRequest();
  Json::Value value;
  for (auto _ : state) {
    value = request;
    benchmark::DoNotOptimize(value);
  }
}

void BM_RawExchange(benchmark::State& state, qb::ServerThread* server) {
  const std::string& path = server->path();
  std::vector<char> buffer(4 + 65536);
  for (auto _ : state) {
    int fd = qb::RawConnect(path);
    long got =
        fd < 0 ? -1 : qb::RawRoundTrip(fd, g_request_packet, buffer.data());
    if (fd >= 0) close(fd);
    if (got < 0) {
      state.SkipWithError("exchange failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

void Summarise(const qb::KeepingReporter& r) {
  printf("\n== One client exchange (connect, send, receive, close) ==\n");
  double lib = r.NsPerOp("exchange/library");
  double raw = r.NsPerOp("exchange/raw");
  double mixed = r.NsPerOp("exchange/raw-client+library-server");
  double copy = r.NsPerOp("exchange/request-copy");
  qb::PrintRatio("library: AutoSendRecvPacketBySocketPath + library server",
                 lib, "ns/op");
  qb::PrintRatio("raw: socket/connect/write/read/close + raw server", raw,
                 "ns/op");
  qb::PrintRatio("raw client + library server", mixed, "ns/op");
  qb::PrintRatio("request value copy (inside the library figure)", copy,
                 "ns/op");
  qb::PrintRatio("client share: library - (raw client + library server)",
                 lib - mixed, "ns/op");
  qb::PrintRatio("server share: (raw client + library server) - raw",
                 mixed - raw, "ns/op");
  qb::PrintGoal("one exchange library/raw", lib / raw, 1.2,
                /*at_most=*/true);
}

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  g_request_packet = qb::EncodePacketBytes(qb::HandshakeRequest());
  if (!g_library_server.Start(qb::ServerKind::kLibrary,
                              qb::SocketPath("exchange-lib")) ||
      !g_raw_server.Start(qb::ServerKind::kRaw,
                          qb::SocketPath("exchange-raw"))) {
    fprintf(stderr, "cannot start the servers\n");
    g_library_server.Stop();
    g_raw_server.Stop();
    return 1;
  }
  benchmark::RegisterBenchmark("exchange/library", BM_LibraryExchange)
      ->UseRealTime();
  benchmark::RegisterBenchmark("exchange/raw", BM_RawExchange, &g_raw_server)
      ->UseRealTime();
  benchmark::RegisterBenchmark("exchange/raw-client+library-server",
                               BM_RawExchange, &g_library_server)
      ->UseRealTime();
  benchmark::RegisterBenchmark("exchange/request-copy", BM_RequestCopy);
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  g_library_server.Stop();
  g_raw_server.Stop();
  if (rc == 0) Summarise(reporter);
  return rc;
}
