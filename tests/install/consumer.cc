// A program built against an installed libquvaidx: a reply built by the event
// server's helper, the log level, a refused connection, and the version of
// the library that was loaded, which it prints.
#include <stdio.h>

#include <quvaidx/quvaidx.h>

int main() {
  Json::Value reply = MakeResponse(true, "installed");
  ChageLogLevel(2);
  int fd = ConnectPeer("/nonexistent/quvaidx-consumer.sock", false, 0);
  printf("%s\n", QuvaidxVersion());
  return fd == -1 && reply["success"].asBool() && g_log_level == 2 ? 0 : 1;
}
