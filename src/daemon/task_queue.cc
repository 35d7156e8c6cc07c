// JSON task queues on System V message queues.
#include "quvaidx/task_queue.h"

#include <errno.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>

#include <string>

#include "ipc/packet_codec.h"
#include "quvaidx/log.h"
#include "util/hooks.h"

namespace {

constexpr char kModule[] = "quvaidx_daemon";
constexpr int kQueueMode = 0600;
constexpr size_t kLargestTextArea = 8192;

// The message handed to msgsnd/msgrcv. The kernel reads the type as a
// `long`, so the text starts right behind a field of that size.
struct TaskMessage {
  long type;
  char text[kLargestTextArea];
};

// The smallest text area that holds `length` bytes and a zero byte, or 0
// when even the largest does not.
size_t TextAreaFor(size_t length) {
  for (size_t area : {size_t{1024}, size_t{4096}, kLargestTextArea}) {
    if (length < area) return area;
  }
  return 0;
}

// Makes the queue key, logging a failure.
bool MakeKey(const char* path, int project, key_t* key) {
  *key = ftok(path, project);
  if (*key != -1) return true;
  int err = errno;
  AppLogError(3, "%s:%d [Error] ftok: %s", kModule, __LINE__, strerror(err));
  return false;
}

}  // namespace

int CreateMessageQueue(const char* path, int project, int size_kib) {
  key_t key;
  if (!MakeKey(path, project, &key)) return -1;
  int old = msgget(key, kQueueMode);
  if (old != -1) msgctl(old, IPC_RMID, nullptr);
  int id = msgget(key, IPC_CREAT | kQueueMode);
  if (id == -1) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] msgget: %s", kModule, __LINE__,
                strerror(err));
    return -1;
  }
  struct msqid_ds status;
  if (size_kib > 0 && msgctl(id, IPC_STAT, &status) == 0) {
    status.msg_qbytes = static_cast<msglen_t>(size_kib) * 1024;
    msgctl(id, IPC_SET, &status);  // a refused limit keeps the default
  }
  return id;
}

int GetMessageQueue(const char* path, int project) {
  key_t key;
  if (!MakeKey(path, project, &key)) return -1;
  int id = msgget(key, kQueueMode);
  if (id == -1) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] msgget: %s, key: %x, id: %d, path: %s,",
                kModule, __LINE__, strerror(err), static_cast<unsigned>(key),
                project, path);
  }
  return id;
}

int DeleteMessageQueue(const char* path, int project) {
  key_t key;
  if (!MakeKey(path, project, &key)) return -1;
  int id = msgget(key, kQueueMode);
  if (id != -1) msgctl(id, IPC_RMID, nullptr);  // don't care if this fails
  return 0;
}

int GetNumOfMessageInQueue(int id) {
  struct msqid_ds status;
  if (msgctl(id, IPC_STAT, &status) != 0) return -1;
  return static_cast<int>(status.msg_qnum);
}

int PushTaskToQueue(int id, Json::Value task, int type) {
  std::string text;
  try {
    text = Json::FastWriter().write(task);
  } catch (...) {
    AppLogError(3, "%s:%d [Error] cannot serialise task", kModule, __LINE__);
    return -1;
  }
  size_t area = TextAreaFor(text.size());
  if (area == 0) {
    AppLogError(3, "%s:%d [Error] message is too big: %s", kModule, __LINE__,
                text.c_str());
    return -1;
  }
  TaskMessage message;
  message.type = type;
  memcpy(message.text, text.data(), text.size());
  // Zero the rest of the area: no stale stack bytes go to another process.
  memset(message.text + text.size(), 0, area - text.size());
  if (msgsnd(id, &message, area, 0) != 0) {
    int err = errno;
    AppLogError(3, "%s:%d [Error] msgsnd: %s", kModule, __LINE__,
                strerror(err));
    return -1;
  }
  return 0;
}

int PopTaskFromQueue(int id, int type, bool block, int attempts,
                     Json::Value& out) {
  if (!block && attempts <= 0) return -1;
  TaskMessage message;
  for (int tried = 0;;) {
    ssize_t got = msgrcv(id, &message, sizeof(message.text), type,
                         block ? 0 : IPC_NOWAIT);
    if (got >= 0) {
      quvaidx::ParsePacketBody(message.text, static_cast<size_t>(got), out);
      return 0;
    }
    int err = errno;
    if (err != ENOMSG || block) {
      AppLogError(3, "%s:%d [Error] msgrcv: %s", kModule, __LINE__,
                  strerror(err));
      return -1;
    }
    quvaidx::SleepSeconds(1);
    if (++tried >= attempts) return -1;
  }
}
