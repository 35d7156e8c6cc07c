// The one packet encoder and decoder, shared by the blocking client side and
// the event server. Not exported.
#ifndef QUVAIDX_IPC_PACKET_CODEC_H_
#define QUVAIDX_IPC_PACKET_CODEC_H_

#include <stddef.h>
#include <sys/un.h>

#include <json/json.h>

namespace quvaidx {

enum class EncodeStatus {
  kOk,        // packet written
  kTooLarge,  // the text is longer than kMaxSendBody; nothing written
  kFailed,    // the value could not be serialised (out of memory)
};

// Serialises `value` with Json::FastWriter and lays header and body out in
// `packet`, which must hold kPacketBufferSize bytes. On kOk, *size is the
// packet's length (header included); on kTooLarge, the text's length.
// Never throws.
EncodeStatus EncodePacket(const Json::Value& value, char* packet, size_t* size);

// As EncodePacket, and a failure is logged at level 3 as coming from
// `module` ("packet too large" with the text's length, or "cannot
// serialise packet").
EncodeStatus EncodePacketOrLog(const Json::Value& value, char* packet,
                               size_t* size, const char* module);

// What the head of a byte stream holds, as far as a receiver can tell.
enum class PeekStatus {
  kNeedMore,  // fewer than 4 bytes, or the announced body has not all come
  kTooLarge,  // the header announces more than kMaxRecvBody bytes
  kComplete,  // the header and the whole body are there
};

struct PacketPeek {
  PeekStatus status;
  size_t body_length;  // announced by the header; 0 before 4 bytes are there
  size_t total;        // header and body; kPacketHeaderSize before that
};

// The one reading of a packet header, shared by the client and the server.
// `head` holds the first min(available, kPacketHeaderSize) bytes of a stream
// of which `available` bytes have arrived. The magic is not examined. The
// body limit is checked here and nowhere else: kTooLarge as soon as the
// header is there, whatever else has arrived.
PacketPeek PeekPacket(const unsigned char* head, size_t available);

// Parses body[0, length) up to its first zero byte into `value` with
// Json::Reader, collecting comments. Returns true when the reader accepted
// it (trailing bytes after a complete value included); false when it
// rejected it, and `value` then holds what the parser left, which may be a
// half-read value. Never throws: input nested too deeply counts as rejected.
bool ParsePacketBody(const char* body, size_t length, Json::Value& value);

// Fills a zeroed Unix-domain address for `path`. Returns false, leaving
// the address zeroed, when path is null or longer than kMaxSocketPath bytes:
// such a path is refused rather than cut to a different one.
bool BuildUnixAddress(const char* path, struct sockaddr_un* address);

// Empties `value` after a failed exchange: an array or object loses its
// members and keeps its type, any other value becomes null. (Json::Value's
// own clear() throws on scalars.)
void EmptyValue(Json::Value& value);

}  // namespace quvaidx

#endif  // QUVAIDX_IPC_PACKET_CODEC_H_
