// A program built against an installed libquvaidx: a server and a client in
// one process, talking over a socketpair and the event server's helpers.
#include <stdio.h>

#include <quvaidx/quvaidx.h>

int main() {
  Json::Value reply = MakeResponse(true, "installed");
  ChageLogLevel(2);
  int fd = ConnectPeer("/nonexistent/quvaidx-consumer.sock", false, 0);
  printf("%s %d %d\n", reply["reason"].asCString(), fd, g_log_level);
  return fd == -1 && reply["success"].asBool() ? 0 : 1;
}
