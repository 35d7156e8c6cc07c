// Shared pieces of the benchmarks: the request payloads, a blocking client
// that moves pre-encoded packets with plain system calls, the two servers
// under comparison (the library's event server and a minimal bufferevent
// server with the same framing); and, from bench_report.h, the reporter that
// keeps every result so that a benchmark binary can print library/baseline
// ratios at the end.
#ifndef QUVAIDX_BENCH_BENCH_SUPPORT_H_
#define QUVAIDX_BENCH_BENCH_SUPPORT_H_

#include <pthread.h>
#include <stddef.h>
#include <stdint.h>
#include <time.h>

#include <atomic>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>
#include <json/json.h>

#include "bench_report.h"

namespace quvaidx_bench {

// ---------------------------------------------------------------------------
// Payloads

// {"command":"HANDSHAKE"}
const Json::Value& HandshakeRequest();
// {"command":"SET_MEDIA_INFO","media":{...}}: a media-information record of
// about forty string and number fields, about 1.4 KB of compact text.
const Json::Value& MediaInfoRequest();

// The packet that the library's framing produces for `value`: 4-byte header
// (magic 0x15BE, 16-bit length, both big-endian) and the FastWriter text.
std::string EncodePacketBytes(const Json::Value& value);

// The 21-byte packet of {"success":true}, which is what both servers answer.
const std::string& SuccessReplyPacket();

// ---------------------------------------------------------------------------
// Blocking client on plain system calls, used against both servers.

// Frames and writes `value` with jsoncpp alone (FastWriter, 4-byte header,
// one write), then reads the reply and parses it with Json::Reader into
// `reply`: the least a client can do with the same JSON work as
// SendPacket + RecvPacket. `buf` as for RawRoundTrip. Returns false on
// failure.
bool JsonRoundTrip(int fd, const Json::Value& value, char* buf,
                   Json::Value* reply);

// Writes all of `n` bytes; false on error or end of stream.
bool WriteAll(int fd, const void* buf, size_t n);
// Reads exactly `n` bytes; false on error or end of stream.
bool ReadAll(int fd, void* buf, size_t n);
// Writes `packet`, then reads the 4-byte reply header and the body it
// announces into `buf` (which holds at least 4 + 65535 bytes). Returns the
// reply's total size, or -1.
long RawRoundTrip(int fd, const std::string& packet, char* buf);
// A connected Unix-domain stream socket, or -1.
int RawConnect(const std::string& path);

// A unique socket path under /tmp for this process.
std::string SocketPath(const char* tag);

// ---------------------------------------------------------------------------
// Servers

enum class ServerKind { kLibrary, kRaw, kRawJson };
const char* ServerKindName(ServerKind kind);

// One server running an event loop of its own in a thread of its own.
// kLibrary uses BuildServer/StopServer (and so g_listener: only one library
// server may run per process); kRaw is a minimal bufferevent server that
// frames like the library and answers every complete packet with
// SuccessReplyPacket() without any JSON work; kRawJson is the same server
// doing the JSON work the library does and nothing more (parse the body
// with Json::Reader, write the reply with Json::FastWriter). All count the
// requests they answered.
class ServerThread {
 public:
  ServerThread() = default;
  ~ServerThread();
  ServerThread(const ServerThread&) = delete;
  ServerThread& operator=(const ServerThread&) = delete;

  // Starts the server at `path` and returns once it listens. False on
  // failure (nothing left running).
  bool Start(ServerKind kind, const std::string& path);
  // Takes the listener down, waits until the clients have closed their
  // connections (at most two seconds), ends the loop and joins the thread.
  // The socket file is removed.
  void Stop();

  bool running() const { return thread_.joinable(); }
  const std::string& path() const { return path_; }
  // CPU time the server thread has used so far, in nanoseconds.
  double CpuNanoseconds() const;
  // Requests answered so far.
  uint64_t served() const;

 private:
  void Run(ServerKind kind);

  std::string path_;
  std::thread thread_;
  clockid_t cpu_clock_ = CLOCK_THREAD_CPUTIME_ID;
  int wake_pipe_[2] = {-1, -1};
  std::atomic<int> state_{0};  // 0 starting, 1 listening, -1 failed
  std::atomic<uint64_t> served_count_{0};
};

// Runs a server of `kind` in the calling thread until `requests` requests
// have been answered and every connection has closed, or until `limit_s`
// seconds have passed. Returns the number of requests answered, or -1 when
// the server could not start. Used for system-call counting, where the
// server has a process of its own.
long ServeInThisThread(ServerKind kind, const std::string& path,
                       uint64_t requests, int limit_s);

}  // namespace quvaidx_bench

#endif  // QUVAIDX_BENCH_BENCH_SUPPORT_H_
