#include "bench_support.h"

#include <errno.h>
#include <fcntl.h>
#include <math.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <iostream>

#include <event2/buffer.h>
#include <event2/bufferevent.h>
#include <event2/event.h>
#include <event2/listener.h>

#include "quvaidx/daemon.h"

namespace quvaidx_bench {

// ---------------------------------------------------------------------------
// Payloads

const Json::Value& HandshakeRequest() {
  static const Json::Value value = [] {
    Json::Value v(Json::objectValue);
    v["command"] = "HANDSHAKE";
    return v;
  }();
  return value;
}

const Json::Value& MediaInfoRequest() {
  static const Json::Value value = [] {
    Json::Value m(Json::objectValue);
    m["path"] = "/share/Multimedia/Holiday 2024/Day 03/IMG_20240817_153012.mp4";
    m["file_name"] = "IMG_20240817_153012.mp4";
    m["title"] = "Sunset over the harbour, seen from the old lighthouse";
    m["artist"] = "Family camera";
    m["album"] = "Holiday 2024";
    m["album_artist"] = "Various";
    m["genre"] = "Home video";
    m["composer"] = "";
    m["comment"] = "Recorded with stabilisation on; second clip of the evening";
    m["date"] = "2024-08-17T15:30:12+02:00";
    m["year"] = 2024;
    m["track"] = 3;
    m["disc"] = 1;
    m["duration"] = 184.533;
    m["bitrate"] = 17834211;
    m["sample_rate"] = 48000;
    m["channels"] = 2;
    m["bits_per_sample"] = 16;
    m["audio_codec"] = "aac";
    m["audio_profile"] = "LC";
    m["video_codec"] = "h264";
    m["video_profile"] = "High";
    m["video_level"] = 42;
    m["width"] = 1920;
    m["height"] = 1080;
    m["frame_rate"] = 29.97;
    m["aspect_ratio"] = "16:9";
    m["container"] = "mov,mp4,m4a,3gp,3g2,mj2";
    m["file_size"] = 411345920;
    m["mtime"] = 1723901412;
    m["ctime"] = 1723901460;
    m["orientation"] = 1;
    m["rotation"] = 90;
    m["gps_latitude"] = 43.296482;
    m["gps_longitude"] = 5.36978;
    m["camera_make"] = "Phone Maker";
    m["camera_model"] = "Model X 12 Pro";
    m["color_space"] = "bt709";
    m["mime_type"] = "video/mp4";
    m["subtitle_count"] = 0;
    m["language"] = "und";
    m["description"] =
        "Evening walk along the quay; boats coming back, gulls, the light "
        "turning orange behind the fort. Audio has some wind noise.";
    m["keywords"] = "holiday,harbour,sunset,boats,lighthouse,evening";
    m["encoder"] = "Lavf60.16.100";
    m["creation_tool"] = "Camera app 5.2.1";
    m["thumbnail"] =
        "/share/Multimedia/Holiday 2024/Day 03/.@__thumb/"
        "s800IMG_20240817_153012.mp4";
    Json::Value v(Json::objectValue);
    v["command"] = "SET_MEDIA_INFO";
    v["media"] = m;
    return v;
  }();
  return value;
}

std::string EncodePacketBytes(const Json::Value& value) {
  Json::FastWriter writer;
  std::string text = writer.write(value);
  std::string packet;
  packet.push_back(static_cast<char>(0x15));
  packet.push_back(static_cast<char>(0xBE));
  packet.push_back(static_cast<char>((text.size() >> 8) & 0xff));
  packet.push_back(static_cast<char>(text.size() & 0xff));
  packet += text;
  return packet;
}

const std::string& SuccessReplyPacket() {
  static const std::string packet = [] {
    Json::Value v(Json::objectValue);
    v["success"] = true;
    return EncodePacketBytes(v);
  }();
  return packet;
}

// ---------------------------------------------------------------------------
// Client

bool WriteAll(int fd, const void* buf, size_t n) {
  const char* p = static_cast<const char*>(buf);
  while (n > 0) {
    ssize_t w = write(fd, p, n);
    if (w > 0) {
      p += w;
      n -= static_cast<size_t>(w);
    } else if (w < 0 && errno == EINTR) {
      continue;
    } else {
      return false;
    }
  }
  return true;
}

bool ReadAll(int fd, void* buf, size_t n) {
  char* p = static_cast<char*>(buf);
  while (n > 0) {
    ssize_t r = read(fd, p, n);
    if (r > 0) {
      p += r;
      n -= static_cast<size_t>(r);
    } else if (r < 0 && errno == EINTR) {
      continue;
    } else {
      return false;
    }
  }
  return true;
}

long RawRoundTrip(int fd, const std::string& packet, char* buf) {
  if (!WriteAll(fd, packet.data(), packet.size())) return -1;
  if (!ReadAll(fd, buf, 4)) return -1;
  size_t length =
      (static_cast<size_t>(static_cast<unsigned char>(buf[2])) << 8) |
      static_cast<unsigned char>(buf[3]);
  if (!ReadAll(fd, buf + 4, length)) return -1;
  return static_cast<long>(4 + length);
}

bool JsonRoundTrip(int fd, const Json::Value& value, char* buf,
                   Json::Value* reply) {
  thread_local Json::FastWriter writer;
  thread_local Json::Reader reader;
  std::string text = writer.write(value);
  if (text.size() > 65535) return false;
  char header[4] = {static_cast<char>(0x15), static_cast<char>(0xBE),
                    static_cast<char>((text.size() >> 8) & 0xff),
                    static_cast<char>(text.size() & 0xff)};
  text.insert(0, header, sizeof(header));
  if (!WriteAll(fd, text.data(), text.size())) return false;
  if (!ReadAll(fd, buf, 4)) return false;
  size_t length =
      (static_cast<size_t>(static_cast<unsigned char>(buf[2])) << 8) |
      static_cast<unsigned char>(buf[3]);
  if (!ReadAll(fd, buf + 4, length)) return false;
  reader.parse(buf + 4, buf + 4 + length, *reply, true);
  return true;
}

int RawConnect(const std::string& path) {
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof(address.sun_path)) return -1;
  memcpy(address.sun_path, path.data(), path.size());
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (connect(fd, reinterpret_cast<struct sockaddr*>(&address),
              sizeof(address)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

std::string SocketPath(const char* tag) {
  return "/tmp/quvaidx-bench-" + std::to_string(getpid()) + "-" + tag + ".sock";
}

const char* ServerKindName(ServerKind kind) {
  switch (kind) {
    case ServerKind::kLibrary:
      return "library";
    case ServerKind::kRaw:
      return "raw";
    case ServerKind::kRawJson:
      return "raw+json";
  }
  return "?";
}

// ---------------------------------------------------------------------------
// Servers

namespace {

// Everything one server loop needs; lives on the stack of the loop's thread.
struct Loop {
  ServerKind kind = ServerKind::kRaw;
  std::string path;
  struct event_base* base = nullptr;
  struct evconnlistener* raw_listener = nullptr;
  EventArgs args = {"bench", nullptr, nullptr};
  int raw_connections = 0;
  // Written only by the loop's thread; read by others.
  std::atomic<uint64_t>* served = nullptr;
  bool stopping = false;
  bool gave_up = false;
  struct event* wake = nullptr;
  struct event* deadline = nullptr;

  int Connections() const {
    return kind == ServerKind::kLibrary ? GetCurrentConnCount()
                                        : raw_connections;
  }
  void CountServed() {
    served->store(served->load(std::memory_order_relaxed) + 1,
                  std::memory_order_relaxed);
  }
};

// The daemon handler of the library server: a HANDSHAKE or SET_MEDIA_INFO
// request is answered with MakeResponse(true, nullptr).
int AnswerHandler(Json::Value& request, Json::Value& reply, EventArgs* args) {
  static_cast<Loop*>(args->context)->CountServed();
  const Json::Value* command =
      request.isObject() ? request.find("command", "command" + 7) : nullptr;
  if (command != nullptr && command->isString()) {
    const char* begin = nullptr;
    const char* end = nullptr;
    command->getString(&begin, &end);
    std::string name(begin, end);
    if (name == "HANDSHAKE" || name == "SET_MEDIA_INFO") {
      reply = MakeResponse(true, nullptr);
      return 0;
    }
  }
  reply = MakeResponse(false, "unknown command");
  return 0;
}

void RawRead(struct bufferevent* bev, void* arg) {
  Loop* loop = static_cast<Loop*>(arg);
  struct evbuffer* input = bufferevent_get_input(bev);
  const std::string& reply = SuccessReplyPacket();
  for (;;) {
    size_t available = evbuffer_get_length(input);
    if (available < 4) return;
    unsigned char header[4];
    evbuffer_copyout(input, header, sizeof(header));
    size_t total = 4 + ((static_cast<size_t>(header[2]) << 8) | header[3]);
    if (available < total) return;
    if (loop->kind == ServerKind::kRawJson) {
      thread_local Json::FastWriter writer;
      thread_local Json::Reader reader;
      const char* packet = reinterpret_cast<const char*>(
          evbuffer_pullup(input, static_cast<ev_ssize_t>(total)));
      Json::Value request;
      reader.parse(packet + 4, packet + total, request, true);
      Json::Value answer(Json::objectValue);
      answer["success"] = true;
      std::string text = writer.write(answer);
      unsigned char out_header[4] = {
          0x15, 0xBE, static_cast<unsigned char>((text.size() >> 8) & 0xff),
          static_cast<unsigned char>(text.size() & 0xff)};
      evbuffer_drain(input, total);
      bufferevent_write(bev, out_header, sizeof(out_header));
      bufferevent_write(bev, text.data(), text.size());
    } else {
      evbuffer_drain(input, total);
      bufferevent_write(bev, reply.data(), reply.size());
    }
    loop->CountServed();
  }
}

void RawEvent(struct bufferevent* bev, short, void* arg) {
  --static_cast<Loop*>(arg)->raw_connections;
  bufferevent_free(bev);
}

void RawAccept(struct evconnlistener* listener, evutil_socket_t fd,
               struct sockaddr*, int, void* arg) {
  Loop* loop = static_cast<Loop*>(arg);
  struct bufferevent* bev = bufferevent_socket_new(
      evconnlistener_get_base(listener), fd, BEV_OPT_CLOSE_ON_FREE);
  if (bev == nullptr) {
    close(fd);
    return;
  }
  ++loop->raw_connections;
  bufferevent_setcb(bev, RawRead, nullptr, RawEvent, loop);
  bufferevent_enable(bev, EV_READ);
}

bool OpenServer(Loop* loop) {
  if (loop->kind == ServerKind::kLibrary) {
    loop->args.context = loop;
    loop->args.handler = AnswerHandler;
    return BuildServer(loop->base, loop->path.c_str(), &loop->args) == 0;
  }
  unlink(loop->path.c_str());
  struct sockaddr_un address;
  memset(&address, 0, sizeof(address));
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, loop->path.data(), loop->path.size());
  loop->raw_listener = evconnlistener_new_bind(
      loop->base, RawAccept, loop,
      LEV_OPT_CLOSE_ON_FREE | LEV_OPT_REUSEABLE | LEV_OPT_CLOSE_ON_EXEC, 16,
      reinterpret_cast<struct sockaddr*>(&address), sizeof(address));
  return loop->raw_listener != nullptr;
}

void CloseServer(Loop* loop) {
  if (loop->kind == ServerKind::kLibrary) {
    StopServer(loop->path.c_str());
  } else if (loop->raw_listener != nullptr) {
    evconnlistener_free(loop->raw_listener);
    loop->raw_listener = nullptr;
    unlink(loop->path.c_str());
  }
}

void OnDeadline(evutil_socket_t, short, void* arg) {
  static_cast<Loop*>(arg)->gave_up = true;
}

void OnWake(evutil_socket_t fd, short, void* arg) {
  Loop* loop = static_cast<Loop*>(arg);
  char byte;
  if (read(fd, &byte, 1) != 1) return;
  if (loop->stopping) return;
  loop->stopping = true;
  CloseServer(loop);
  struct timeval two_seconds = {2, 0};
  evtimer_add(loop->deadline, &two_seconds);
}

}  // namespace

ServerThread::~ServerThread() { Stop(); }

bool ServerThread::Start(ServerKind kind, const std::string& path) {
  if (running()) return false;
  path_ = path;
  state_ = 0;
  served_count_ = 0;
  if (pipe2(wake_pipe_, O_CLOEXEC) != 0) return false;
  thread_ = std::thread(&ServerThread::Run, this, kind);
  auto until = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (state_.load() == 0 && std::chrono::steady_clock::now() < until) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  if (state_.load() == 1) return true;
  Stop();
  return false;
}

void ServerThread::Stop() {
  if (!running()) return;
  char byte = 1;
  if (write(wake_pipe_[1], &byte, 1) != 1) perror("wake server");
  thread_.join();
  close(wake_pipe_[0]);
  close(wake_pipe_[1]);
  wake_pipe_[0] = wake_pipe_[1] = -1;
}

double ServerThread::CpuNanoseconds() const {
  struct timespec ts;
  if (clock_gettime(cpu_clock_, &ts) != 0) return NAN;
  return static_cast<double>(ts.tv_sec) * 1e9 + static_cast<double>(ts.tv_nsec);
}

uint64_t ServerThread::served() const {
  return served_count_.load(std::memory_order_relaxed);
}

void ServerThread::Run(ServerKind kind) {
  pthread_getcpuclockid(pthread_self(), &cpu_clock_);
  Loop loop;
  loop.kind = kind;
  loop.path = path_;
  loop.served = &served_count_;
  loop.base = event_base_new();
  if (loop.base == nullptr) {
    state_ = -1;
    return;
  }
  loop.wake =
      event_new(loop.base, wake_pipe_[0], EV_READ | EV_PERSIST, OnWake, &loop);
  loop.deadline = evtimer_new(loop.base, OnDeadline, &loop);
  if (loop.wake == nullptr || loop.deadline == nullptr ||
      event_add(loop.wake, nullptr) != 0 || !OpenServer(&loop)) {
    if (loop.wake != nullptr) event_free(loop.wake);
    if (loop.deadline != nullptr) event_free(loop.deadline);
    event_base_free(loop.base);
    state_ = -1;
    return;
  }
  state_ = 1;
  while (!(loop.stopping && (loop.Connections() == 0 || loop.gave_up))) {
    event_base_loop(loop.base, EVLOOP_ONCE);
  }
  if (loop.Connections() != 0) {
    fprintf(stderr, "%s server: %d connections still open at stop\n",
            ServerKindName(kind), loop.Connections());
  }
  event_free(loop.wake);
  event_free(loop.deadline);
  event_base_free(loop.base);
}

long ServeInThisThread(ServerKind kind, const std::string& path,
                       uint64_t requests, int limit_s) {
  std::atomic<uint64_t> served{0};
  Loop loop;
  loop.kind = kind;
  loop.path = path;
  loop.served = &served;
  loop.base = event_base_new();
  if (loop.base == nullptr) return -1;
  loop.deadline = evtimer_new(loop.base, OnDeadline, &loop);
  struct timeval limit = {limit_s, 0};
  if (loop.deadline == nullptr || evtimer_add(loop.deadline, &limit) != 0 ||
      !OpenServer(&loop)) {
    if (loop.deadline != nullptr) event_free(loop.deadline);
    event_base_free(loop.base);
    return -1;
  }
  while (!loop.gave_up &&
         !(served.load() >= requests && loop.Connections() == 0)) {
    event_base_loop(loop.base, EVLOOP_ONCE);
  }
  CloseServer(&loop);
  event_free(loop.deadline);
  event_base_free(loop.base);
  return static_cast<long>(served.load());
}

}  // namespace quvaidx_bench
