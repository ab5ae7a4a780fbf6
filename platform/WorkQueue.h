// SPDX-License-Identifier: MIT
// A serial work queue. Portable code: standard library only.
//
// A WorkQueue runs the closures posted to it one at a time, in the order they were posted, on a
// thread of its own. Handles are cheap to copy and share ownership of the one queue; post() may
// be called from any thread, including from a closure running on the queue.
//
// Lifetime: when the last handle goes, the queue stops taking work but still runs everything that
// was posted before, in order. Dropping the last handle on any other thread waits for that work
// to finish; dropping it on the queue's own thread (a closure that held the last handle) cannot
// wait for itself, so the queue's thread then finishes the remaining work and ends on its own.
#pragma once

#include <functional>
#include <memory>
#include <string>

namespace halvex {

class WorkQueue {
 public:
  using Closure = std::function<void()>;

  // Starts a queue and its thread. The label names the thread for debuggers (first 15 bytes).
  static WorkQueue create(std::string label);

  const std::string& label() const;

  // Appends closure to the queue. An empty closure is ignored.
  void post(Closure closure) const;

  // True when called from a closure running on this queue.
  bool isCurrent() const;

  friend bool operator==(const WorkQueue& a, const WorkQueue& b) { return a.impl_ == b.impl_; }

 private:
  class Impl;
  explicit WorkQueue(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}
  std::shared_ptr<Impl> impl_;
};

}  // namespace halvex
