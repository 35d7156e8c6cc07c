// Request/reply throughput of the library's event server against a minimal
// bufferevent server with the same framing, driven by the same blocking
// client (pre-encoded request bytes, plain write and read) on 1, 4 and 16
// connections at once, one client thread per connection.
//
// Two requests: the 28-byte handshake and a 1.4 KB media-information
// record. For the large one, more runs measure what the library adds on
// both ends (SendPacket/RecvPacket client, library server) over jsoncpp's
// own parse and write of the same document: once against jsoncpp in a loop
// of its own, once against the same jsoncpp calls made by hand inside the
// same exchange (raw client and raw server each doing their JSON work).
//
// Client and server threads share the CPUs, so besides wall time each run
// reports the CPU time per request of the server thread (srv_cpu_ns) and of
// the client threads (the CPU column); the summary compares both.
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
qb::ServerThread g_raw_json_server;

const int kClientCounts[] = {1, 4, 16};

qb::ServerThread* ServerOf(qb::ServerKind kind) {
  switch (kind) {
    case qb::ServerKind::kLibrary:
      return &g_library_server;
    case qb::ServerKind::kRaw:
      return &g_raw_server;
    case qb::ServerKind::kRawJson:
      break;
  }
  return &g_raw_json_server;
}

// Records the server thread's CPU time per request (thread 0 only, so the
// per-thread sum equals its value).
class ServerCpuMeter {
 public:
  ServerCpuMeter(const benchmark::State& state, qb::ServerThread* server)
      : server_(server),
        active_(state.thread_index() == 0),
        start_(active_ ? server->CpuNanoseconds() : 0) {}
  void Finish(benchmark::State& state) {
    if (!active_ || state.iterations() == 0) return;
    double requests = static_cast<double>(state.iterations()) *
                      static_cast<double>(state.threads());
    state.counters["srv_cpu_ns"] =
        (server_->CpuNanoseconds() - start_) / requests;
  }

 private:
  qb::ServerThread* server_;
  bool active_;
  double start_;
};

// One client thread: a connection of its own and a blocking loop of
// pre-encoded request, reply header, reply body.
void BM_RawClient(benchmark::State& state, qb::ServerKind kind,
                  const std::string* packet) {
  qb::ServerThread* server = ServerOf(kind);
  std::vector<char> buffer(4 + 65536);
  int fd = qb::RawConnect(server->path());
  // One exchange before timing, so that the server has accepted.
  if (fd < 0 || qb::RawRoundTrip(fd, *packet, buffer.data()) < 0) {
    state.SkipWithError("cannot connect or first exchange failed");
  }
  ServerCpuMeter meter(state, server);
  for (auto _ : state) {
    if (qb::RawRoundTrip(fd, *packet, buffer.data()) < 0) {
      state.SkipWithError("exchange failed");
    }
  }
  meter.Finish(state);
  state.SetItemsProcessed(state.iterations());
  if (fd >= 0) close(fd);
}

// The library on both ends: SendPacket of the request value and RecvPacket
// of the reply (what AutoSendRecvPacketByFd does, without emptying the
// request) against the library server.
void BM_LibraryClient(benchmark::State& state, const Json::Value* request) {
  Json::Value value = *request;
  int fd = qb::RawConnect(g_library_server.path());
  {
    Json::Value reply;
    if (fd < 0 || SendPacket(fd, value) != 0 || RecvPacket(fd, reply) != 0) {
      state.SkipWithError("cannot connect or first exchange failed");
    }
  }
  ServerCpuMeter meter(state, &g_library_server);
  for (auto _ : state) {
    Json::Value reply;
    if (SendPacket(fd, value) != 0 || RecvPacket(fd, reply) != 0) {
      state.SkipWithError("exchange failed");
    }
    benchmark::DoNotOptimize(reply);
  }
  meter.Finish(state);
  state.SetItemsProcessed(state.iterations());
  if (fd >= 0) close(fd);
}

// The same JSON work done by hand on both ends: a client that writes the
// request with FastWriter and parses the reply with Reader (JsonRoundTrip),
// against the raw server that parses the request and writes the reply. The
// in-place cost of jsoncpp within an exchange, for comparison with the
// library on both ends.
void BM_JsonClient(benchmark::State& state, const Json::Value* request) {
  std::vector<char> buffer(4 + 65536);
  int fd = qb::RawConnect(g_raw_json_server.path());
  {
    Json::Value reply;
    if (fd < 0 || !qb::JsonRoundTrip(fd, *request, buffer.data(), &reply)) {
      state.SkipWithError("cannot connect or first exchange failed");
    }
  }
  ServerCpuMeter meter(state, &g_raw_json_server);
  for (auto _ : state) {
    Json::Value reply;
    if (!qb::JsonRoundTrip(fd, *request, buffer.data(), &reply)) {
      state.SkipWithError("exchange failed");
    }
    benchmark::DoNotOptimize(reply);
  }
  meter.Finish(state);
  state.SetItemsProcessed(state.iterations());
  if (fd >= 0) close(fd);
}

