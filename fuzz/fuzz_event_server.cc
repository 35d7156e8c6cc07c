// Feeds the event server arbitrary byte streams on one client connection.
//
// Input layout:
//   byte 0: flags
//     bit 0: lazy client, which reads replies only when its writes block and
//            at the end (lets replies pile up: backpressure);
//     bit 1: half-close the connection right after the last chunk;
//     bits 2-3: loop iterations run between two chunks (0 to 3);
//     bit 4: stall: the deadlines are cut to a few milliseconds and the
//            client goes quiet, once the server has settled (a lazy client
//            at once, leaving its replies unread), so the server must close
//            the connection;
//   byte 1: chunk sizes: 0 writes the stream in one piece, otherwise the low
//           four bits give the largest chunk (1 << bits) and the high four
//           bits seed the generator choosing each chunk's size;
//   byte 2: further seed for the chunk sizes;
//   the rest: the byte stream sent to the server, normally packets.
//
// The handler's behaviour is chosen by the request's "op" member: "fail"
// returns non-zero, "throw" throws a std::exception, "throw-other" throws an
// int, "pad" answers with a padding string of "n" bytes (large values make
// the reply too large for a packet), anything else echoes the request.
//
// Every run checks that each reply is a well-formed packet, that replies come
// in request order, that a connection the server keeps open had every
// complete request answered, that a connection the server closed (handler
// refusal, oversized header, or the client's half-close) delivered every
// reply queued before the close, that a stalled connection is closed within
// a bounded time, and that no descriptor and no connection outlives the
// run. A violation aborts with a message.
#include <dirent.h>
#include <errno.h>
#include <signal.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <linux/sockios.h>

#include <algorithm>
#include <memory>
#include <stdexcept>
#include <string>

#include <event2/event.h>
#include <json/json.h>

#include "quvaidx/daemon.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "util/hooks.h"

namespace {

constexpr size_t kControlBytes = 3;
// Larger inputs only slow the fuzzer down without reaching new states.
constexpr size_t kMaxInput = 256 * 1024;
// Loop iterations without any observable progress after which the server is
// taken to be done with what it was sent.
constexpr int kIdleRounds = 3;
// Bounds on loop iterations; reaching one means the server no longer makes
// progress although it has work, which is a fault.
constexpr int kMaxStalls = 20000;
constexpr int kMaxCloseRounds = 1000;
// Largest padding a "pad" request may ask for: a little above what fits.
constexpr unsigned kMaxPad = kMaxSendBody + 64;

char g_path[sizeof(sockaddr_un::sun_path)];
// Deadlines in stall mode, and how long the server may take to act on them.
constexpr ServerLimits kStallLimits = {2, 4, kMaxTotalPendingOutput};
constexpr int kMaxStallMs = 2000;
// Requests handed to the handler during the current run, and how many of
// those the handler refused (returned non-zero or threw).
uint32_t g_handler_calls = 0;
uint32_t g_handler_refusals = 0;

[[noreturn]] void Fail(const char* what) {
  fprintf(stderr, "fuzz_event_server: %s\n", what);
  abort();
}

void DiscardLogLine(int, const char* line) {
  if (strlen(line) >= 16384) Fail("log line longer than its buffer");
}

int OpenDescriptorCount() {
  DIR* dir = opendir("/proc/self/fd");
  if (dir == nullptr) Fail("cannot list /proc/self/fd");
  int count = 0;
  while (struct dirent* entry = readdir(dir)) {
    if (entry->d_name[0] != '.') ++count;
  }
  closedir(dir);
  return count - 1;  // the directory stream's own descriptor
}

std::string RequestOp(const Json::Value& request) {
  if (!request.isObject()) return "";
  const Json::Value& op = request["op"];
  return op.isString() ? op.asString() : "";
}

int Handler(Json::Value& received, Json::Value& reply, EventArgs*) {
  const Json::Value& request = received;
  const uint32_t seq = g_handler_calls++;
  const std::string op = RequestOp(request);
  if (op == "fail" || op == "throw" || op == "throw-other") {
    ++g_handler_refusals;
    if (op == "throw") throw std::runtime_error("requested by the client");
    if (op == "throw-other") throw 42;
    return 1;
  }
  reply = MakeResponse(true, nullptr);
  reply["seq"] = seq;
  if (op == "pad") {
    const Json::Value& n = request["n"];
    unsigned pad = n.isUInt() ? std::min(n.asUInt(), kMaxPad) : 0;
    reply["pad"] = std::string(pad, 'x');
  } else {
    reply["echo"] = request;
  }
  return 0;
}

// Chooses chunk sizes from the control bytes: a small xorshift generator, so
// that the same input always splits the same way.
class Chunker {
 public:
  Chunker(uint8_t shape, uint8_t seed)
      : max_(shape == 0 ? 0 : size_t{1} << (shape & 0x0f)),
        state_(0x9e3779b9u ^ (uint32_t{shape} << 8) ^ seed) {}

