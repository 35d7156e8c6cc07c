#include "ipc/packet_codec.h"

#include <string.h>
#include <sys/socket.h>

#include <string>

#include "quvaidx/ipc.h"
#include "quvaidx/log.h"

namespace quvaidx {

EncodeStatus EncodePacket(const Json::Value& value, char* packet,
                          size_t* size) {
  // A writer and reader per thread keep their buffers between packets.
  thread_local Json::FastWriter writer;
  std::string text;
  try {
    text = writer.write(value);
  } catch (...) {
    return EncodeStatus::kFailed;
  }
  if (text.size() > kMaxSendBody) {
    *size = text.size();
    return EncodeStatus::kTooLarge;
  }
  packet[0] = static_cast<char>((kPacketMagic >> 8) & 0xff);
  packet[1] = static_cast<char>(kPacketMagic & 0xff);
  packet[2] = static_cast<char>((text.size() >> 8) & 0xff);
  packet[3] = static_cast<char>(text.size() & 0xff);
  memcpy(packet + kPacketHeaderSize, text.data(), text.size());
  *size = kPacketHeaderSize + text.size();
  return EncodeStatus::kOk;
}

EncodeStatus EncodePacketOrLog(const Json::Value& value, char* packet,
                               size_t* size, const char* module) {
  EncodeStatus status = EncodePacket(value, packet, size);
  if (status == EncodeStatus::kTooLarge) {
    AppLogError(3, "%s:%d [Error] packet too large: %zu bytes, limit %zu",
                module, __LINE__, *size, kMaxSendBody);
  } else if (status == EncodeStatus::kFailed) {
    AppLogError(3, "%s:%d [Error] cannot serialise packet", module, __LINE__);
  }
  return status;
}

PacketPeek PeekPacket(const unsigned char* head, size_t available) {
  if (available < kPacketHeaderSize) {
    return {PeekStatus::kNeedMore, 0, kPacketHeaderSize};
  }
  size_t length = (static_cast<size_t>(head[2]) << 8) | head[3];
  size_t total = kPacketHeaderSize + length;
  if (length > kMaxRecvBody) return {PeekStatus::kTooLarge, length, total};
  if (available < total) return {PeekStatus::kNeedMore, length, total};
  return {PeekStatus::kComplete, length, total};
}

bool ParsePacketBody(const char* body, size_t length, Json::Value& value) {
  thread_local Json::Reader reader;
  const void* zero = memchr(body, '\0', length);
  const char* end =
      zero != nullptr ? static_cast<const char*>(zero) : body + length;
  try {
    return reader.parse(body, end, value, true);
  } catch (...) {
    // Nesting beyond the reader's limit throws; such a body counts as
    // malformed, like any other.
    return false;
  }
}

bool BuildUnixAddress(const char* path, struct sockaddr_un* address) {
  memset(address, 0, sizeof(*address));
  address->sun_family = AF_UNIX;
  if (path == nullptr) return false;
  size_t length = strlen(path);
  if (length > kMaxSocketPath) return false;
  memcpy(address->sun_path, path, length);
  return true;
}

void EmptyValue(Json::Value& value) {
  if (value.isArray() || value.isObject()) {
    value.clear();
  } else {
    value = Json::Value();
  }
}

}  // namespace quvaidx