// jsoncpp alone: FastWriter write and Reader parse (comments collected, as
// the library parses) of one value, with writer and reader kept across
// iterations as the library keeps them.
void BM_JsonWriteParse(benchmark::State& state, const Json::Value* value) {
  Json::FastWriter writer;
  Json::Reader reader;
  for (auto _ : state) {
    std::string text = writer.write(*value);
    Json::Value parsed;
    reader.parse(text.data(), text.data() + text.size(), parsed, true);
    benchmark::DoNotOptimize(parsed);
  }
  state.SetItemsProcessed(state.iterations());
}

void BM_JsonParse(benchmark::State& state, const Json::Value* value) {
  Json::FastWriter writer;
  Json::Reader reader;
  std::string text = writer.write(*value);
  for (auto _ : state) {
    Json::Value parsed;
    reader.parse(text.data(), text.data() + text.size(), parsed, true);
    benchmark::DoNotOptimize(parsed);
  }
}

void BM_JsonWrite(benchmark::State& state, const Json::Value* value) {
  Json::FastWriter writer;
  for (auto _ : state) {
    std::string text = writer.write(*value);
    benchmark::DoNotOptimize(text);
  }
}

std::string g_handshake_packet;
std::string g_media_packet;
Json::Value g_success_reply;

void Register() {
  struct Payload {
    const char* name;
    const std::string* packet;
  };
  const Payload payloads[] = {{"handshake", &g_handshake_packet},
                              {"media", &g_media_packet}};
  for (const Payload& p : payloads) {
    for (qb::ServerKind kind :
         {qb::ServerKind::kLibrary, qb::ServerKind::kRaw}) {
      std::string name =
          std::string("server/") + qb::ServerKindName(kind) + "/" + p.name;
      auto* b = benchmark::RegisterBenchmark(name.c_str(), BM_RawClient, kind,
                                             p.packet);
      for (int n : kClientCounts) b->Threads(n);
      b->UseRealTime();
    }
  }
  auto* e2e = benchmark::RegisterBenchmark(
      "e2e/library/media", BM_LibraryClient, &qb::MediaInfoRequest());
  e2e->Threads(1)->Threads(16)->UseRealTime();
  auto* by_hand = benchmark::RegisterBenchmark(
      "e2e/raw+json/media", BM_JsonClient, &qb::MediaInfoRequest());
  by_hand->Threads(1)->Threads(16)->UseRealTime();
  benchmark::RegisterBenchmark("json/write+parse/media", BM_JsonWriteParse,
                               &qb::MediaInfoRequest());
  benchmark::RegisterBenchmark("json/write+parse/reply", BM_JsonWriteParse,
                               &g_success_reply);
  benchmark::RegisterBenchmark("json/parse/media", BM_JsonParse,
                               &qb::MediaInfoRequest());
  benchmark::RegisterBenchmark("json/write/reply", BM_JsonWrite,
                               &g_success_reply);
}

// CPU nanoseconds per request of the client threads and the server thread
// together: less disturbed by other load on the machine than wall time.
double CpuPerRequest(const qb::KeepingReporter& r, const std::string& name,
                     int threads) {
  return r.CpuNsPerOp(name, threads) + r.Counter(name, "srv_cpu_ns", threads);
}

