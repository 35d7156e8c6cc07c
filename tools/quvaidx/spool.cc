// quvaidx spool: adding entries to a spool queue and trimming its head.
//
// `add` goes through WriteIndexQueue, so an entry already queued is not
// queued twice. `trim` goes through TrimQueueHead, the library's consumer
// side: it takes the queue's exclusive flock, removes the head with
// FileRemoveHeadingLine and lets go. Every entry is checked before the first is
// written, so a bad one leaves the queue as it was.
#include <errno.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "cli.h"
#include "commands.h"
#include "quvaidx/spool_consumer.h"
#include "quvaidx/system.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "spool";

quvaidx_tools::CommandLine MakeLine() {
  return Subcommand(
      kName, {"add  QUEUE ENTRY...", "trim QUEUE N"},
      "Works on a spool queue: a text file of one entry per line, appended\n"
      "under an exclusive flock and consumed from its head.\n"
      "\n"
      "  add   appends each ENTRY as one line, unless a line equal to it is\n"
      "        already there; QUEUE is created when missing. An entry must\n"
      "        not be empty, hold a line feed or exceed " +
          std::to_string(kMaxQueueEntry) +
          " bytes; when one\n"
          "        does, nothing is added.\n"
          "  trim  removes the first N lines (all of them when N is beyond "
          "the\n        end) while holding the queue's exclusive flock, as a "
          "consumer\n        does; waits for the lock as long as another "
          "process holds it\n",
      {},
      "An ENTRY that starts with '-' goes after \"--\".\n"
      "\n"
      "Exit status: 0 on success, 2 on a usage error, a refused entry or a\n"
      "failed operation.\n"
      "\n"
      "Example:\n"
      "  quvaidx spool add /tmp/q.queue /share/Photos/2015 /share/Photos/2016\n"
      "  quvaidx spool trim /tmp/q.queue 1\n");
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

// The directory part of `path`: "." when it has none.
std::string DirectoryOf(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

// Checks that QUEUE can be written, so that the library's open is not
// refused: it retries a refused open for sixteen seconds. Prints one line
// and returns false otherwise.
bool CheckWritableQueue(const std::string& queue) {
  struct stat st;
  if (stat(queue.c_str(), &st) == 0) {
    if (!S_ISREG(st.st_mode)) {
      PrintError(kName, queue + " is not a regular file");
      return false;
    }
    if (access(queue.c_str(), W_OK) != 0) {
      PrintError(kName, queue + ": " + strerror(errno));
      return false;
    }
    return true;
  }
  if (errno != ENOENT) {
    PrintError(kName, queue + ": " + strerror(errno));
    return false;
  }
  std::string dir = DirectoryOf(queue);
  if (access(dir.c_str(), W_OK | X_OK) != 0) {
    PrintError(kName,
               "cannot create " + queue + ": " + dir + ": " + strerror(errno));
    return false;
  }
  return true;
}

int Add(int count, char** args) {
  if (count < 2) return UsageError(kName, "add needs QUEUE and an ENTRY");
  std::string queue = args[0];
  for (int i = 1; i < count; ++i) {
    std::string problem = EntryProblem(args[i]);
    if (!problem.empty()) {
      PrintError(kName, problem + " (entry " + std::to_string(i) +
                            "); nothing was added");
      return kExitError;
    }
  }
  if (!CheckWritableQueue(queue)) return kExitError;
  for (int i = 1; i < count; ++i) {
    if (WriteIndexQueue(args[i], queue.c_str()) != 0) {
      PrintError(kName, std::string("cannot add '") + args[i] + "' to " +
                            queue + " (--verbose shows the library's report)");
      return kExitError;
    }
  }
  return kExitOk;
}

int Trim(int count, char** args) {
  if (count < 2) return UsageError(kName, "trim needs QUEUE and N");
  if (count > 2) {
    return UsageError(kName,
                      std::string("unexpected argument '") + args[2] + "'");
  }
  const char* queue = args[0];
  int lines = 0;
  if (!ParseInt(args[1], 0, INT_MAX, &lines)) {
    return UsageError(kName, std::string("N needs a whole number of lines "
                                         "from 0 to ") +
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
  int result = TrimQueueHead(queue, lines);
  if (result != 0) {
    PrintError(kName, std::string("cannot trim ") + queue +
                          ": the queue is unchanged, or a temporary file "
                          "beside it was left behind");
    return kExitError;
  }
  return kExitOk;
}

}  // namespace

int RunSpool(int argc, char** argv) {
  int first = 0;
  int status = ParseArguments(MakeLine(), argc, argv, &first);
  if (status != kContinue) return status;
  int count = argc - first;
  char** args = argv + first;
  if (count < 1) return UsageError(kName, "missing the operation: add or trim");
  std::string op = args[0];
  if (op == "add") return Add(count - 1, args + 1);
  if (op == "trim") return Trim(count - 1, args + 1);
  return UsageError(kName, "unknown operation '" + op + "'");
}

}  // namespace quvaidx_cli
