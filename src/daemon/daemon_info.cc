#include "quvaidx/daemon_info.h"

#include <string.h>

#include "quvaidx/paths.h"

DaemonInfo::DaemonInfo() {
  for (const quvaidx::IndexDaemonPaths& daemon : quvaidx::kIndexDaemons) {
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
