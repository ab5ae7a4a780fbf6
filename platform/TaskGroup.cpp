// SPDX-License-Identifier: MIT
// Portable: standard library only.
#include "platform/TaskGroup.h"

#include <condition_variable>
#include <cstdio>
#include <cstdlib>

#include "platform/Mutex.h"

namespace halvex {

struct TaskGroup::State {
  Mutex mutex;
  std::condition_variable drained;
  long count GUARDED_BY(mutex) = 0;
};

TaskGroup::TaskGroup() : state_(std::make_shared<State>()) {}

void TaskGroup::enter() const {
  MutexLock lock(state_->mutex);
  ++state_->count;
}

void TaskGroup::leave() const {
  // Kept alive past the unlock: a waiter that wakes may destroy the group at once, and this handle
  // may be nothing but a reference to the waiter's own.
  const std::shared_ptr<State> state = state_;
  {
    MutexLock lock(state->mutex);
    if (state->count == 0) {
      std::fputs("TaskGroup: leave() without a matching enter()\n", stderr);
      std::abort();
    }
    if (--state->count != 0) {
      return;
    }
  }
  // After the unlock, so that the waiter does not wake into a lock still held.
  state->drained.notify_all();
}

void TaskGroup::wait() const {
  MutexLock lock(state_->mutex);
  while (state_->count != 0) {
    lock.wait(state_->drained);
  }
}

bool TaskGroup::waitFor(std::chrono::milliseconds timeout) const {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  MutexLock lock(state_->mutex);
  while (state_->count != 0) {
    if (!lock.waitUntil(state_->drained, deadline)) {
      return state_->count == 0;
    }
  }
  return true;
}

TaskGroupHold::TaskGroupHold(TaskGroup group) : group_(std::make_unique<TaskGroup>(group)) {
  group_->enter();
}

TaskGroupHold::TaskGroupHold(const TaskGroupHold& other) {
  if (other.group_) {
    group_ = std::make_unique<TaskGroup>(*other.group_);
    group_->enter();
  }
}

TaskGroupHold::TaskGroupHold(TaskGroupHold&& other) noexcept : group_(std::move(other.group_)) {}

TaskGroupHold& TaskGroupHold::operator=(TaskGroupHold other) noexcept {
  std::swap(group_, other.group_);
  return *this;
}

TaskGroupHold::~TaskGroupHold() {
  if (group_) {
    group_->leave();
  }
}

}  // namespace halvex
