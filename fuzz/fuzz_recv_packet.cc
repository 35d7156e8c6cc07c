// Feeds RecvPacket arbitrary byte streams through a socket pair.
//
// Input layout:
//   byte 0: chunk sizes: 0 writes the whole stream (up to 64 KiB) before the
//           first read; otherwise the low four bits give the largest chunk
//           (1 << bits) and the high four bits seed the generator choosing
//           each chunk's size;
//   the rest: the byte stream, normally packets.
//
// The reading end is non-blocking. Whenever a read would block, Readn waits
// through the sleep seam; the harness's sleeper writes the next chunk there
// (and half-closes the writing end after the last), so a packet arrives in
// pieces deterministically, on one thread.
//
// RecvPacket is called into a fresh value until it fails. Each result is
// checked against the stream: 0 for every complete packet whose header
// announces at most kMaxRecvBody bytes, then -1 for the first header that
// announces more, for a packet cut short by the end of the stream, or for the
// end of the stream itself. A mismatch aborts with a message.
#include <errno.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>

#include <json/json.h>

#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "util/hooks.h"

namespace {

constexpr size_t kMaxInput = 256 * 1024;
// Fits an empty socket buffer, so a chunk is always written whole.
constexpr size_t kMaxChunk = 64 * 1024;
// Waits allowed in one run; more means Readn spins on a stream that ended.
constexpr int kMaxWaits = 1 << 20;

[[noreturn]] void Fail(const char* what) {
  fprintf(stderr, "fuzz_recv_packet: %s\n", what);
  abort();
}

void DiscardLogLine(int, const char* line) {
  if (strlen(line) >= 16384) Fail("log line longer than its buffer");
}

// Writes the stream into the socket pair chunk by chunk, on demand.
class Feeder {
 public:
  Feeder(int fd, const uint8_t* bytes, size_t size, uint8_t shape)
      : fd_(fd),
        bytes_(bytes),
        size_(size),
        max_(shape == 0 ? kMaxChunk : size_t{1} << (shape & 0x0f)),
        state_(0x9e3779b9u ^ shape) {}

  // Writes the next chunk, or half-closes the socket after the last one.
  void FeedNext() {
    if (closed_) Fail("read waited after the end of the stream");
    if (offset_ == size_) {
      shutdown(fd_, SHUT_WR);
      closed_ = true;
      return;
    }
    size_t chunk = std::min(NextChunkSize(), size_ - offset_);
    while (chunk > 0) {
      ssize_t n = send(fd_, bytes_ + offset_, chunk, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) Fail("cannot write a chunk into an empty socket");
      offset_ += static_cast<size_t>(n);
      chunk -= static_cast<size_t>(n);
    }
  }

  int waits = 0;

 private:
  size_t NextChunkSize() {
    if (max_ == kMaxChunk) return kMaxChunk;
    state_ ^= state_ << 13;
    state_ ^= state_ >> 17;
    state_ ^= state_ << 5;
    return 1 + state_ % max_;
  }

  int fd_;
  const uint8_t* bytes_;
  size_t size_;
  size_t offset_ = 0;
  size_t max_;
  uint32_t state_;
  bool closed_ = false;
};

Feeder* g_feeder = nullptr;

// Replaces sleep(3) in Readn's retry after a would-block read.
unsigned FeedInsteadOfSleeping(unsigned) {
  if (g_feeder == nullptr) Fail("unexpected sleep");
  if (++g_feeder->waits > kMaxWaits) Fail("endless waiting for input");
  g_feeder->FeedNext();
  return 0;
}

// RecvPacket's expected result for the packet at `offset`, and its size.
int Expected(const uint8_t* stream, size_t size, size_t offset,
             size_t* packet_size) {
  if (size - offset < kPacketHeaderSize) return -1;
  size_t length = (size_t{stream[offset + 2]} << 8) | stream[offset + 3];
  if (length > kMaxRecvBody) return -1;
  if (size - offset - kPacketHeaderSize < length) return -1;
  *packet_size = kPacketHeaderSize + length;
  return 0;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  quvaidx::SetLogSink(DiscardLogLine);
  quvaidx::SetSleepFunction(FeedInsteadOfSleeping);
  // Format every line the library writes, to cover its log calls too.
  ChageLogLevel(7);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1 || size > kMaxInput) return 0;
  const uint8_t* stream = data + 1;
  const size_t stream_size = size - 1;

  int fds[2];
  // Both ends non-blocking: reads that would block go through the sleep
  // seam, and a chunk never exceeds the room of the empty socket.
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, fds) !=
      0) {
    Fail("socketpair");
  }
  const int reader = fds[0];
  const int writer = fds[1];
  Feeder feeder(writer, stream, stream_size, data[0]);
  g_feeder = &feeder;
  feeder.FeedNext();

  size_t offset = 0;
  for (;;) {
    size_t packet_size = 0;
    const int expected = Expected(stream, stream_size, offset, &packet_size);
    Json::Value value;
    const int result = RecvPacket(reader, value);
    if (result != expected) {
      fprintf(stderr, "packet at offset %zu: RecvPacket %d, expected %d\n",
              offset, result, expected);
      Fail("wrong RecvPacket result");
    }
    if (result != 0) break;
    offset += packet_size;
  }

  g_feeder = nullptr;
  close(reader);
  close(writer);
  return 0;
}
