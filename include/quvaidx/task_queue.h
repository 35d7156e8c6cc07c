// JSON task queues between daemons, on System V message queues.
//
// A queue is named by an existing file and a project number (ftok) and is
// readable and writable by its owner only (0600). A task is a JSON object
// sent as its compact text with a terminating zero byte, in a message whose
// text area is 1024, 4096 or 8192 bytes, the smallest that holds it; the
// queue's byte limit is charged the whole area. Texts of 8192 bytes or more
// are refused. Message types follow the System V rules: a pop of type 0
// takes the oldest task, a positive type the oldest task of that type, a
// negative type the oldest task of the lowest type not above its absolute
// value (so small types act as high priorities).
//
// Results: 0 or an identifier on success, -1 on failure. Failures are logged
// at level 3 (module "quvaidx_daemon"); an empty non-blocking pop is not.
//
// Threads and processes: the kernel serialises every send and receive, so
// any number of producers and consumers may share a queue; each task goes to
// exactly one consumer. The library keeps no state here. A push onto a full
// queue and a blocking pop hold up the calling thread; a non-blocking pop
// waits one second after each empty attempt.
#ifndef QUVAIDX_TASK_QUEUE_H_
#define QUVAIDX_TASK_QUEUE_H_

#include <json/json.h>

#include "quvaidx/export.h"

// Creates a fresh, empty queue for (path, project), discarding any queue an
// earlier run left under the same key with all its tasks, and sets its byte
// limit to size_kib * 1024 when the system allows it (a size of 0 or less
// keeps the system's default).
// Returns the queue identifier, or -1 when path does not exist or the queue
// cannot be created (an old queue may already be gone by then).
QUVAIDX_API int CreateMessageQueue(const char* path, int project, int size_kib);

// Opens the existing queue for (path, project).
// Returns its identifier, or -1 when there is none or access is denied.
QUVAIDX_API int GetMessageQueue(const char* path, int project);

// Removes the queue for (path, project) if there is one.
// Returns 0, also when there was no queue; -1 only when path does not exist.
QUVAIDX_API int DeleteMessageQueue(const char* path, int project);

// Returns the number of tasks now in queue `id`, or -1 when the queue's
// status cannot be read (an invalid identifier, a removed queue).
QUVAIDX_API int GetNumOfMessageInQueue(int id);

// Sends `task` (a copy; the caller's value is not touched) with message type
// `type`, which must be greater than 0. Waits while the queue is full.
// Returns 0 when the task is on the queue, -1 when its text is 8192 bytes or
// longer (nothing sent) or the system refused it.
QUVAIDX_API int PushTaskToQueue(int id, Json::Value task, int type);

// Takes one task of `type` off queue `id` and parses it into `out`, which is
// not cleared first. With `block`, waits for a task and ignores `attempts`.
// Without it, makes up to `attempts` non-waiting tries, sleeping one second
// after each empty one (the last included); attempts <= 0 fails at once.
// Returns 0 when a task left the queue, even one whose text is not JSON
// (`out` then holds what the parser left); -1 when no task came within the
// attempts (not logged) or the receive failed, for example interrupted or
// the queue removed (logged).
QUVAIDX_API int PopTaskFromQueue(int id, int type, bool block, int attempts,
                                 Json::Value& out);

#endif  // QUVAIDX_TASK_QUEUE_H_