void Summarise(const qb::KeepingReporter& r) {
  printf("\n== Event server vs raw bufferevent server (same raw client) ==\n");
  printf("  request sizes: handshake %zu B, media %zu B (whole packet)\n",
         g_handshake_packet.size(), g_media_packet.size());
  for (const char* payload : {"handshake", "media"}) {
    for (int n : kClientCounts) {
      std::string lib = std::string("server/library/") + payload;
      std::string raw = std::string("server/raw/") + payload;
      double lib_ns = r.NsPerOp(lib, n);
      double raw_ns = r.NsPerOp(raw, n);
      char label[128];
      snprintf(label, sizeof(label), "%s, %2d clients: req/s library, raw",
               payload, n);
      printf("  %-52s %8.0f, %8.0f  ratio %.3f\n", label, 1e9 / lib_ns,
             1e9 / raw_ns, raw_ns / lib_ns);
      snprintf(label, sizeof(label), "%s, %2d clients: server CPU ns/req",
               payload, n);
      double lib_srv = r.Counter(lib, "srv_cpu_ns", n);
      double raw_srv = r.Counter(raw, "srv_cpu_ns", n);
      printf("  %-52s %8.0f, %8.0f  ratio %.3f\n", label, lib_srv, raw_srv,
             lib_srv / raw_srv);
      snprintf(label, sizeof(label),
               "%s, %2d clients: client+server CPU ns/req", payload, n);
      double lib_cpu = CpuPerRequest(r, lib, n);
      double raw_cpu = CpuPerRequest(r, raw, n);
      printf("  %-52s %8.0f, %8.0f  ratio %.3f\n", label, lib_cpu, raw_cpu,
             lib_cpu / raw_cpu);
    }
  }
  double small16 = r.NsPerOp("server/raw/handshake", 16) /
                   r.NsPerOp("server/library/handshake", 16);
  qb::PrintGoal("throughput library/raw, 16 clients, handshake", small16, 0.75,
                /*at_most=*/false);

  printf("\n== 1.4 KB request: library client+server over jsoncpp ==\n");
  printf(
      "  library = SendPacket/RecvPacket client + library server;\n"
      "  raw = raw client + raw server moving the same bytes, no JSON\n");
  double json_wall = r.NsPerOp("json/write+parse/media");
  double json_cpu = r.CpuNsPerOp("json/write+parse/media");
  double reply_cpu = r.CpuNsPerOp("json/write+parse/reply");
  qb::PrintRatio("jsoncpp FastWriter write + Reader parse, media (CPU)",
                 json_cpu, "ns");
  qb::PrintRatio("jsoncpp write + parse of the {\"success\":true} reply (CPU)",
                 reply_cpu, "ns");
  for (int n : {1, 16}) {
    double lib_cpu = CpuPerRequest(r, "e2e/library/media", n);
    double raw_cpu = CpuPerRequest(r, "server/raw/media", n);
    double lib_wall = r.NsPerOp("e2e/library/media", n);
    double raw_wall = r.NsPerOp("server/raw/media", n);
    char label[128];
    snprintf(label, sizeof(label), "%2d clients: CPU ns/req library, raw", n);
    printf("  %-52s %8.0f, %8.0f  added %.0f\n", label, lib_cpu, raw_cpu,
           lib_cpu - raw_cpu);
    snprintf(label, sizeof(label), "%2d clients: wall ns/req library, raw", n);
    printf("  %-52s %8.0f, %8.0f  added %.0f\n", label, lib_wall, raw_wall,
           lib_wall - raw_wall);
    snprintf(label, sizeof(label),
             "%d clients: added CPU / jsoncpp(write+parse media)", n);
    qb::PrintGoal(label, (lib_cpu - raw_cpu) / json_cpu, 1.10,
                  /*at_most=*/true);
    snprintf(label, sizeof(label), "  %d clients: same on wall time (noisier)",
             n);
    qb::PrintRatio(label, (lib_wall - raw_wall) / json_wall, "x");
    snprintf(label, sizeof(label),
             "  %d clients: added CPU / jsoncpp(media + reply)", n);
    qb::PrintRatio(label, (lib_cpu - raw_cpu) / (json_cpu + reply_cpu), "x");
    // The same JSON work by hand inside the same exchange: what jsoncpp
    // costs in place (cold caches after system calls, another thread).
    double hand_cpu = CpuPerRequest(r, "e2e/raw+json/media", n);
    snprintf(label, sizeof(label),
             "  %d clients: CPU ns/req JSON by hand on both ends", n);
    printf("  %-52s %8.0f  added %.0f\n", label, hand_cpu, hand_cpu - raw_cpu);
    snprintf(label, sizeof(label),
             "%d clients: added CPU / by-hand added (in place)", n);
    qb::PrintGoal(label, (lib_cpu - raw_cpu) / (hand_cpu - raw_cpu), 1.10,
                  /*at_most=*/true);
  }
  double srv_lib = r.Counter("server/library/media", "srv_cpu_ns", 1);
  double srv_raw = r.Counter("server/raw/media", "srv_cpu_ns", 1);
  double parse = r.CpuNsPerOp("json/parse/media");
  double write_reply = r.CpuNsPerOp("json/write/reply");
  printf("  server side alone, 1 client (raw client):\n");
  qb::PrintRatio("  server CPU added per media request (library - raw)",
                 srv_lib - srv_raw, "ns");
  qb::PrintRatio("  jsoncpp parse media + write reply", parse + write_reply,
                 "ns");
  qb::PrintRatio("  ratio", (srv_lib - srv_raw) / (parse + write_reply), "x");
}

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  g_handshake_packet = qb::EncodePacketBytes(qb::HandshakeRequest());
  g_media_packet = qb::EncodePacketBytes(qb::MediaInfoRequest());
  g_success_reply = Json::Value(Json::objectValue);
  g_success_reply["success"] = true;

  if (!g_library_server.Start(qb::ServerKind::kLibrary,
                              qb::SocketPath("server-lib")) ||
      !g_raw_server.Start(qb::ServerKind::kRaw, qb::SocketPath("server-raw")) ||
      !g_raw_json_server.Start(qb::ServerKind::kRawJson,
                               qb::SocketPath("server-raw-json"))) {
    fprintf(stderr, "cannot start the servers\n");
    g_library_server.Stop();
    g_raw_server.Stop();
    g_raw_json_server.Stop();
    return 1;
  }
  Register();
  qb::KeepingReporter reporter;
  int rc = qb::RunAll(argc, argv, &reporter);
  g_library_server.Stop();
  g_raw_server.Stop();
  g_raw_json_server.Stop();
  if (rc == 0) Summarise(reporter);
  return rc;
}
