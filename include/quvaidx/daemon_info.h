// The directory of the index service's daemons: for each daemon's short
// name, its pid file, its executable and its Unix-domain socket, as listed
// in quvaidx/paths.h:
//
//   controld  pid  /var/run/quvaindexd.pid
//             bin  /usr/quva/sbin/quvaindexd
//             sock /tmp/quvaindexd_sock
//   scand     pid  /var/run/quvaindexscand.pid
//             bin  /usr/quva/sbin/quvaindexscand
//             sock /tmp/quvaindexscand_sock
//   workerd   pid  /var/run/quvaindexworkerd.pid
//             bin  /usr/quva/sbin/quvaindexworkerd
//             sock /tmp/quvaindexworkerd_sock
//   plugind   pid  /var/run/quvaindexplugind.pid
//             bin  /usr/quva/sbin/quvaindexplugind
//             sock /tmp/quvaindexplugind_sock
//   mediad    pid  /var/run/quvamediaparserd.pid
//             bin  /usr/quva/sbin/quvamediaparserd
//             sock /tmp/quvamediaparserd_sock
//
// Threads: a lookup of an unknown name inserts an empty entry, so one
// instance must not be used by two threads at once; separate instances are
// independent.
#ifndef QUVAIDX_DAEMON_INFO_H_
#define QUVAIDX_DAEMON_INFO_H_

#include <map>
#include <string>

#include "quvaidx/export.h"

class QUVAIDX_API DaemonInfo {
 public:
  // Fills the three maps from kIndexDaemons (quvaidx/paths.h).
  DaemonInfo();

  // Returns the path of `field` ("pid", "bin" or "sock", compared exactly)
  // for the daemon `name`; an empty string for a name not in the table or
  // any other field.
  // REQUIRES: neither pointer is null.
  std::string get(std::string name, const char* field);
  std::string get(const char* name, const char* field);

 private:
  std::map<std::string, std::string> pid_files_;    // name -> pid file
  std::map<std::string, std::string> executables_;  // name -> executable
  std::map<std::string, std::string> sockets_;      // name -> socket path
};

#endif  // QUVAIDX_DAEMON_INFO_H_
