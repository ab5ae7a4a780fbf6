// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <atomic>
#include <optional>
#include <thread>
#include <vector>

#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"

namespace halvex {
namespace {

using namespace std::chrono_literals;

TEST(WorkQueueTest, RunsClosuresOneAtATimeInPostingOrder) {
  WorkQueue queue = WorkQueue::create("test.order");
  EXPECT_EQ(queue.label(), "test.order");
  constexpr int kCount = 2000;
  std::vector<int> seen;  // touched only on the queue
  std::atomic<int> running{0};
  std::atomic<bool> overlapped{false};
  TaskGroup done;
  done.enter();
  for (int i = 0; i < kCount; ++i) {
    queue.post([&, i] {
      if (running.fetch_add(1) != 0) {
        overlapped = true;
      }
      seen.push_back(i);
      running.fetch_sub(1);
      if (i == kCount - 1) {
        done.leave();
      }
    });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_FALSE(overlapped.load());
  ASSERT_EQ(seen.size(), static_cast<size_t>(kCount));
  for (int i = 0; i < kCount; ++i) {
    ASSERT_EQ(seen[static_cast<size_t>(i)], i);
  }
}

TEST(WorkQueueTest, PostsFromManyThreadsKeepEachThreadsOrder) {
  WorkQueue queue = WorkQueue::create("test.threads");
  constexpr int kThreads = 4;
  constexpr int kEach = 500;
  std::vector<std::vector<int>> perThread(kThreads);  // touched only on the queue
  TaskGroup done;
  std::vector<std::thread> posters;
  for (int t = 0; t < kThreads; ++t) {
    posters.emplace_back([&, t] {
      for (int i = 0; i < kEach; ++i) {
        TaskGroupHold hold(done);
        queue.post([&, t, i, hold] { perThread[static_cast<size_t>(t)].push_back(i); });
      }
    });
  }
  for (auto& poster : posters) {
    poster.join();
  }
  ASSERT_TRUE(done.waitFor(10s));
  for (const auto& values : perThread) {
    ASSERT_EQ(values.size(), static_cast<size_t>(kEach));
    for (int i = 0; i < kEach; ++i) {
      ASSERT_EQ(values[static_cast<size_t>(i)], i);
    }
  }
}

TEST(WorkQueueTest, ClosuresRunOnTheQueuesOwnThread) {
  WorkQueue queue = WorkQueue::create("test.thread");
  EXPECT_FALSE(queue.isCurrent());
  std::atomic<bool> onQueue{false};
  std::atomic<bool> sameThreadTwice{false};
  TaskGroup done;
  done.enter();
  std::thread::id first;
  queue.post([&] {
    first = std::this_thread::get_id();
    onQueue = queue.isCurrent();
  });
  queue.post([&] {
    sameThreadTwice = first == std::this_thread::get_id();
    done.leave();
  });
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_TRUE(onQueue.load());
  EXPECT_TRUE(sameThreadTwice.load());
}

TEST(WorkQueueTest, DroppingTheLastHandleStillRunsQueuedWork) {
  std::atomic<int> ran{0};
  {
    WorkQueue queue = WorkQueue::create("test.drain");
    TaskGroup gate;
    gate.enter();
    // The first closure blocks until the handle is about to go, so the rest is still queued.
    queue.post([gate] { gate.wait(); });
    for (int i = 0; i < 100; ++i) {
      queue.post([&] { ran.fetch_add(1); });
    }
    gate.leave();
  }
  // Dropping the last handle on another thread waited for the queue to drain.
  EXPECT_EQ(ran.load(), 100);
}

TEST(WorkQueueTest, LastHandleDroppedOnItsOwnThreadFinishesTheRest) {
  std::atomic<int> ran{0};
  TaskGroup done;
  done.enter();
  {
    auto holder = std::make_shared<std::optional<WorkQueue>>(WorkQueue::create("test.self"));
    WorkQueue queue = **holder;
    queue.post([holder] { holder->reset(); });  // drops the last handle on the queue itself
    for (int i = 0; i < 10; ++i) {
      queue.post([&] { ran.fetch_add(1); });
    }
    queue.post([done] { done.leave(); });
  }
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_EQ(ran.load(), 10);
}

TEST(WorkQueueTest, ClosuresMayPostToTheirOwnQueue) {
  WorkQueue queue = WorkQueue::create("test.repost");
  std::vector<int> order;  // touched only on the queue
  TaskGroup done;
  done.enter();
  queue.post([&] {
    order.push_back(1);
    queue.post([&] {
      order.push_back(3);
      done.leave();
    });
    order.push_back(2);
  });
  ASSERT_TRUE(done.waitFor(10s));
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

}  // namespace
}  // namespace halvex