  size_t Next(size_t remaining) {
    if (max_ == 0) return remaining;
    state_ ^= state_ << 13;
    state_ ^= state_ >> 17;
    state_ ^= state_ << 5;
    return std::min(remaining, 1 + state_ % max_);
  }

 private:
  size_t max_;
  uint32_t state_;
};

// Number of requests the server must hand to the handler when it keeps the
// connection open: the complete packets before the first header announcing
// more than kMaxRecvBody bytes.
uint32_t CompletePackets(const uint8_t* stream, size_t size) {
  uint32_t count = 0;
  size_t offset = 0;
  while (size - offset >= kPacketHeaderSize) {
    size_t length = (size_t{stream[offset + 2]} << 8) | stream[offset + 3];
    if (length > kMaxRecvBody) break;
    if (size - offset - kPacketHeaderSize < length) break;
    offset += kPacketHeaderSize + length;
    ++count;
  }
  return count;
}

// Collects the reply stream and checks every complete packet in it.
class ReplyChecker {
 public:
  ReplyChecker() {
    Json::CharReaderBuilder builder;
    // Replies nest one level deeper than the requests they echo.
    builder["stackLimit"] = 4000;
    builder["allowSpecialFloats"] = true;
    reader_.reset(builder.newCharReader());
  }

  void Feed(const char* bytes, size_t n) {
    pending_.append(bytes, n);
    size_t offset = 0;
    while (pending_.size() - offset >= kPacketHeaderSize) {
      const unsigned char* header =
          reinterpret_cast<const unsigned char*>(pending_.data() + offset);
      unsigned magic = (unsigned{header[0]} << 8) | header[1];
      size_t length = (size_t{header[2]} << 8) | header[3];
      if (magic != kPacketMagic) Fail("reply with a wrong magic number");
      if (length > kMaxSendBody) Fail("reply longer than kMaxSendBody");
      if (pending_.size() - offset - kPacketHeaderSize < length) break;
      CheckBody(pending_.data() + offset + kPacketHeaderSize, length);
      offset += kPacketHeaderSize + length;
    }
    pending_.erase(0, offset);
  }

  uint32_t replies() const { return replies_; }

 private:
  void CheckBody(const char* body, size_t length) {
    if (length == 0 || body[length - 1] != '\n') {
      Fail("reply body does not end in a line feed");
    }
    if (memchr(body, '\0', length) != nullptr) Fail("zero byte in a reply");
    Json::Value reply;
    std::string errors;
    if (!reader_->parse(body, body + length, &reply, &errors)) {
      fprintf(stderr, "%s\n", errors.c_str());
      Fail("reply is not valid JSON");
    }
    if (!reply.isObject() || !reply["success"].isBool()) {
      Fail("reply without a boolean \"success\"");
    }
    if (reply["success"].asBool()) {
      const Json::Value& seq = reply["seq"];
      if (!seq.isUInt() || seq.asUInt() != replies_) {
        Fail("reply out of request order");
      }
    } else if (reply["reason"] != "reply too large") {
      Fail("unexpected failure reply");
    }
    if (replies_ >= g_handler_calls) Fail("more replies than requests");
    ++replies_;
  }

