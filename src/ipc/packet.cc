// Blocking framing primitives on a connected stream socket.
#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "ipc/packet_codec.h"
#include "quvaidx/ipc.h"
#include "quvaidx/log.h"
#include "util/hooks.h"

namespace {

constexpr char kModule[] = "quvaidx_ipc_core";

// Maps a Readn/Writen result that is not the full count to the packet
// result: -2 passes through, anything else is a plain failure.
int PacketFailure(int transfer_result) {
  return transfer_result == -2 ? -2 : -1;
}

}  // namespace

int Writen(int fd, const void* buf, size_t n) {
  if (n == 0) return 0;
  const char* p = static_cast<const char*>(buf);
  size_t remaining = n;
  while (remaining > 0) {
    ssize_t sent = send(fd, p, remaining, MSG_NOSIGNAL);
    if (sent > 0) {
      p += sent;
      remaining -= static_cast<size_t>(sent);
    } else if (sent == 0) {
      break;
    } else if (errno == EINTR || errno == EAGAIN) {
      quvaidx::SleepSeconds(0);  // Retry
    } else if (errno == EPIPE) {
      return -2;
    } else {
      int err = errno;
      AppLogError(3, "%s:%d [Error] %d, %s", kModule, __LINE__, err,
                  strerror(err));
      return -1;
    }
  }
  return static_cast<int>(n - remaining);
}

int Readn(int fd, void* buf, size_t n) {
  if (n == 0) return 0;
  char* p = static_cast<char*>(buf);
  size_t remaining = n;
  while (remaining > 0) {
    ssize_t got = read(fd, p, remaining);
    if (got > 0) {
      p += got;
      remaining -= static_cast<size_t>(got);
    } else if (got == 0) {
      break;  // end of stream
    } else if (errno == EINTR || errno == EAGAIN) {
      quvaidx::SleepSeconds(0);  // Retry
    } else if (errno == ECONNRESET) {
      return -2;
    } else {
      int err = errno;
      AppLogError(3, "%s:%d [Error] %d, %s", kModule, __LINE__, err,
                  strerror(err));
      return -1;
    }
  }
  return static_cast<int>(n - remaining);
}

int SendPacket(int fd, Json::Value& value) {
  char packet[kPacketBufferSize];
  size_t size = 0;
  if (quvaidx::EncodePacketOrLog(value, packet, &size, kModule) !=
      quvaidx::EncodeStatus::kOk) {
    return -1;
  }
  int written = Writen(fd, packet, size);
  if (written == static_cast<int>(size)) return 0;
  return PacketFailure(written);
}

int RecvPacket(int fd, Json::Value& value) {
  unsigned char header[kPacketHeaderSize];
  int got = Readn(fd, header, sizeof(header));
  if (got != static_cast<int>(sizeof(header))) return PacketFailure(got);
  quvaidx::PacketPeek peek = quvaidx::PeekPacket(header, sizeof(header));
  if (peek.status == quvaidx::PeekStatus::kTooLarge) {
    AppLogError(3, "%s:%d [Error] packet too large: %zu bytes, limit %zu",
                kModule, __LINE__, peek.body_length, kMaxRecvBody);
    return -1;
  }
  char body[kPacketBufferSize];
  got = Readn(fd, body, peek.body_length);
  if (got != static_cast<int>(peek.body_length)) return PacketFailure(got);
  // A reply the reader rejects is still received: the caller judges it by
  // its keys (a missing "success" reads as false).
  quvaidx::ParsePacketBody(body, peek.body_length, value);
  return 0;
}
