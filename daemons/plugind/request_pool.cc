#include "request_pool.h"

#include <signal.h>
#include <stdint.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <event2/event.h>
#include <quvaidx/daemon.h>

namespace plugind {
namespace {

void Signal(int fd) {
  const uint64_t one = 1;
  // An eventfd counter only fails to grow near 2^64: it is readable anyway.
  if (write(fd, &one, sizeof(one)) < 0) {
  }
}

}  // namespace

RequestPool::~RequestPool() { Stop(); }

bool RequestPool::Start(struct event_base* base, int workers, int capacity) {
  capacity_ = capacity;
  done_fd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  stop_fd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  if (done_fd_ >= 0 && stop_fd_ >= 0) {
    done_event_ = event_new(base, done_fd_, EV_READ | EV_PERSIST, OnDone, this);
  }
  if (done_event_ == nullptr || event_add(done_event_, nullptr) != 0) {
    Stop();
    return false;
  }
  // Stop signals are the loop's: the workers never take them.
  sigset_t all, previous;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &previous);
  try {
    for (int i = 0; i < workers; ++i)
      workers_.emplace_back([this] { RunWorker(); });
  } catch (...) {  // no thread could be made
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    Stop();
    return false;
  }
  pthread_sigmask(SIG_SETMASK, &previous, nullptr);
  return true;
}

void RequestPool::Submit(DeferredReply* deferred, Work work) {
  ++taken_;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    jobs_.push_back(Job{deferred, std::move(work)});
  }
  wake_.notify_one();
}

void RequestPool::RunWorker() {
  for (;;) {
    Job job;
    {
      std::unique_lock<std::mutex> lock(mutex_);
      wake_.wait(lock, [this] { return stopping_ || !jobs_.empty(); });
      if (stopping_) return;
      job = std::move(jobs_.front());
      jobs_.pop_front();
    }
    Json::Value reply;
    try {
      reply = job.work();
    } catch (...) {  // out of memory: answer all the same
      reply = MakeResponse(false, "internal error");
    }
    {
      std::lock_guard<std::mutex> lock(mutex_);
      done_.push_back(Done{job.deferred, std::move(reply)});
    }
    Signal(done_fd_);
  }
}

void RequestPool::OnDone(int, short, void* pool) {
  static_cast<RequestPool*>(pool)->SendDone();
}

void RequestPool::SendDone() {
  uint64_t count;
  while (read(done_fd_, &count, sizeof(count)) > 0) {
  }
  std::vector<Done> done;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    done.swap(done_);
  }
  for (Done& reply : done) {
    --taken_;
    // A connection that closed meanwhile makes this a no-op.
    SendDeferredReply(reply.deferred, &reply.reply);
  }
}

void RequestPool::Stop() {
  if (stop_fd_ >= 0) Signal(stop_fd_);
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  for (std::thread& worker : workers_) worker.join();
  workers_.clear();
  // What was not answered is dropped; the handles go with their
  // connections.
  for (Job& job : jobs_) SendDeferredReply(job.deferred, nullptr);
  jobs_.clear();
  for (Done& reply : done_) SendDeferredReply(reply.deferred, nullptr);
  done_.clear();
  taken_ = 0;
  if (done_event_ != nullptr) event_free(done_event_);
  done_event_ = nullptr;
  for (int* fd : {&done_fd_, &stop_fd_}) {
    if (*fd >= 0) close(*fd);
    *fd = -1;
  }
}

}  // namespace plugind