  std::unique_ptr<Json::CharReader> reader_;
  std::string pending_;
  uint32_t replies_ = 0;
};

// The client end of the connection and what it has seen.
struct Client {
  struct event_base* base = nullptr;
  int fd = -1;
  bool lazy = false;
  bool server_closed = false;  // end of stream or error on the socket
  ReplyChecker checker;
};

void Step(struct event_base* base) {
  if (event_base_loop(base, EVLOOP_NONBLOCK | EVLOOP_ONCE) < 0) {
    Fail("event_base_loop failed");
  }
}

// Reads every reply byte available now; returns how many there were.
size_t Drain(Client& client) {
  char buf[65536];
  size_t total = 0;
  for (;;) {
    ssize_t n = recv(client.fd, buf, sizeof(buf), MSG_DONTWAIT);
    if (n > 0) {
      client.checker.Feed(buf, static_cast<size_t>(n));
      total += static_cast<size_t>(n);
    } else if (n == 0) {
      client.server_closed = true;
      return total;
    } else if (errno == EINTR) {
      continue;
    } else if (errno == EAGAIN) {
      return total;
    } else {
      client.server_closed = true;  // reset
      return total;
    }
  }
}

// Whether the server has not read everything the client sent: kernel memory
// still held by the client's sent data, which drops to 0 only when the last
// byte was read.
int Unread(const Client& client) {
  int amount = 0;
  if (ioctl(client.fd, SIOCOUTQ, &amount) != 0) return 0;
  return amount;
}

// Sends `size` bytes; runs the server and takes its replies whenever the
// socket is full. Returns false when the server closed the connection.
bool Send(Client& client, const uint8_t* bytes, size_t size) {
  size_t done = 0;
  int stalls = 0;
  while (done < size) {
    ssize_t n =
        send(client.fd, bytes + done, size - done, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      done += static_cast<size_t>(n);
      stalls = 0;
    } else if (n < 0 && errno == EINTR) {
      continue;
    } else if (n < 0 && errno == EAGAIN) {
      // The server has not read what is there, perhaps because its replies
      // are waiting for this client to read them.
      Step(client.base);
      Drain(client);
      if (++stalls > kMaxStalls) Fail("server stopped reading a connection");
    } else {
      return false;  // EPIPE or ECONNRESET: the server closed
    }
  }
  return true;
}

// Runs the loop until the server has nothing more to do for this client: it
// has read every byte sent (the server reads at most a few KiB per
// iteration) and a few iterations went by without a reply byte or a handler
// call.
void Settle(Client& client) {
  int idle = 0;
  for (int rounds = 0; !client.server_closed; ++rounds) {
    if (rounds > kMaxStalls * 16) Fail("server never settles");
    const uint32_t calls = g_handler_calls;
    Step(client.base);
    const bool progress = Drain(client) > 0 || calls != g_handler_calls;
    idle = progress ? 0 : idle + 1;
    if (idle >= kIdleRounds && Unread(client) == 0) return;
  }
}

// Goes quiet with deadlines of a few milliseconds: whatever the connection
// was waiting for, the server must close it.
void Stall(Client& client) {
  SetServerLimits(&kStallLimits);
  struct timespec start;
  clock_gettime(CLOCK_MONOTONIC, &start);
  while (GetCurrentConnCount() != 0) {
    struct timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    long long ms = (now.tv_sec - start.tv_sec) * 1000LL +
                   (now.tv_nsec - start.tv_nsec) / 1000000;
    if (ms > kMaxStallMs) Fail("a stalled connection was never closed");
    Step(client.base);
    if (!client.lazy) Drain(client);
    usleep(100);
  }
  SetServerLimits(nullptr);
}

void RunSession(struct event_base* base, const uint8_t* data, size_t size) {
  const uint8_t flags = data[0];
  Chunker chunker(data[1], data[2]);
  const uint8_t* stream = data + kControlBytes;
  const size_t stream_size = size - kControlBytes;
  const int steps_between_chunks = (flags >> 2) & 3;
  const bool half_close = (flags & 2) != 0;
  const bool stall = (flags & 16) != 0;

  Client client;
  client.base = base;
  client.lazy = (flags & 1) != 0;
  client.fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (client.fd < 0) Fail("socket");
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, g_path, strlen(g_path));
  if (connect(client.fd, reinterpret_cast<struct sockaddr*>(&address),
              sizeof(address)) != 0) {
    Fail("connect");
  }
  for (int i = 0; GetCurrentConnCount() == 0; ++i) {
    if (i == kMaxCloseRounds) Fail("connection never accepted");
    Step(base);
  }

