// Answering requests off the event loop: a fixed number of worker threads
// take the requests whose answers may wait on files or on another daemon,
// and hand each reply back to the loop, which sends it as the deferred
// reply of its request (DeferReply and SendDeferredReply in
// quvaidx/daemon.h). The loop meanwhile answers everyone else.
//
// Bounds: `workers` threads; at most `capacity` requests taken at once
// (running, waiting for a worker, or with their reply not yet sent); the
// caller refuses more (HasRoom). Each request's own work bounds its time
// (the media parser's timeout, for one).
//
// Threads: Start, HasRoom, Submit and Stop run on the loop's thread; the
// work runs on the workers.
#ifndef QUVAIDX_DAEMONS_PLUGIND_REQUEST_POOL_H_
#define QUVAIDX_DAEMONS_PLUGIND_REQUEST_POOL_H_

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include <json/json.h>

struct event;
struct event_base;
struct DeferredReply;

namespace plugind {

class RequestPool {
 public:
  // What a worker does for one request: the reply to send.
  using Work = std::function<Json::Value()>;

  RequestPool() = default;
  ~RequestPool();  // Stop()
  RequestPool(const RequestPool&) = delete;
  RequestPool& operator=(const RequestPool&) = delete;

  // Starts `workers` threads taking at most `capacity` requests at once;
  // replies are sent from an event on `base`. Returns false, with nothing
  // left running, when the threads or the event cannot be made.
  bool Start(struct event_base* base, int workers, int capacity);

  // True when another request may be submitted.
  bool HasRoom() const { return taken_ < capacity_; }
  // Requests taken and not yet answered.
  int taken() const { return taken_; }

  // Has `work` done on a worker; its result is sent on the loop as the
  // reply of `deferred`. REQUIRES: HasRoom().
  void Submit(DeferredReply* deferred, Work work);

  // Readable from the moment Stop begins, so that work waiting on another
  // daemon gives up at once; -1 before Start.
  int stop_fd() const { return stop_fd_; }

  // Stops the workers (each ends the request it runs, its waits cut short)
  // and joins them; requests not answered are dropped, their connections
  // ended. Further calls do nothing.
  void Stop();

 private:
  struct Job {
    DeferredReply* deferred;
    Work work;
  };
  struct Done {
    DeferredReply* deferred;
    Json::Value reply;
  };

  void RunWorker();
  // On the loop: sends the replies the workers have finished.
  static void OnDone(int fd, short events, void* pool);
  void SendDone();

  int capacity_ = 0;
  int taken_ = 0;     // loop thread only
  int done_fd_ = -1;  // eventfd: a worker finished a request
  int stop_fd_ = -1;  // eventfd: readable once stopping
  struct event* done_event_ = nullptr;
  std::vector<std::thread> workers_;

  std::mutex mutex_;  // guards the members below
  std::condition_variable wake_;
  std::deque<Job> jobs_;
  std::vector<Done> done_;
  bool stopping_ = false;
};

}  // namespace plugind

#endif  // QUVAIDX_DAEMONS_PLUGIND_REQUEST_POOL_H_
