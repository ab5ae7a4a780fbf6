// SPDX-License-Identifier: MIT
// A one-shot signal between two threads: one waits, the other sets it once. The waiter sleeps in
// the kernel until then, without spinning, and a signal set before the wait costs no system call
// on either side. Either side may go first; the object must outlive both calls.
// Not std::atomic::wait: libstdc++ spins and yields the processor before it sleeps, which is
// the busy hand-off this replaces.
#pragma once

#include <atomic>

#include "detail/Private.h"

namespace halvex::bus {

class Wakeup {
 public:
  void set();
  // Returns once set() has been called, at once if it already has.
  void wait();
  bool isSet() const { return state_.load(std::memory_order_acquire) == kSet; }

 private:
  static constexpr int kUnset = 0;
  static constexpr int kWaiting = 1;
  static constexpr int kSet = 2;
  std::atomic<int> state_{kUnset};
};

}  // namespace halvex::bus
