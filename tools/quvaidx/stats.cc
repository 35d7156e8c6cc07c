// quvaidx stats: a process's descriptors and memory, and the machine's.
//
// The figures come from the library's process statistics, which read
// /proc and start no other process. A figure that cannot be read (another
// user's descriptors, a kernel thread's memory) is shown as "-", or null in
// JSON, rather than as a number that would mislead.
#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "stats";

quvaidx_tools::CommandLine MakeLine(bool* json) {
  return Subcommand(
      kName, {"[--json] [PID]"},
      "Prints the open descriptors, resident and virtual memory of process\n"
      "PID (default: this tool's own process) and the machine's total\n"
      "memory, in kB, from /proc. A figure that cannot be read is shown as\n"
      "\"-\".\n",
      {JsonOption(json,
                  "print a JSON object with the members pid,\ndescriptors, "
                  "rss_kb, vmsize_kb and\nmem_total_kb (null when "
                  "unreadable)")},
      "Exit status: 0, or 2 on a usage error or when no process PID "
      "exists.\n");
}

// The figures; -1 where unreadable.
struct Figures {
  int pid;
  long descriptors;
  long rss_kb;
  long vmsize_kb;
  long mem_total_kb;
};

bool ProcessExists(int pid) {
  struct stat st;
  return stat(("/proc/" + std::to_string(pid)).c_str(), &st) == 0;
}

std::string Text(long value, const char* unit) {
  return value < 0 ? "-" : std::to_string(value) + unit;
}

Json::Value JsonNumber(long value) {
  return value < 0 ? Json::Value() : Json::Value(Json::Int64(value));
}

}  // namespace

int RunStats(int argc, char** argv) {
  bool json = false;
  std::vector<std::string> pid;
  if (int status = ParseCommand(MakeLine(&json), {"PID", 0, 1, nullptr}, argc,
                                argv, &pid);
      status != kContinue) {
    return status;
  }
  Figures figures = {static_cast<int>(getpid()), -1, -1, -1, -1};
  if (!pid.empty() && !ParseInt(pid[0].c_str(), 1, INT_MAX, &figures.pid)) {
    return UsageError(kName, "PID needs a whole number from 1 to " +
                                 std::to_string(INT_MAX) + ", not '" + pid[0] +
                                 "'");
  }
  if (!ProcessExists(figures.pid)) {
    PrintError(kName, "no process " + std::to_string(figures.pid));
    return kExitError;
  }
  // The library counts one line more than there are descriptors: the
  // header of a long listing. 0 means the directory could not be read.
  int listed = GetFileDescriptorNum(figures.pid);
  if (listed > 0) figures.descriptors = listed - 1;
  long rss = -1;
  long vmsize = -1;
  GetMemoryUsagekb(figures.pid, rss, vmsize);  // unread figures stay -1
  figures.rss_kb = rss;
  figures.vmsize_kb = vmsize;
  long total = -1;
  GetTotalMemory(total);
  figures.mem_total_kb = total;
  // The process may have ended while it was being read.
  if (!ProcessExists(figures.pid)) {
    PrintError(kName, "process " + std::to_string(figures.pid) +
                          " ended while it was being read");
    return kExitError;
  }

  if (json) {
    Json::Value object(Json::objectValue);
    object["pid"] = figures.pid;
    object["descriptors"] = JsonNumber(figures.descriptors);
    object["rss_kb"] = JsonNumber(figures.rss_kb);
    object["vmsize_kb"] = JsonNumber(figures.vmsize_kb);
    object["mem_total_kb"] = JsonNumber(figures.mem_total_kb);
    PrintJson(object, false);
    return kExitOk;
  }
  printf("pid              %d\n", figures.pid);
  printf("descriptors      %s\n", Text(figures.descriptors, "").c_str());
  printf("resident memory  %s\n", Text(figures.rss_kb, " kB").c_str());
  printf("virtual memory   %s\n", Text(figures.vmsize_kb, " kB").c_str());
  printf("total memory     %s\n", Text(figures.mem_total_kb, " kB").c_str());
  fflush(stdout);
  return kExitOk;
}

}  // namespace quvaidx_cli
