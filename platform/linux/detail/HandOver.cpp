// SPDX-License-Identifier: MIT
#include "detail/HandOver.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <utility>

namespace halvex::bus {

namespace {

// True on the thread that is the I/O context right now. Work it posts runs at once, and it must
// not wait for itself.
thread_local bool tIoContext = false;
// True while this thread borrows the connection: sd-bus is its to use, sd-event is not.
thread_local bool tBorrowed = false;
thread_local bool tBorrowAbandoned = false;

class IoScope {
 public:
  IoScope() { tIoContext = true; }
  ~IoScope() { tIoContext = false; }
  IoScope(const IoScope&) = delete;
  IoScope& operator=(const IoScope&) = delete;
};

}  // namespace

HandOver::HandOver(Keeper& keeper)
    : keeper_(keeper),
      wakeFd_(eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)),
      wakeFdError_(wakeFd_ < 0 ? errno : 0) {}

HandOver::~HandOver() {
  if (wakeFd_ >= 0) {
    ::close(wakeFd_);
  }
}

void HandOver::Turn::lock() {
  tryLockUntil(Deadline::max());
}

bool HandOver::Turn::tryLock() {
  MutexLock lock(mutex_);
  return !std::exchange(held_, true);
}

bool HandOver::Turn::tryLockUntil(Deadline by) {
  MutexLock lock(mutex_);
  while (held_) {
    if (!lock.waitUntil(free_, by) && held_) {
      return false;
    }
  }
  held_ = true;
  return true;
}

void HandOver::Turn::unlock() {
  {
    MutexLock lock(mutex_);
    held_ = false;
  }
  free_.notify_one();
}

bool HandOver::inIoContext() {
  return tIoContext;
}

bool HandOver::borrowing() {
  return tBorrowed;
}

void HandOver::abandonBorrow() {
  tBorrowAbandoned = true;
}

bool HandOver::post(Task task, Deadline by) {
  if (tIoContext) {
    task();
    return true;
  }
  for (;;) {
    if (enqueue(task)) {
      return true;
    }
    Hold io(ioTurn_, std::defer_lock);
    if (!io.tryLockUntil(by)) {
      return false;
    }
    // A loop may have claimed the connection between the two looks; then it takes the work.
    if (!claimed_) {
      runHere(task);
      io.unlock();
      keeper_.flushLog();
      return true;
    }
  }
}

bool HandOver::runDirectly(const Task& task) {
  {
    MutexLock lock(inboxMutex_);
    if (inboxOpen_) {
      return false;
    }
  }
  Hold io(ioTurn_);
  if (claimed_) {
    return false;
  }
  runHere(task);
  io.unlock();
  keeper_.flushLog();
  return true;
}

void HandOver::runHere(const Task& task) {
  IoScope scope;
  task();
  keeper_.serveDirectly();
}

bool HandOver::send(Task task, Deadline by) {
  return borrow(task) || post(std::move(task), by);
}

bool HandOver::borrow(const Task& task) {
  bool wakeLoop = false;
  {
    // A loop that is awake holds the lock: the work is then queued for it rather than waiting
    // here for it to finish what it does.
    Hold io(ioTurn_, std::defer_lock);
    if (!io.tryLock() || !claimed_ || !keeper_.lendable()) {
      return false;
    }
    IoScope scope;
    tBorrowed = true;
    task();
    tBorrowed = false;
    if (std::exchange(tBorrowAbandoned, false)) {
      return false;
    }
    wakeLoop = keeper_.wakeAfterLending();
  }
  keeper_.flushLog();
  if (wakeLoop) {
    wake();
  }
  return true;
}

bool HandOver::enqueue(Task& task) {
  bool wasEmpty = false;
  {
    MutexLock lock(inboxMutex_);
    if (!inboxOpen_) {
      return false;
    }
    wasEmpty = inbox_.empty();
    inbox_.push_back(std::move(task));
  }
  // One wake-up per batch: the loop drains the whole inbox when it wakes.
  if (wasEmpty) {
    wake();
  }
  return true;
}

void HandOver::wake() {
  std::uint64_t one = 1;
  // Cannot fail short of a full counter, which a drained inbox never leaves behind.
  [[maybe_unused]] ssize_t written = write(wakeFd_, &one, sizeof one);
}

bool HandOver::claim() {
  ioTurn_.lock();
  if (claimed_) {
    ioTurn_.unlock();
    return false;
  }
  claimed_ = true;
  tIoContext = true;
  return true;
}

void HandOver::open() {
  MutexLock lock(inboxMutex_);
  inboxOpen_ = true;
}

int HandOver::sleep(const std::function<int()>& wait) {
  ioTurn_.unlock();
  keeper_.flushLog();
  const int r = wait();
  ioTurn_.lock();
  return r;
}

void HandOver::drain() {
  std::uint64_t count = 0;
  [[maybe_unused]] ssize_t got = read(wakeFd_, &count, sizeof count);
  std::deque<Task> batch;
  {
    MutexLock lock(inboxMutex_);
    batch.swap(inbox_);
  }
  for (Task& task : batch) {
    task();
    // Released at once, not with the batch: what a task holds may have to go before the next
    // task runs (a manager's shutdown hands back its last reference this way).
    task = nullptr;
  }
}

void HandOver::close() {
  MutexLock lock(inboxMutex_);
  inboxOpen_ = false;
}

void HandOver::release() {
  claimed_ = false;
  tIoContext = false;
  ioTurn_.unlock();
  keeper_.flushLog();
}

}  // namespace halvex::bus
