// SPDX-License-Identifier: MIT
#include "detail/Wakeup.h"

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace halvex::bus {

void Wakeup::set() {
  // Only a waiter that went to sleep needs the kernel to wake it.
  if (state_.exchange(kSet, std::memory_order_release) == kWaiting) {
    syscall(SYS_futex, &state_, FUTEX_WAKE_PRIVATE, 1, nullptr, nullptr, 0);
  }
}

void Wakeup::wait() {
  int expected = kUnset;
  if (!state_.compare_exchange_strong(expected, kWaiting, std::memory_order_acquire)) {
    return;
  }
  // The kernel sleeps only while the word still says kWaiting, so a set() between the exchange
  // and the sleep is not missed; a spurious return just looks again.
  while (state_.load(std::memory_order_acquire) == kWaiting) {
    syscall(SYS_futex, &state_, FUTEX_WAIT_PRIVATE, kWaiting, nullptr, nullptr, 0);
  }
}

}  // namespace halvex::bus
