// SPDX-License-Identifier: MIT
#include "platform/linux/testing/BusTesting.h"

#include <future>

#include "detail/ProcessBus.h"

namespace halvex::bus {

// Defined next to the bounds themselves; declared only here, for tests.
CallBounds& callBoundsForTesting();

RunLoopThreadForTesting::RunLoopThreadForTesting() {
  // The loop must have claimed the bus before the constructor returns, or work posted right
  // after would run directly on the posting thread instead of on the loop.
  std::promise<void> claimed;
  std::future<void> ready = claimed.get_future();
  thread_ =
      std::thread([&claimed] { ProcessBus::instance().run([&claimed] { claimed.set_value(); }); });
  ready.wait();
}

RunLoopThreadForTesting::~RunLoopThreadForTesting() {
  ProcessBus::instance().stop();
  thread_.join();
}

ScopedCallBoundsForTesting::ScopedCallBoundsForTesting(const CallBounds& bounds)
    : saved_(callBoundsForTesting()) {
  callBoundsForTesting() = bounds;
}

ScopedCallBoundsForTesting::~ScopedCallBoundsForTesting() {
  callBoundsForTesting() = saved_;
}

}  // namespace halvex::bus
