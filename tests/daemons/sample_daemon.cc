// A daemon on the common daemon life with a handler of its own, for the
// tests of that life: it answers HANDSHAKE, logs each request at level 6
// (so --loglevel and --stderr can be seen at work) and counts its starts
// and stops in the files named by --starts (optional).
#include <stdio.h>

#include <string>

#include <quvaidx/daemon.h>
#include <quvaidx/log.h>

#include "daemon_runner.h"

namespace {

std::string g_marks;

int Handle(Json::Value& request, Json::Value& reply, EventArgs*) {
  AppLogError(6, "%s:%d request %s", "sample", __LINE__,
              request["command"].asString().c_str());
  reply = MakeResponse(true, nullptr);
  return 0;
}

void Mark(const char* what) {
  if (g_marks.empty()) return;
  FILE* file = fopen(g_marks.c_str(), "a");
  if (file == nullptr) return;
  fprintf(file, "%s\n", what);
  fclose(file);
}

int Start(struct event_base*, void*) {
  Mark("start");
  return 0;
}

void Stop(void*) { Mark("stop"); }

}  // namespace

int main(int argc, char** argv) {
  quvaidx_daemons::DaemonSpec spec;
  spec.program = "sampled";
  spec.summary = "a sample daemon";
  spec.description = "Answers every request with success.\n";
  spec.default_socket = "/nonexistent/sampled.sock";
  spec.default_pidfile = "/nonexistent/sampled.pid";
  spec.handler = Handle;
  spec.context = nullptr;
  spec.options = {quvaidx_tools::Text("marks", 0, "FILE", &g_marks,
                                      "append start and stop to FILE")};
  spec.start = Start;
  spec.stop = Stop;
  return quvaidx_daemons::RunDaemon(spec, argc, argv);
}
