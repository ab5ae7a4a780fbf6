// SPDX-License-Identifier: MIT
// Portable: standard library only, apart from naming the thread where the C library can.
#include "platform/WorkQueue.h"

#include <pthread.h>

#include <condition_variable>
#include <deque>
#include <thread>

#include "platform/Mutex.h"

namespace halvex {

namespace {

// Shared by the handles' Impl and the worker thread, so that a worker whose Impl is gone can
// still drain what was posted.
struct Shared {
  Mutex mutex;
  std::condition_variable ready;
  std::deque<WorkQueue::Closure> pending GUARDED_BY(mutex);
  bool closed GUARDED_BY(mutex) = false;
};

void drain(const std::shared_ptr<Shared>& shared) {
  for (;;) {
    WorkQueue::Closure next;
    {
      MutexLock lock(shared->mutex);
      while (!shared->closed && shared->pending.empty()) {
        lock.wait(shared->ready);
      }
      if (shared->pending.empty()) {
        return;
      }
      next = std::move(shared->pending.front());
      shared->pending.pop_front();
    }
    next();
  }
}

}  // namespace

class WorkQueue::Impl {
 public:
  explicit Impl(std::string label) : label_(std::move(label)), shared_(std::make_shared<Shared>()) {
    thread_ = std::thread([shared = shared_, name = label_.substr(0, 15)] {
      pthread_setname_np(pthread_self(), name.c_str());
      drain(shared);
    });
  }

  ~Impl() {
    {
      MutexLock lock(shared_->mutex);
      shared_->closed = true;
    }
    shared_->ready.notify_one();
    if (std::this_thread::get_id() == thread_.get_id()) {
      thread_.detach();
    } else {
      thread_.join();
    }
  }

  Impl(const Impl&) = delete;
  Impl& operator=(const Impl&) = delete;

  const std::string& label() const { return label_; }

  void post(Closure closure) {
    if (!closure) {
      return;
    }
    {
      MutexLock lock(shared_->mutex);
      shared_->pending.push_back(std::move(closure));
    }
    shared_->ready.notify_one();
  }

  bool isCurrent() const { return std::this_thread::get_id() == thread_.get_id(); }

 private:
  std::string label_;
  std::shared_ptr<Shared> shared_;
  std::thread thread_;
};

WorkQueue WorkQueue::create(std::string label) {
  return WorkQueue(std::make_shared<Impl>(std::move(label)));
}

const std::string& WorkQueue::label() const {
  return impl_->label();
}

void WorkQueue::post(Closure closure) const {
  impl_->post(std::move(closure));
}

bool WorkQueue::isCurrent() const {
  return impl_->isCurrent();
}

}  // namespace halvex
