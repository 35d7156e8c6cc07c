#include "quvaidx/daemon_info.h"

#include <string.h>

namespace {

struct DaemonEntry {
  const char* name;
  const char* pid_file;
  const char* executable;
  const char* socket;
};

constexpr DaemonEntry kDaemons[] = {
    {"controld", "/var/run/quvaindexd.pid", "/usr/quva/sbin/quvaindexd",
     "/tmp/quvaindexd_sock"},
    {"scand", "/var/run/quvaindexscand.pid", "/usr/quva/sbin/quvaindexscand",
     "/tmp/quvaindexscand_sock"},
    {"workerd", "/var/run/quvaindexworkerd.pid",
     "/usr/quva/sbin/quvaindexworkerd", "/tmp/quvaindexworkerd_sock"},
    {"plugind", "/var/run/quvaindexplugind.pid",
     "/usr/quva/sbin/quvaindexplugind", "/tmp/quvaindexplugind_sock"},
    {"mediad", "/var/run/quvamediaparserd.pid",
     "/usr/quva/sbin/quvamediaparserd", "/tmp/quvamediaparserd_sock"},
};

}  // namespace

DaemonInfo::DaemonInfo() {
  for (const DaemonEntry& daemon : kDaemons) {
    pid_files_[daemon.name] = daemon.pid_file;
    executables_[daemon.name] = daemon.executable;
    sockets_[daemon.name] = daemon.socket;
  }
}

std::string DaemonInfo::get(std::string name, const char* field) {
  if (strcmp(field, "pid") == 0) return pid_files_[name];
  if (strcmp(field, "bin") == 0) return executables_[name];
  if (strcmp(field, "sock") == 0) return sockets_[name];
  return std::string();
}

std::string DaemonInfo::get(const char* name, const char* field) {
  return get(std::string(name), field);
}
