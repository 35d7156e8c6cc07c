// quvaidx spool: adding entries to a spool queue and trimming its head.
//
// `add` goes through WriteIndexQueue, so an entry already queued is not
// queued twice. `trim` goes through TrimQueueHead, the library's consumer
// side: under the queue's exclusive flock it blanks the first N entries in
// place, as the queue's daemon does with the entries it finished. Every
// entry is checked before the first is written, so a bad one leaves the
// queue as it was. An ENTRY "-" reads the
// entries from standard input, one per line (or NUL-terminated, with -0).
#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "cli.h"
#include "commands.h"
#include "preview_queue.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "spool";

quvaidx_tools::CommandLine MakeLine(bool* null_list) {
  return Subcommand(
      kName, {"add  QUEUE ENTRY...|-", "trim QUEUE N"},
      "Works on a spool queue: a text file of one entry per line, appended\n"
      "under an exclusive flock and consumed from its head.\n"
      "\n"
      "  add   appends each ENTRY as one line, unless a line equal to it is\n"
      "        already there; QUEUE is created when missing. An entry must\n"
      "        not be empty, hold a line feed or exceed " +
          std::to_string(kMaxQueueEntry) +
          " bytes; when one\n"
          "        does, nothing is added. With -, the entries are read "
          "from\n        standard input, one per line.\n"
          "  trim  removes the first N lines (all of them when N is beyond "
          "the\n        end) while holding the queue's exclusive flock, as a "
          "consumer\n        does; waits for the lock as long as another "
          "process holds it\n",
      {NullOption(null_list)},
      "An ENTRY that starts with '-' goes after \"--\".\n"
      "\n"
      "Exit status: 0 on success, 2 on a usage error, a refused entry or a\n"
      "failed operation.\n"
      "\n"
      "Examples:\n"
      "  $ quvaidx spool add /tmp/q.queue /share/Photos/2015 "
      "/share/Photos/2016\n"
      "  $ quvaidx spool trim /tmp/q.queue 1\n");
}

// Why `entry` cannot be queued, or "" when it can.
std::string EntryProblem(const std::string& entry) {
  if (entry.empty()) return "an empty entry cannot be queued";
  if (entry.find('\n') != std::string::npos) {
    return "an entry must not hold a line feed";
  }
  if (entry.size() > static_cast<size_t>(kMaxQueueEntry)) {
    return "an entry is " + std::to_string(entry.size()) +
           " bytes long; a queue line holds at most " +
           std::to_string(kMaxQueueEntry);
  }
  return "";
}

// `args`: QUEUE and the entries.
int Add(const std::vector<std::string>& args) {
  if (args.size() < 2) return UsageError(kName, "add needs QUEUE and an ENTRY");
  const std::string& queue = args[0];
  for (size_t i = 1; i < args.size(); ++i) {
    std::string problem = EntryProblem(args[i]);
    if (!problem.empty()) {
      PrintError(kName, problem + " (entry " + std::to_string(i) +
                            "); nothing was added");
      return kExitError;
    }
  }
  if (!CheckWritableQueue(kName, queue)) return kExitError;
  for (size_t i = 1; i < args.size(); ++i) {
    if (WriteIndexQueue(args[i].c_str(), queue.c_str()) != 0) {
      PrintError(kName, "cannot add '" + args[i] + "' to " + queue +
                            " (--verbose shows the library's report)");
      return kExitError;
    }
  }
  return kExitOk;
}

// `args`: QUEUE and N.
int Trim(const std::vector<std::string>& args) {
  if (args.size() < 2) return UsageError(kName, "trim needs QUEUE and N");
  if (args.size() > 2) {
    return UsageError(kName, "unexpected argument '" + args[2] + "'");
  }
  const char* queue = args[0].c_str();
  int lines = 0;
  if (!ParseInt(args[1].c_str(), 0, INT_MAX, &lines)) {
    return UsageError(kName, "N needs a whole number of lines from 0 to " +
                                 std::to_string(INT_MAX) + ", not '" + args[1] +
                                 "'");
  }
  struct stat st;
  if (stat(queue, &st) != 0) {
    PrintError(kName, std::string(queue) + ": " + strerror(errno));
    return kExitError;
  }
  if (!S_ISREG(st.st_mode)) {
    PrintError(kName, std::string(queue) + " is not a regular file");
    return kExitError;
  }
  // Under the queue's lock, following a queue another consumer replaced
  // while this one waited.
  if (TrimQueueHead(queue, lines) != 0) {
    PrintError(kName, std::string("cannot trim ") + queue +
                          " (--verbose shows the library's report)");
    return kExitError;
  }
  return kExitOk;
}

}  // namespace

int RunSpool(int argc, char** argv) {
  bool null_list = false;
  std::vector<std::string> args;
  if (int status = ParseCommand(
          MakeLine(&null_list),
          {"the operation: add or trim", 1, -1, &null_list}, argc, argv, &args);
      status != kContinue) {
    return status;
  }
  const std::string op = args[0];
  args.erase(args.begin());
  if (op == "add") return Add(args);
  if (op == "trim") return Trim(args);
  return UsageError(kName, "unknown operation '" + op + "'");
}

}  // namespace quvaidx_cli
