// quvaidx taskq: the JSON task queues between daemons, from the shell.
//
// Every operation names its queue by a key file and a project number, as
// the daemons do. Arguments are checked, and the key file looked at, before
// the library is called, so every mistake gets one line of its own; a
// queue is opened only when it exists, never created by accident.
#include <errno.h>
#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>
#include <vector>

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

quvaidx_tools::CommandLine MakeLine(Request* r) {
  using namespace quvaidx_tools;
  return Subcommand(
      kName,
      {"create PATH PROJECT [--size KIB]",
       "push   PATH PROJECT JSON|- [--type N]",
       "pop    PATH PROJECT [--type N] [--nowait [--attempts N]]",
       "count  PATH PROJECT", "delete PATH PROJECT"},
      "Works on the task queue named by the existing file PATH and the\n"
      "project number PROJECT (1 to 255); tasks are JSON objects.\n"
      "\n"
      "  create  makes a fresh, empty queue (an old one under the same name\n"
      "          is discarded with its tasks) and prints its identifier\n"
      "  push    adds the task JSON (-: read from standard input); waits\n"
      "          while the queue is full\n"
      "  pop     takes one task off and prints it on one line; waits for\n"
      "          one unless --nowait is given\n"
      "  count   prints the number of tasks in the queue\n"
      "  delete  removes the queue, if there is one\n",
      {
          Noted(Number("size", 0, "KIB", 1, kMaxSizeKib, &r->size_kib,
                       "create: the queue's byte limit in KiB\n(default: "
                       "the system's; a limit the system\nrefuses is "
                       "silently not applied)"),
                &r->size_given),
          Noted(Number("type", 0, "N", -INT_MAX, INT_MAX, &r->type,
                       "push: the task's type, 1 or more (default 1);\n"
                       "pop: 0 takes the oldest task (default), N > 0\nthe "
                       "oldest of type N, N < 0 the oldest of the\nlowest "
                       "type not above -N"),
                &r->type_given),
          quvaidx_tools::Flag(
              "nowait", 'n', &r->nowait,
              "pop: do not wait for a task; attempts are\none second apart"),
          Noted(Number("attempts", 'a', "N", 1, kMaxAttempts, &r->attempts,
                       "pop --nowait: attempts (default 1)"),
                &r->attempts_given),
      },
      "Exit status: 0 on success, 1 when pop found no task, 2 on a usage\n"
      "error, a missing key file or queue, or a failed operation.\n"
      "\n"
      "Examples:\n"
      "  $ touch /tmp/q.key && quvaidx taskq create /tmp/q.key 7\n"
      "  $ quvaidx taskq push /tmp/q.key 7 '{\"path\":\"/share/a.jpg\"}'\n"
      "  $ quvaidx taskq pop /tmp/q.key 7 --nowait\n"
      "  $ quvaidx taskq delete /tmp/q.key 7\n");
}

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
  const JsonInput input = {"task", "{\"path\":\"/share/a.jpg\"}", kMaxTaskText,
                           "a queue"};
  if (!ReadJsonObject(kName, request.json, input, &task)) return kExitError;
  int id = OpenQueue(request);
  if (id < 0) return kExitError;
  if (PushTaskToQueue(id, task, request.type_given ? request.type : 1) != 0) {
    PrintError(kName, "the task was not queued on " + QueueName(request) +
                          " (--verbose shows the library's report)");
    return kExitError;
  }
  return kExitOk;
}

void Wake(int) {}

// One attempt to take a task without waiting. The library sleeps a second
// after an empty attempt; a one-shot timer cuts that sleep short, so that
// the attempts are spaced by this tool alone, with no wait after the last.
// The receive itself does not wait, so the signal cannot interrupt it.
int PopOnce(int id, int type, Json::Value& task) {
  struct sigaction action = {}, previous;
  action.sa_handler = Wake;  // no SA_RESTART: sleep(3) returns early
  sigemptyset(&action.sa_mask);
  sigaction(SIGALRM, &action, &previous);
  struct itimerval timer = {}, off = {};
  timer.it_value.tv_usec = 20 * 1000;
  setitimer(ITIMER_REAL, &timer, nullptr);
  int result = PopTaskFromQueue(id, type, false, 1, task);
  setitimer(ITIMER_REAL, &off, nullptr);
  sigaction(SIGALRM, &previous, nullptr);
  return result;
}

int Pop(const Request& request) {
  int id = OpenQueue(request);
  if (id < 0) return kExitError;
  Json::Value task;  // the library parses into it without clearing it
  int result = -1;
  if (!request.nowait) {
    result = PopTaskFromQueue(id, request.type, true, 1, task);
  } else {
    for (int attempt = 0; attempt < request.attempts && result != 0;
         ++attempt) {
      if (attempt > 0) sleep(1);  // never after the last attempt
      result = PopOnce(id, request.type, task);
      // A queue whose status cannot be read is gone: no use trying on.
      if (result != 0 && GetNumOfMessageInQueue(id) < 0) break;
    }
  }
  if (result == 0) {
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
bool CheckRequest(Request* request, const std::vector<std::string>& args) {
  const int count = static_cast<int>(args.size());
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
    UsageError(kName, "unexpected argument '" + args[wanted] + "'");
    return false;
  }
  request->path = args[1];
  if (!ParseInt(args[2].c_str(), 1, 255, &request->project)) {
    UsageError(kName, "PROJECT needs a whole number from 1 to 255, not '" +
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
  Request request;
  std::vector<std::string> args;
  if (int status = ParseCommand(MakeLine(&request), {"", 0, -1, nullptr}, argc,
                                argv, &args);
      status != kContinue) {
    return status;
  }
  if (!CheckRequest(&request, args)) return kExitError;
  const std::string& op = request.operation;
  if (op == "create") return Create(request);
  if (op == "push") return Push(request);
  if (op == "pop") return Pop(request);
  if (op == "count") return Count(request);
  return Delete(request);
}

}  // namespace quvaidx_cli
