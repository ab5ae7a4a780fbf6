// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <atomic>
#include <numeric>
#include <optional>
#include <vector>

#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"

namespace halvex {
namespace {

using namespace std::chrono_literals;

TEST(WorkQueueTest, RunsClosuresOneAtATimeInPostingOrderOnItsOwnThread) {
  WorkQueue queue = WorkQueue::create("test.order");
  EXPECT_EQ(queue.label(), "test.order");
  EXPECT_FALSE(queue.isCurrent());
  constexpr int kCount = 2000;
  std::vector<int> seen;  // touched only on the queue
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false}, onQueue{true};
  TaskGroup done;
  done.enter();
  for (int i = 0; i < kCount; ++i) {
    queue.post([&, i] {
      overlapped = overlapped || running.fetch_add(1) != 0;
      onQueue = onQueue && queue.isCurrent();
      if (i == kCount - 1) {  // a closure may post to its own queue, to run after itself
        queue.post([&] {
          seen.push_back(kCount);
          done.leave();
        });
      }
      seen.push_back(i);
      running.fetch_sub(1);
    });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_FALSE(overlapped.load());
  EXPECT_TRUE(onQueue.load());
  std::vector<int> expected(kCount + 1);
  std::iota(expected.begin(), expected.end(), 0);
  EXPECT_EQ(seen, expected);
}

TEST(WorkQueueTest, DroppingTheLastHandleStillRunsQueuedWork) {
  std::atomic<int> ran{0};
  {
    WorkQueue queue = WorkQueue::create("test.drain");
    TaskGroup gate;
    gate.enter();
    // The first closure blocks until the handle is about to go, so the rest is still queued.
    queue.post([gate] { gate.wait(); });
    for (int i = 0; i < 100; ++i)
      queue.post([&] { ran.fetch_add(1); });
    gate.leave();
  }
  // Dropping the last handle on another thread waited for the queue to drain.
  EXPECT_EQ(ran.load(), 100);

  TaskGroup done;
  done.enter();
  {
    auto holder = std::make_shared<std::optional<WorkQueue>>(WorkQueue::create("test.self"));
    WorkQueue queue = **holder;
    queue.post([holder] { holder->reset(); });  // drops the last handle on the queue itself
    for (int i = 0; i < 10; ++i)
      queue.post([&] { ran.fetch_add(1); });
    queue.post([done] { done.leave(); });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_EQ(ran.load(), 110);
}

}  // namespace
}  // namespace halvex
