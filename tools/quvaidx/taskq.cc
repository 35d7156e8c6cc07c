// quvaidx taskq: the JSON task queues between daemons, from the shell.
//
// Every operation names its queue by a key file and a project number, as
// the daemons do. Arguments are checked, and the key file looked at, before
// the library is called, so every mistake gets one line of its own; a
// queue is opened only when it exists, never created by accident.
#include <errno.h>
#include <getopt.h>
#include <limits.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>

#include <string>

#include <json/json.h>

#include "cli.h"
#include "commands.h"
#include "quvaidx/task_queue.h"

namespace quvaidx_cli {
namespace {

constexpr char kName[] = "taskq";
// Largest task text the queue carries (it refuses 8192 bytes or more).
constexpr size_t kMaxTaskText = 8191;
constexpr int kMaxAttempts = 3600;
constexpr int kMaxSizeKib = INT_MAX / 1024;

void PrintHelp() {
  printf(
      "Usage: quvaidx taskq create PATH PROJECT [--size KIB]\n"
      "       quvaidx taskq push   PATH PROJECT JSON [--type N]\n"
      "       quvaidx taskq pop    PATH PROJECT [--type N] [--nowait "
      "[--attempts N]]\n"
      "       quvaidx taskq count  PATH PROJECT\n"
      "       quvaidx taskq delete PATH PROJECT\n"
      "\n"
      "Works on the task queue named by the existing file PATH and the\n"
      "project number PROJECT (1 to 255); tasks are JSON objects.\n"
      "\n"
      "  create  makes a fresh, empty queue (an old one under the same name\n"
      "          is discarded with its tasks) and prints its identifier\n"
      "  push    adds the task JSON; waits while the queue is full\n"
      "  pop     takes one task off and prints it on one line; waits for\n"
      "          one unless --nowait is given\n"
      "  count   prints the number of tasks in the queue\n"
      "  delete  removes the queue, if there is one\n"
      "\n"
      "Options:\n"
      "  -s, --size KIB      create: the queue's byte limit in KiB (default:\n"
      "                      the system's; a limit the system refuses is\n"
      "                      silently not applied)\n"
      "  -t, --type N        push: the task's type, 1 or more (default 1);\n"
      "                      pop: 0 takes the oldest task (default), N > 0\n"
      "                      the oldest of type N, N < 0 the oldest of the\n"
      "                      lowest type not above -N\n"
      "  -n, --nowait        pop: do not wait; each empty attempt costs one\n"
      "                      second\n"
      "  -a, --attempts N    pop --nowait: attempts (default 1, at most %d)\n"
      "  -v, --verbose       also show the library's log lines on stderr\n"
      "  -h, --help          show this help\n"
      "\n"
      "Exit status: 0 on success, 1 when pop found no task, 2 on a usage\n"
      "error, a missing key file or queue, or a failed operation.\n"
      "\n"
      "Example:\n"
      "  touch /tmp/q.key && quvaidx taskq create /tmp/q.key 7\n"
      "  quvaidx taskq push /tmp/q.key 7 '{\"path\":\"/share/a.jpg\"}'\n"
      "  quvaidx taskq pop /tmp/q.key 7 --nowait\n"
      "  quvaidx taskq delete /tmp/q.key 7\n",
      kMaxAttempts);
}

// The command line after option parsing.
struct Request {
  std::string operation, path, json;
  int project = 0;
  int size_kib = 0;
  int type = 0;
  bool type_given = false, size_given = false;
  bool nowait = false, attempts_given = false;
  int attempts = 1;
};

std::string QueueName(const Request& request) {
  return "key file " + request.path + ", project " +
         std::to_string(request.project);
}

// Opens the existing queue, or prints why not and returns -1.
int OpenQueue(const Request& request) {
  int id = GetMessageQueue(request.path.c_str(), request.project);
  if (id < 0) {
    PrintError(kName, "no queue for " + QueueName(request) +
                          " (or no access to it); make one with "
                          "'quvaidx taskq create'");
  }
  return id;
}

int Create(const Request& request) {
  int id = CreateMessageQueue(request.path.c_str(), request.project,
                              request.size_kib);
  if (id < 0) {
    PrintError(kName, "cannot create a queue for " + QueueName(request) +
                          " (--verbose shows the library's report)");
    return kExitError;
  }
  printf("%d\n", id);
  return kExitOk;
}

int Push(const Request& request) {
  Json::Value task;
  if (!ParseJsonObject(kName, request.json, "task",
                       "{\"path\":\"/share/a.jpg\"}", &task)) {
    return kExitError;
  }
  size_t size = Json::FastWriter().write(task).size();
  if (size > kMaxTaskText) {
    PrintError(kName, "the task is " + std::to_string(size) +
                          " bytes long; a queue carries at most " +
                          std::to_string(kMaxTaskText));
    return kExitError;
  }
  int id = OpenQueue(request);
  if (id < 0) return kExitError;
  if (PushTaskToQueue(id, task, request.type_given ? request.type : 1) != 0) {
    PrintError(kName, "the task was not queued on " + QueueName(request) +
                          " (--verbose shows the library's report)");
    return kExitError;
  }
  return kExitOk;
}

int Pop(const Request& request) {
  int id = OpenQueue(request);
  if (id < 0) return kExitError;
  Json::Value task;  // the library parses into it without clearing it
  if (PopTaskFromQueue(id, request.type, !request.nowait, request.attempts,
                       task) == 0) {
    PrintJson(task, true);
    return kExitOk;
  }
  // The library answers an empty queue and a failed receive alike; a queue
  // whose status can still be read was merely empty.
  if (request.nowait && GetNumOfMessageInQueue(id) >= 0) {
    PrintError(kName, "no task of type " + std::to_string(request.type) +
                          " after " + std::to_string(request.attempts) +
                          (request.attempts == 1 ? " attempt" : " attempts"));
    return kExitFalse;
  }
  PrintError(kName,
             "no task came: the queue was removed or the wait failed "
             "(--verbose shows the library's report)");
  return kExitError;
}

int Count(const Request& request) {
  int id = OpenQueue(request);
  if (id < 0) return kExitError;
  int count = GetNumOfMessageInQueue(id);
  if (count < 0) {
    PrintError(kName,
               "cannot read the status of the queue for " + QueueName(request));
    return kExitError;
  }
  printf("%d\n", count);
  return kExitOk;
}

int Delete(const Request& request) {
  if (DeleteMessageQueue(request.path.c_str(), request.project) != 0) {
    PrintError(kName, "cannot delete the queue for " + QueueName(request));
    return kExitError;
  }
  return kExitOk;
}

// Checks the positional arguments and which options suit the operation.
// Prints one error and returns false on a mistake.
bool CheckRequest(Request* request, int count, char** args) {
  if (count < 1) {
    UsageError(kName,
               "missing the operation: create, push, pop, count or "
               "delete");
    return false;
  }
  request->operation = args[0];
  const std::string& op = request->operation;
  bool is_push = op == "push";
  if (op != "create" && !is_push && op != "pop" && op != "count" &&
      op != "delete") {
    UsageError(kName, "unknown operation '" + op + "'");
    return false;
  }
  int wanted = is_push ? 4 : 3;
  if (count < wanted) {
    UsageError(kName, op + (is_push ? " needs PATH, PROJECT and JSON"
                                    : " needs PATH and PROJECT"));
    return false;
  }
  if (count > wanted) {
    UsageError(kName,
               std::string("unexpected argument '") + args[wanted] + "'");
    return false;
  }
  request->path = args[1];
  if (!ParseInt(args[2], 1, 255, &request->project)) {
    UsageError(kName, std::string("PROJECT needs a whole number from 1 to "
                                  "255, not '") +
                          args[2] + "'");
    return false;
  }
  if (is_push) request->json = args[3];
  const char* misplaced = nullptr;
  if (request->size_given && op != "create") misplaced = "--size";
  if (request->type_given && !is_push && op != "pop") misplaced = "--type";
  if (request->nowait && op != "pop") misplaced = "--nowait";
  if (misplaced != nullptr) {
    UsageError(kName, std::string(misplaced) + " does not apply to " + op);
    return false;
  }
  if (request->attempts_given && !request->nowait) {
    UsageError(kName, "--attempts applies to pop --nowait only");
    return false;
  }
  if (is_push && request->type_given && request->type < 1) {
    UsageError(kName, "push --type needs a type of 1 or more");
    return false;
  }
  struct stat info;
  if (stat(request->path.c_str(), &info) != 0) {
    PrintError(kName, "key file " + request->path + ": " + strerror(errno));
    return false;
  }
  return true;
}

}  // namespace

int RunTaskq(int argc, char** argv) {
  static const struct option kOptions[] = {
      {"size", required_argument, nullptr, 's'},
      {"type", required_argument, nullptr, 't'},
      {"nowait", no_argument, nullptr, 'n'},
      {"attempts", required_argument, nullptr, 'a'},
      {"verbose", no_argument, nullptr, 'v'},
      {"help", no_argument, nullptr, 'h'},
      {nullptr, 0, nullptr, 0},
  };
  Request request;
  optind = 0;
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, ":s:t:na:vh", kOptions, nullptr)) != -1) {
    switch (c) {
      case 's':
        if (!ParseInt(optarg, 1, kMaxSizeKib, &request.size_kib)) {
          return UsageError(kName, std::string("--size needs a whole number "
                                               "of KiB from 1 to ") +
                                       std::to_string(kMaxSizeKib) + ", not '" +
                                       optarg + "'");
        }
        request.size_given = true;
        break;
      case 't':
        if (!ParseInt(optarg, -INT_MAX, INT_MAX, &request.type)) {
          return UsageError(kName, std::string("--type needs a whole number, "
                                               "not '") +
                                       optarg + "'");
        }
        request.type_given = true;
        break;
      case 'n':
        request.nowait = true;
        break;
      case 'a':
        if (!ParseInt(optarg, 1, kMaxAttempts, &request.attempts)) {
          return UsageError(kName, std::string("--attempts needs a whole "
                                               "number from 1 to ") +
                                       std::to_string(kMaxAttempts) +
                                       ", not '" + optarg + "'");
        }
        request.attempts_given = true;
        break;
      case 'v':
        EnableVerboseLogging();
        break;
      case 'h':
        PrintHelp();
        return kExitOk;
      default:
        return OptionError(kName, c, argv);
    }
  }
  if (!CheckRequest(&request, argc - optind, argv + optind)) return kExitError;
  const std::string& op = request.operation;
  if (op == "create") return Create(request);
  if (op == "push") return Push(request);
  if (op == "pop") return Pop(request);
  if (op == "count") return Count(request);
  return Delete(request);
}

}  // namespace quvaidx_cli
