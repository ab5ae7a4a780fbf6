// SPDX-License-Identifier: MIT
// A reference-counted completion group. Portable code: standard library only.
//
// A group counts outstanding work: enter() adds one, leave() takes one away, and wait() blocks
// until the count is zero. Copies refer to the same group, and every operation may be called
// from any thread. A leave() without a matching enter() is a programming error: it is reported
// on standard error and the process aborts, because a group whose count went negative would
// release a waiter while work is still running.
#pragma once

#include <chrono>
#include <memory>

namespace halvex {

class TaskGroup {
 public:
  // A new, empty group.
  TaskGroup();

  void enter() const;
  void leave() const;

  // Blocks until every enter has been matched by a leave. Returns at once on an empty group.
  void wait() const;

  // As wait(), but gives up after timeout. True when the group became empty in time.
  bool waitFor(std::chrono::milliseconds timeout) const;

  // True when both handles refer to the same group.
  friend bool operator==(const TaskGroup& a, const TaskGroup& b) { return a.state_ == b.state_; }

 private:
  struct State;
  std::shared_ptr<State> state_;
};

// One membership of a group, tied to an object's lifetime: constructing or copying a hold enters
// the group, destroying it leaves. A moved-from hold is empty and leaves nothing. Capture one in
// a completion so that every copy the framework makes keeps the group busy until it is dropped.
class TaskGroupHold {
 public:
  TaskGroupHold() = default;
  explicit TaskGroupHold(TaskGroup group);
  TaskGroupHold(const TaskGroupHold& other);
  TaskGroupHold(TaskGroupHold&& other) noexcept;
  TaskGroupHold& operator=(TaskGroupHold other) noexcept;
  ~TaskGroupHold();

  bool holds() const { return group_ != nullptr; }

 private:
  std::unique_ptr<TaskGroup> group_;
};

}  // namespace halvex