  bool open = true;
  size_t offset = 0;
  while (open && offset < stream_size) {
    size_t chunk = chunker.Next(stream_size - offset);
    open = Send(client, stream + offset, chunk);
    offset += chunk;
    for (int i = 0; i < steps_between_chunks; ++i) {
      Step(base);
      if (!client.lazy) Drain(client);
    }
  }
  if (half_close) shutdown(client.fd, SHUT_WR);
  if (stall && client.lazy) {
    // Replies left unread, perhaps with reading paused for them or a close
    // waiting on them: the server must give up on the connection.
    Stall(client);
  } else {
    Settle(client);
  }

  if (!stall && open && !half_close && !client.server_closed) {
    // The server kept the connection: it must have read everything and
    // answered every complete request, in order.
    const uint32_t expected = CompletePackets(stream, stream_size);
    if (g_handler_calls != expected) {
      fprintf(stderr, "handled %u of %u complete requests\n", g_handler_calls,
              expected);
      Fail("complete requests left unhandled");
    }
    if (client.checker.replies() != expected) {
      fprintf(stderr, "%u replies to %u requests\n", client.checker.replies(),
              expected);
      Fail("requests left unanswered");
    }
  }

  if (stall && !client.lazy) Stall(client);

  if (!stall && client.server_closed) {
    // Every handler call that returned 0 was promised a reply.
    const uint32_t answered = g_handler_calls - g_handler_refusals;
    if (client.checker.replies() != answered) {
      fprintf(stderr, "%u replies to %u answered requests\n",
              client.checker.replies(), answered);
      Fail("queued replies dropped when the server closed the connection");
    }
  }

  close(client.fd);
  for (int i = 0; GetCurrentConnCount() != 0; ++i) {
    if (i == kMaxCloseRounds) Fail("connection outlived its client");
    Step(base);
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  quvaidx::SetLogSink(DiscardLogLine);
  // Format every line the library writes, to cover its log calls too.
  ChageLogLevel(7);
  // As a daemon must: libevent's socket writes raise SIGPIPE otherwise.
  signal(SIGPIPE, SIG_IGN);
  const char* dir = getenv("TMPDIR");
  if (dir == nullptr || *dir == '\0') dir = "/tmp";
  int n = snprintf(g_path, sizeof(g_path), "%s/quvaidx-fuzz-%d.sock", dir,
                   static_cast<int>(getpid()));
  if (n < 0 || static_cast<size_t>(n) > kMaxSocketPath) {
    snprintf(g_path, sizeof(g_path), "/tmp/quvaidx-fuzz-%d.sock",
             static_cast<int>(getpid()));
  }
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < kControlBytes || size > kMaxInput) return 0;
  const int descriptors = OpenDescriptorCount();
  g_handler_calls = 0;
  g_handler_refusals = 0;

  struct event_base* base = event_base_new();
  if (base == nullptr) Fail("event_base_new");
  EventArgs args = {"fuzzd", nullptr, Handler};
  if (BuildServer(base, g_path, &args) != 0) Fail("BuildServer");

  RunSession(base, data, size);

  StopServer(g_path);
  if (g_listener != nullptr) Fail("listener left after StopServer");
  event_base_free(base);
  if (OpenDescriptorCount() != descriptors) Fail("descriptor leak");
  return 0;
}
