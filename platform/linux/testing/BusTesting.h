// SPDX-License-Identifier: MIT
// Test-only hooks into the host backend. Never linked into the tool.
#pragma once

#include <thread>

#include "detail/CallBounds.h"

namespace halvex::bus {

// Runs the platform's run loop on a thread of its own for this object's lifetime, as the tool's
// main thread does. Destroying it stops the loop: every call still pending completes with
// kResultConnectionLost and the connection is closed.
class RunLoopThreadForTesting {
 public:
  RunLoopThreadForTesting();
  ~RunLoopThreadForTesting();
  RunLoopThreadForTesting(const RunLoopThreadForTesting&) = delete;
  RunLoopThreadForTesting& operator=(const RunLoopThreadForTesting&) = delete;

 private:
  std::thread thread_;
};

// Replaces the call bounds for this object's lifetime. Create it before anything uses the bus.
class ScopedCallBoundsForTesting {
 public:
  explicit ScopedCallBoundsForTesting(const CallBounds& bounds);
  ~ScopedCallBoundsForTesting();
  ScopedCallBoundsForTesting(const ScopedCallBoundsForTesting&) = delete;
  ScopedCallBoundsForTesting& operator=(const ScopedCallBoundsForTesting&) = delete;

 private:
  CallBounds saved_;
};

}  // namespace halvex::bus
